// An event as it goes into a queue file.
#ifndef WATCH_QUEUE_LINE_H_
#define WATCH_QUEUE_LINE_H_

#include <cstdint>
#include <string>

namespace vexlo::watch {

// The bits of a queue line's "event" that a watcher reports, one at a time. They are the queue's
// own numbers, not the kernel's. Stored in queue files: never renumber.
enum QueueMask : uint32_t {
  kMaskAttrib = 0x4,
  kMaskCloseWrite = 0x8,
  kMaskCreate = 0x40,
  kMaskDelete = 0x80,
  kMaskRename = 0x100,
  kMaskCrashed = 0x200,
  kMaskReindex = 0x10000,
};

struct QueueEvent {
  uint32_t mask = 0;  // Exactly one bit of QueueMask.
  bool is_dir = false;
  std::string path;      // Full path, bytes in any encoding. For kMaskRename, the path after it.
  std::string path_old;  // For kMaskRename, the path before it and never empty; else empty.
};

// The event as one line of a queue file, newline included:
//   {"event":8,"is_dir":false,"path":"/volume1/s/a","path_old":"","data":null}
// Quotes, backslashes and control characters are escaped; all other bytes, valid UTF-8 or not,
// stand as they are, so that a reader gets the very bytes of the name.
std::string QueueLine(const QueueEvent& event);

}  // namespace vexlo::watch

#endif  // WATCH_QUEUE_LINE_H_
