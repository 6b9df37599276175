// What daemons tell of themselves.
#ifndef CLI_DAEMON_STATS_H_
#define CLI_DAEMON_STATS_H_

#include <json/value.h>

#include <optional>
#include <string>

namespace vexlo::cli {

// Sends a request to the daemon on the Unix socket at `path` and gives its reply, an object. None
// when nobody listens, or there is no such reply within a few seconds; `reason` says which, for
// people: "nobody answers on '...'".
std::optional<Json::Value> AskDaemon(const std::string& path, const std::string& request,
                                     std::string* reason = nullptr);

// The index daemon's {"success":true,"shares":[...]}; none when it does not answer.
std::optional<Json::Value> IndexDaemonStats(std::string* reason = nullptr);

}  // namespace vexlo::cli

#endif  // CLI_DAEMON_STATS_H_
