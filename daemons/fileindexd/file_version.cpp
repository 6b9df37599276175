#include "daemons/fileindexd/file_version.h"

#include <sys/stat.h>

namespace vexlo::fileindexd {

std::string FileVersion(const std::string& path) {
  struct stat info {};
  if (lstat(path.c_str(), &info) != 0) {
    return "";
  }
  return std::to_string(info.st_ino) + "-" + std::to_string(info.st_ctim.tv_sec) + "." +
         std::to_string(info.st_ctim.tv_nsec);
}

}  // namespace vexlo::fileindexd
