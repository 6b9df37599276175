#include "daemons/common/folders.h"

#include <fcntl.h>
#include <sys/stat.h>
#include <unistd.h>

#include <cerrno>

#include "daemons/common/unique_fd.h"

namespace vexlo::daemon {

bool MakeFolders(const std::string& path) {
  for (size_t slash = 0; slash != std::string::npos;) {
    slash = path.find('/', slash + 1);
    const std::string folder = path.substr(0, slash);
    const size_t above = folder.rfind('/');
    if (mkdir(folder.c_str(), 0755) == 0) {
      if (!SyncFolder(above == 0 ? "/" : folder.substr(0, above))) {
        return false;
      }
    } else if (errno != EEXIST) {
      return false;
    }
  }
  return true;
}

bool SyncFolder(const std::string& path) {
  const UniqueFd fd(open(path.c_str(), O_RDONLY | O_DIRECTORY | O_CLOEXEC));
  return fd.Get() >= 0 && fsync(fd.Get()) == 0;
}

}  // namespace vexlo::daemon
