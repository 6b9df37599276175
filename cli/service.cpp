#include "cli/service.h"

#include <sys/socket.h>
#include <sys/un.h>
#include <unistd.h>

#include <cerrno>

#include "cli/daemon_stats.h"
#include "fileindex/paths.h"
#include "kavo/local/content.h"
#include "kavo/local/shares.h"

namespace vexlo::cli {

bool IsListening(const std::string& path) {
  sockaddr_un address{AF_UNIX, {}};
  if (path.size() >= sizeof(address.sun_path)) {
    return false;
  }
  const int fd = socket(AF_UNIX, SOCK_STREAM | SOCK_CLOEXEC | SOCK_NONBLOCK, 0);
  if (fd < 0) {
    return false;
  }
  path.copy(address.sun_path, sizeof(address.sun_path) - 1);
  // A queue of connections that is full is somebody's, too.
  const bool connected =
      connect(fd, reinterpret_cast<const sockaddr*>(&address), sizeof(address)) == 0 ||
      errno == EAGAIN;
  close(fd);
  return connected;
}

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

bool IsIndexDaemonRunning() { return IsListening(fileindex::kFileIndexDaemonSocketPath.Get()); }

std::string NoIndexDaemon() {
  return "the index daemon fileindexd does not run (nobody answers on '" +
         fileindex::kFileIndexDaemonSocketPath.Get() + "')";
}

}  // namespace vexlo::cli
