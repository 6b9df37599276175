// Not installed.
#ifndef COMMON_SCOPED_FD_H_
#define COMMON_SCOPED_FD_H_

#include <unistd.h>

#include <cerrno>

namespace vexlo {

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
  bool IsOpen() const { return fd_ >= 0; }
  bool Close() {
    if (fd_ < 0) {
      return true;
    }
    const int fd = fd_;
    fd_ = -1;
    return close(fd) == 0;
  }

 private:
  int fd_;
};

}  // namespace vexlo

#endif  // COMMON_SCOPED_FD_H_
