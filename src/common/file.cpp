#include "common/file.h"

#include <fcntl.h>
#include <sys/stat.h>
#include <unistd.h>

#include <cerrno>
#include <climits>
#include <cstdlib>
#include <cstring>
#include <memory>
#include <string_view>

#include "common/check.h"
#include "common/error.h"
#include "common/lock.h"
#include "common/scoped_fd.h"
#include "common/sdk/mutex.h"
#include "common/string.h"
#include "kavo/acl.h"
#include "kavo/file.h"
#include "kavo/filesystem.h"
#include "kavo/user.h"

namespace vexlo {
namespace {

constexpr int kMaxLinks = 40;  // As many as the kernel follows.
constexpr size_t kReadBytes = size_t{64} * 1024;

bool IsDirAfterLinks(const std::string& path, int links_allowed) {
  struct stat info {};
  if (lstat(path.c_str(), &info) != 0) {
    return false;
  }
  if (S_ISDIR(info.st_mode)) {
    return true;
  }
  if (!S_ISLNK(info.st_mode) || links_allowed == 0) {
    return false;
  }
  char target[PATH_MAX] = {};
  const ssize_t length = readlink(path.c_str(), target, sizeof(target) - 1);
  return length >= 0 &&
         IsDirAfterLinks(std::string(target, static_cast<size_t>(length)), links_allowed - 1);
}

// Writes all of `data`; false with errno at the first failure.
bool WriteAll(int fd, std::string_view data) {
  while (!data.empty()) {
    const ssize_t written = write(fd, data.data(), data.size());
    if (written < 0) {
      if (errno == EINTR) {
        continue;
      }
      return false;
    }
    data.remove_prefix(static_cast<size_t>(written));
  }
  return true;
}

// False with errno.
bool ReadByte(int fd, off_t at, char& byte) {
  while (true) {
    const ssize_t count = pread(fd, &byte, 1, at);
    if (count >= 0 || errno != EINTR) {
      return count == 1;
    }
  }
}

std::string FolderOf(const std::string& path) {
  const size_t slash = path.rfind('/');
  if (slash == std::string::npos) {
    return ".";
  }
  return slash == 0 ? "/" : path.substr(0, slash);
}

bool SyncFolder(const std::string& folder) {
  const ScopedFd fd(open(folder.c_str(), O_RDONLY | O_DIRECTORY | O_CLOEXEC));
  // A file system that has no such thing for folders is as safe as it can be.
  return fd.IsOpen() && (fsync(fd.Get()) == 0 || errno == EINVAL);
}

// Gives the new file mode 0644 and, best effort, the owner of the file that it replaces.
bool DressLike(int fd, const std::string& path) {
  struct stat old {};
  if (lstat(path.c_str(), &old) == 0 && S_ISREG(old.st_mode)) {
    // Not permitted, or in a user namespace or on a network file system not possible.
    (void)!fchown(fd, old.st_uid, old.st_gid);
  }
  return fchmod(fd, 0644) == 0;
}

// For the holder of the file's lock. The call that failed, with errno, or nullptr.
const char* AppendUnderLock(const std::string& path, const std::string& lines) {
  ScopedFd fd(open(path.c_str(), O_RDWR | O_APPEND | O_CREAT | O_CLOEXEC | O_NOFOLLOW, 0644));
  struct stat info {};
  if (!fd.IsOpen() || fstat(fd.Get(), &info) != 0) {
    return "open";
  }
  char last = '\n';
  if (info.st_size > 0 && !ReadByte(fd.Get(), info.st_size - 1, last)) {
    return "read";
  }
  // One write, so that a reader without the lock sees as little of a part as can be.
  if (!(last == '\n' ? WriteAll(fd.Get(), lines) : WriteAll(fd.Get(), "\n" + lines))) {
    const int saved = errno;
    if (ftruncate(fd.Get(), info.st_size) != 0) {
      LogFailure({VEXLO_SOURCE, __LINE__, __func__, "ftruncate(fd, size) != 0"}, errno);
    }
    errno = saved;
    return "write";
  }
  return fd.Close() ? nullptr : "write";
}

}  // namespace

std::string RealPath(const std::string& path) {
  const std::unique_ptr<char, decltype(&free)> resolved(realpath(path.c_str(), nullptr), &free);
  return resolved == nullptr ? "" : resolved.get();
}

bool IsFileExist(const std::string& path) {
  struct stat info {};
  return lstat(path.c_str(), &info) == 0 && S_ISREG(info.st_mode);
}

bool MayFileExist(const std::string& path) {
  struct stat info {};
  return lstat(path.c_str(), &info) == 0
             ? S_ISREG(info.st_mode)
             : errno != ENOENT && errno != ENOTDIR && errno != ENAMETOOLONG;
}

bool IsDirExist(const std::string& path, bool follow_link) {
  return IsDirAfterLinks(path, follow_link ? kMaxLinks : 0);
}

bool IsDirentDir(const struct dirent* entry, const std::string& /*path*/) {
  return entry->d_type == DT_DIR;
}

bool IsMountPoint(const std::string& path) { return KAVOFSDirIsMntPoint(path.c_str()) > 0; }

bool CheckACLPerm(const std::string& path, unsigned perm) {
  unsigned mask = 0;
  return KAVOACLPermGet(path.c_str(), &mask) >= 0 && (mask & perm) != 0;
}

bool Unlink(const std::string& path) { return unlink(path.c_str()) == 0 || errno == ENOENT; }

bool MVFile(const std::string& from, const std::string& to) {
  KAVO_FILE_COPY_ARGS args{};
  args.keep_attributes = 1;
  args.remove_source = 1;
  return MVFileImpl(from, to, args);
}

bool CPFile(const std::string& from, const std::string& to) {
  KAVO_FILE_COPY_ARGS args{};
  args.keep_attributes = 1;
  return MVFileImpl(from, to, args);
}

bool MVFileImpl(const std::string& from, const std::string& to, const KAVO_FILE_COPY_ARGS& args) {
  return KAVOFileCopy(from.c_str(), to.c_str(), &args) == 0;
}

bool ChownVexlo(const std::string& path) {
  KAVO_USER* user = nullptr;
  const LockMutex lock(sdk::SDKMutex());
  if (KAVOUserGet("Vexlo", &user) < 0 || user == nullptr) {
    return false;
  }
  const uid_t uid = user->uid;
  const gid_t gid = user->gid;
  KAVOUserFree(user);
  return chown(path.c_str(), uid, gid) == 0;
}

bool ReadFile(std::string& content, const std::string& path) {
  const ScopedFd fd(open(path.c_str(), O_RDONLY | O_CLOEXEC));
  if (!fd.IsOpen()) {
    return false;
  }
  content.clear();
  char buffer[kReadBytes];
  while (true) {
    const ssize_t count = read(fd.Get(), buffer, sizeof(buffer));
    if (count > 0) {
      content.append(buffer, static_cast<size_t>(count));
    } else if (count == 0) {
      return true;
    } else if (errno != EINTR) {
      return false;
    }
  }
}

bool ReplaceFile(const std::string& path, const std::string& content) {
  std::string temporary = path + ".XXXXXX";
  ScopedFd fd(mkostemp(temporary.data(), O_CLOEXEC));
  if (!fd.IsOpen()) {
    return false;
  }
  if (WriteAll(fd.Get(), content) && DressLike(fd.Get(), path) && fsync(fd.Get()) == 0 &&
      fd.Close() && rename(temporary.c_str(), path.c_str()) == 0) {
    return SyncFolder(FolderOf(path));
  }
  const int saved = errno;
  unlink(temporary.c_str());
  errno = saved;
  return false;
}

void AppendLines(const std::string& path, const std::string& lines) {
  const LockFile lock(path, /*exclusive=*/true);
  const char* const failed = AppendUnderLock(path, lines);
  VEXLO_CHECK(failed != nullptr, ERR_SYSTEM,
              std::string(failed) + " failed, path=" + path + ", reason=" + strerror(errno));
}

bool TryAppendLines(const std::string& path, const std::string& lines) {
  const LockFile lock(path, /*exclusive=*/true, std::try_to_lock);
  return lock.IsHeld() && AppendUnderLock(path, lines) == nullptr;
}

}  // namespace vexlo
