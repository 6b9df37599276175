#include "fileindex/optree/event.h"

#include "common/json.h"
#include "fileindex/optree/malformed_line.h"

namespace vexlo::fileindex {

Event::Event(const std::string& event_raw) {
  if (event_raw.size() > kMaxQueueLineBytes) {
    FailMalformed(std::string_view(event_raw).substr(0, kShownOfTooLong), event_raw.size());
  }
  Json::Value value;
  if (!JsonFromString(value, event_raw)) {
    FailMalformed(event_raw, event_raw.size());
  }
  GetJsonValue(event, value, "event", /*required=*/true);
  GetJsonValue(is_dir, value, "is_dir", /*required=*/false);
  GetJsonValue(path, value, "path", /*required=*/true);
  GetJsonValue(path_old, value, "path_old", /*required=*/false);
  GetJsonValue(data, value, "data", /*required=*/false);
}

}  // namespace vexlo::fileindex
