#include "kavo/filesystem.h"

#include <fcntl.h>
#include <sys/stat.h>

#include <cerrno>
#include <new>
#include <string>

int KAVOFSDirIsMntPoint(const char* path) {
  struct statx info {};
  if (statx(AT_FDCWD, path, AT_SYMLINK_NOFOLLOW | AT_NO_AUTOMOUNT, STATX_TYPE | STATX_INO, &info) !=
      0) {
    return -1;
  }
  if (!S_ISDIR(info.stx_mode)) {
    return 0;
  }
  if ((info.stx_attributes_mask & STATX_ATTR_MOUNT_ROOT) != 0) {
    return (info.stx_attributes & STATX_ATTR_MOUNT_ROOT) != 0 ? 1 : 0;
  }
  // Kernels before 5.8. They do not show a bind mount of a folder of the same file system.
  try {
    struct stat self {};
    struct stat parent {};
    if (lstat(path, &self) != 0 || lstat((std::string(path) + "/..").c_str(), &parent) != 0) {
      return -1;
    }
    return self.st_dev != parent.st_dev || self.st_ino == parent.st_ino ? 1 : 0;
  } catch (const std::bad_alloc&) {
    errno = ENOMEM;
    return -1;
  }
}
