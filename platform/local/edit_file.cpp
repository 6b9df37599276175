#include "platform/local/edit_file.h"

#include <fcntl.h>
#include <sys/file.h>
#include <sys/stat.h>

#include <algorithm>
#include <cstring>
#include <new>

namespace kavo::local {
namespace {

[[noreturn]] void ThrowSystem(const std::string& path, const char* deed) {
  throw FileError(path + ": " + deed + " failed: " + strerror(errno));
}

// The new file in the making, under a name that is known: what a crash leaves goes with the next
// edit.
class Temporary {
 public:
  explicit Temporary(const std::string& file) : path_(file + ".tmp") { unlink(path_.c_str()); }
  ~Temporary() { unlink(path_.c_str()); }
  Temporary(const Temporary&) = delete;
  Temporary& operator=(const Temporary&) = delete;

  const std::string& Path() const { return path_; }

 private:
  std::string path_;
};

int OpenLock(const std::string& path) {
  const int fd = open(path.c_str(), O_RDWR | O_CREAT | O_CLOEXEC, 0644);
  if (fd < 0) {
    ThrowSystem(path, "open");
  }
  return fd;
}

bool SyncFolder(const std::string& folder) {
  const ScopedFd fd(open(folder.c_str(), O_RDONLY | O_DIRECTORY | O_CLOEXEC));
  return fd.Get() >= 0 && fsync(fd.Get()) == 0;
}

}  // namespace

bool IsNormalised(std::string_view path) {
  if (!path.starts_with('/')) {
    return false;
  }
  while (!path.empty()) {
    path.remove_prefix(1);
    const std::string_view component = path.substr(0, path.find('/'));
    if (component.empty() || component == "." || component == "..") {
      return false;
    }
    path.remove_prefix(component.size());
  }
  return true;
}

void RethrowNoMemory(const std::exception& error) {
  if (strstr(error.what(), "allocate") != nullptr) {
    throw std::bad_alloc();
  }
}

std::string FolderOf(const std::string& file) {
  const size_t slash = file.rfind('/');
  return slash == std::string::npos ? "." : file.substr(0, std::max<size_t>(slash, 1));
}

void MakeFolders(const std::string& folder) {
  for (size_t end = 0; end != std::string::npos;) {
    end = folder.find('/', end + 1);
    const std::string part = folder.substr(0, end);
    struct stat info {};
    if (mkdir(part.c_str(), 0755) != 0) {
      const int error = errno;
      if (stat(part.c_str(), &info) != 0 || !S_ISDIR(info.st_mode)) {
        errno = error;
        ThrowSystem(part, "mkdir");
      }
    } else if (!SyncFolder(FolderOf(part))) {
      ThrowSystem(part, "fsync of the folder above");
    }
  }
}

bool ReadAll(int fd, size_t expected, std::string& text) {
  size_t used = 0;
  text.resize(std::min(expected, kMaxFileBytes) + 1);
  while (true) {
    const ssize_t count = read(fd, text.data() + used, text.size() - used);
    if (count < 0 && errno != EINTR) {
      return false;
    }
    used += static_cast<size_t>(std::max<ssize_t>(count, 0));
    if (count == 0 || used > kMaxFileBytes) {
      text.resize(used);
      return true;
    }
    if (used == text.size()) {
      text.resize(std::min(2 * used, kMaxFileBytes + 1));
    }
  }
}

EditLock::EditLock(const std::string& file) : fd_(OpenLock(file + ".lock")) {
  while (flock(fd_.Get(), LOCK_EX) != 0) {
    if (errno != EINTR) {
      ThrowSystem(file + ".lock", "flock");
    }
  }
}

void ReplaceWhole(const std::string& file, std::string_view text) {
  const Temporary temporary(file);
  const std::string& path = temporary.Path();
  ScopedFd fd(open(path.c_str(), O_WRONLY | O_CREAT | O_EXCL | O_CLOEXEC | O_NOFOLLOW, 0644));
  if (fd.Get() < 0) {
    ThrowSystem(path, "open");
  }
  struct stat old {};
  if (stat(file.c_str(), &old) == 0 && fchown(fd.Get(), old.st_uid, old.st_gid) != 0) {
    // Only root gives files away; the file is then that of whoever edits it.
  }
  if (fchmod(fd.Get(), 0644) != 0) {  // Whatever the umask is.
    ThrowSystem(path, "chmod");
  }
  if (!WriteAll(fd.Get(), text)) {
    ThrowSystem(path, "write");
  }
  if (fsync(fd.Get()) != 0) {
    ThrowSystem(path, "fsync");
  }
  if (!fd.Close()) {
    ThrowSystem(path, "close");
  }
  if (rename(path.c_str(), file.c_str()) != 0) {
    ThrowSystem(file, "rename");
  }
  if (!SyncFolder(FolderOf(file))) {
    ThrowSystem(file,
                "the change is made but may not outlive a power failure, as fsync of the folder");
  }
}

}  // namespace kavo::local
