// The fast way through a queue line. Not installed.
#ifndef FILEINDEX_OPTREE_LINE_SCANNER_H_
#define FILEINDEX_OPTREE_LINE_SCANNER_H_

#include <json/value.h>

#include <cstdint>
#include <string_view>

namespace vexlo::fileindex {

// An event whose texts stand in somebody else's memory.
struct EventView {
  uint32_t event = 0;
  bool is_dir = false;
  std::string_view path;
  std::string_view path_old;
  const Json::Value* data = nullptr;  // Null pointer: a JSON null.
};

// Reads an ordinary line: the five members in any order, each at most once and of its own type, no
// escapes in the texts, "data" null or absent, blanks only behind ":" and ",". True means that the
// JSON reader would have found exactly `event`; its texts point into `line`. False says nothing
// about the line: it is for the JSON reader to judge.
bool ScanLine(std::string_view line, EventView& event);

}  // namespace vexlo::fileindex

#endif  // FILEINDEX_OPTREE_LINE_SCANNER_H_
