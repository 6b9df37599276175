// File descriptors. Not installed.
#ifndef PLATFORM_LOCAL_FD_H_
#define PLATFORM_LOCAL_FD_H_

#include <unistd.h>

#include <cerrno>
#include <string_view>

namespace kavo::local {

// Closes a descriptor at the end of a scope without touching errno.
class ScopedFd {
 public:
  explicit ScopedFd(int fd) : fd_(fd) {}
  ~ScopedFd() {
    const int saved = errno;
    Close();
    errno = saved;
  }
  ScopedFd(const ScopedFd&) = delete;
  ScopedFd& operator=(const ScopedFd&) = delete;

  int Get() const { return fd_; }
  // False with errno when the file system tells only now that a write failed.
  bool Close() {
    const int fd = fd_;
    fd_ = -1;
    return fd < 0 || close(fd) == 0;
  }

 private:
  int fd_;
};

// False with errno.
inline bool WriteAll(int fd, std::string_view data) {
  while (!data.empty()) {
    const ssize_t written = write(fd, data.data(), data.size());
    if (written >= 0) {
      data.remove_prefix(static_cast<size_t>(written));
    } else if (errno != EINTR) {
      return false;
    }
  }
  return true;
}

}  // namespace kavo::local

#endif  // PLATFORM_LOCAL_FD_H_
