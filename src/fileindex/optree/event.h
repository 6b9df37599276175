// One file-system event, as a line of a share's queue file holds it.
#ifndef FILEINDEX_OPTREE_EVENT_H_
#define FILEINDEX_OPTREE_EVENT_H_

#include <json/value.h>

#include <cstddef>
#include <cstdint>
#include <string>

#include "common/export.h"

namespace vexlo::fileindex {

// Bits of an event mask. Stored in queue files: never renumber. Bits that are not here are ignored.
enum EventMask : uint32_t {
  EV_MODIFY = 0x2,
  EV_ATTRIB = 0x4,
  EV_CLOSE_WRITE = 0x8,
  EV_CREATE = 0x40,
  EV_DELETE = 0x80,
  EV_RENAME = 0x100,
  EV_QUEUE_CRASHED = 0x200,  // The notify daemon lost events: the whole share must be rebuilt.
  EV_REINDEX = 0x10000,
  EV_UPDATE_DIRECTORY = 0x20000,
};

// A longer line is malformed. A path has at most 4,095 bytes, so no true line comes near; the bound
// is what keeps a file without newlines from filling the memory.
inline constexpr size_t kMaxQueueLineBytes = size_t{4} * 1024 * 1024;

// A queue line is one JSON object:
//   {"event":8,"is_dir":false,"path":"/volume1/s/a","path_old":"","data":null}
// "event" and "path" are required; the members may stand in any order. Paths are full paths, bytes
// in any encoding.
struct VEXLO_EXPORT Event {
  // Parses one line, without its newline. Throws Error 906 when it is not JSON or too long, and 120
  // as GetJsonValue() does when it is no object or "event" or "path" is missing or mistyped; a
  // mistyped optional member keeps its default.
  explicit Event(const std::string& event_raw);

  uint32_t event = 0;    // Bits of EventMask.
  bool is_dir = false;   // Whether the path names a folder, also one that is gone by now.
  std::string path;      // For a rename, the path after it.
  std::string path_old;  // For a rename, the path before it; else empty.
  Json::Value data;      // For EV_UPDATE_DIRECTORY, flags by category; else null.
};

}  // namespace vexlo::fileindex

#endif  // FILEINDEX_OPTREE_EVENT_H_
