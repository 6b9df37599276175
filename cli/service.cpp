#include "cli/service.h"

#include <sys/socket.h>
#include <sys/un.h>
#include <cerrno>

#include "cli/daemon_stats.h"
#include "fileindex/paths.h"
#include "kavo/local/content.h"
#include "kavo/local/shares.h"
#include "watch/directory.h"

namespace vexlo::cli {

Reach ReachOf(const std::string& socket) {
  sockaddr_un address{AF_UNIX, {}};
  if (socket.size() >= sizeof(address.sun_path)) {
    return Reach::kNobody;
  }
  const watch::Fd fd(::socket(AF_UNIX, SOCK_STREAM | SOCK_CLOEXEC | SOCK_NONBLOCK, 0));
  socket.copy(address.sun_path, sizeof(address.sun_path) - 1);
  // A queue of connections that is full is somebody's, too.
  return connect(fd.Get(), reinterpret_cast<const sockaddr*>(&address), sizeof(address)) == 0 ||
                 errno == EAGAIN
             ? Reach::kListening
         : errno == EACCES ? Reach::kClosed
                           : Reach::kNobody;
}

bool IsListening(const std::string& socket) { return ReachOf(socket) == Reach::kListening; }

std::vector<DaemonPlace> LocalDaemons() {
  return {{"kavoelasticd", fileindex::kElasticdSocketPath.Get()},
          {"kavocontentextractd", kavo::local::ContentSocket()},
          {"fileindexd", fileindex::kFileIndexDaemonSocketPath.Get()},
          {"evnotifyd", kavo::local::Root() + "/var/run/evnotifyd.sock"}};
}

Json::Value AskStats(const std::string& socket) {
  // The daemons name what they are asked differently; each passes over what it does not know.
  return AskDaemon(socket, R"({"command":"stats","type":"stats","data":null})")
      .value_or(Json::Value());
}

Json::Value AskShares() {
  const Json::Value stats = AskStats(fileindex::kFileIndexDaemonSocketPath.Get());
  const Json::Value& shares = stats["shares"];
  return shares.isArray() ? shares : Json::Value(Json::arrayValue);
}

bool IsIndexDaemonListening() { return IsListening(fileindex::kFileIndexDaemonSocketPath.Get()); }

std::string WhyUnreached(const std::string& daemon, const std::string& socket) {
  return ReachOf(socket) == Reach::kClosed
             ? daemon + " cannot be asked: its socket '" + socket + "' is closed to this user"
             : daemon + " does not run (nobody answers on '" + socket + "')";
}

std::string NoIndexDaemon() {
  return WhyUnreached("the index daemon fileindexd", fileindex::kFileIndexDaemonSocketPath.Get());
}

}  // namespace vexlo::cli
