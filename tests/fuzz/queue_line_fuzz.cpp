// One queue line: what the scanner takes, the JSON reader takes, and both find the same event.
#include <optional>

#include "common/error.h"
#include "common/json.h"
#include "fileindex/optree/event.h"
#include "fileindex/optree/line_scanner.h"
#include "fuzz/target.h"

namespace {

using vexlo::fileindex::Event;
using vexlo::fileindex::EventView;

std::optional<Event> ReadJson(const std::string& line) {
  try {
    return Event(line);
  } catch (const vexlo::Error& error) {
    fuzz::Require(error.GetErrorCode() == 906 || error.GetErrorCode() == 120,
                  "a line fails with another code");
    return std::nullopt;
  }
}

std::string Show(const EventView& event) {
  Json::Value shown;
  shown["event"] = event.event;
  shown["is_dir"] = event.is_dir;
  shown["path"] = std::string(event.path);
  shown["path_old"] = std::string(event.path_old);
  shown["data"] = event.data == nullptr ? Json::Value() : *event.data;
  return vexlo::JsonToString(shown);
}

}  // namespace

extern "C" int LLVMFuzzerTestOneInput(const uint8_t* data, size_t size) {
  const std::string line(fuzz::TextOf(data, size));
  const std::optional<Event> read = ReadJson(line);
  if (EventView scanned; vexlo::fileindex::ScanLine(line, scanned)) {
    fuzz::Require(read.has_value(), "the scanner takes what the JSON reader refuses");
    fuzz::RequireEqual(Show(scanned),
                       Show({read->event, read->is_dir, read->path, read->path_old,
                             read->data.isNull() ? nullptr : &read->data}),
                       "the scanner and the JSON reader differ");
  }
  if (read) {
    const std::string shown =
        Show({read->event, read->is_dir, read->path, read->path_old, &read->data});
    const std::optional<Event> again = ReadJson(shown);
    fuzz::Require(again.has_value(), "an event as it is written cannot be read");
    fuzz::RequireEqual(
        Show({again->event, again->is_dir, again->path, again->path_old, &again->data}), shown,
        "an event is another one when it was written");
  }
  return 0;
}
