// The service's state as metrics, in the text format of Prometheus.
#ifndef CLI_METRICS_H_
#define CLI_METRICS_H_

#include <json/value.h>

#include <string>

namespace vexlo::cli {

// What waits in a share's queue and its snapshot.
struct Backlog {
  uint64_t lines = 0;
  uint64_t bytes = 0;
  // Since the first line that waits was appended, in seconds; 0 when none does.
  double age = 0;
};

// Reads the files. What is not there counts nothing.
Backlog BacklogOf(const std::string& queue_path);

// `state` is AskWholeStack()'s; "backlog" of a share, {"lines","bytes","age"}, is shown where it is
// there.
std::string MetricsText(const Json::Value& state);

}  // namespace vexlo::cli

#endif  // CLI_METRICS_H_
