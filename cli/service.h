// What commands share that change the service's state or ask its daemons.
#ifndef CLI_SERVICE_H_
#define CLI_SERVICE_H_

#include <json/value.h>

#include <string>
#include <vector>

namespace vexlo::cli {

// What comes of a connection to a Unix socket: somebody takes it, there is nobody, or this user may
// not try, and so cannot know.
enum class Reach { kListening, kNobody, kClosed };
Reach ReachOf(const std::string& socket);

bool IsListening(const std::string& socket);
bool IsIndexDaemonListening();

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

// "DAEMON does not run (nobody answers on 'SOCKET')", or that the socket is closed to this user.
std::string WhyUnreached(const std::string& daemon, const std::string& socket);
// The same of the index daemon.
std::string NoIndexDaemon();

}  // namespace vexlo::cli

#endif  // CLI_SERVICE_H_
