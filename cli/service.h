// What commands share that change the service's state or ask its daemons.
#ifndef CLI_SERVICE_H_
#define CLI_SERVICE_H_

#include <json/value.h>

#include <string>
#include <vector>

namespace vexlo::cli {

// Whether somebody takes connections on the Unix socket at `path`.
bool IsListening(const std::string& path);
bool IsIndexDaemonRunning();

// The daemons of the local stack, in the order in which they are started.
struct DaemonPlace {
  const char* name;
  std::string socket;
};
std::vector<DaemonPlace> LocalDaemons();

// What the daemon behind a socket answers to "stats", null when it does not (see AskDaemon).
Json::Value AskStats(const std::string& socket);

// The index daemon's "shares", an array.
Json::Value AskShares();

// "the index daemon fileindexd does not run (nobody answers on '...')".
std::string NoIndexDaemon();

}  // namespace vexlo::cli

#endif  // CLI_SERVICE_H_
