#include "watch/queue_line.h"

#include "common/json.h"

namespace vexlo::watch {

std::string QueueLine(const QueueEvent& event) {
  std::string line;
  line.reserve(event.path.size() + event.path_old.size() + 80);
  line += "{\"event\":";
  line += std::to_string(event.mask);
  line += event.is_dir ? ",\"is_dir\":true,\"path\":" : ",\"is_dir\":false,\"path\":";
  AppendJsonText(line, event.path);
  line += ",\"path_old\":";
  AppendJsonText(line, event.path_old);
  line += ",\"data\":null}\n";
  return line;
}

}  // namespace vexlo::watch
