#include "cli/service.h"

#include <sys/socket.h>
#include <sys/un.h>
#include <unistd.h>

#include "fileindex/paths.h"

namespace vexlo::cli {

bool IsListening(const std::string& path) {
  sockaddr_un address{AF_UNIX, {}};
  const int fd = socket(AF_UNIX, SOCK_STREAM | SOCK_CLOEXEC | SOCK_NONBLOCK, 0);
  if (fd < 0 || path.size() >= sizeof(address.sun_path)) {
    return false;
  }
  path.copy(address.sun_path, sizeof(address.sun_path) - 1);
  const bool connected =
      connect(fd, reinterpret_cast<const sockaddr*>(&address), sizeof(address)) == 0;
  close(fd);
  return connected;
}

bool IsIndexDaemonRunning() { return IsListening(fileindex::kFileIndexDaemonSocketPath.Get()); }

std::string NoIndexDaemon() {
  return "the index daemon fileindexd does not run (nobody answers on '" +
         fileindex::kFileIndexDaemonSocketPath.Get() + "')";
}

}  // namespace vexlo::cli
