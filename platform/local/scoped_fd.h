// Not installed.
#ifndef PLATFORM_LOCAL_SCOPED_FD_H_
#define PLATFORM_LOCAL_SCOPED_FD_H_

#include <unistd.h>

#include <cerrno>

namespace kavo::local {

// Closes its descriptor, or nothing for a negative one, without touching errno.
class ScopedFd {
 public:
  explicit ScopedFd(int fd) : fd_(fd) {}
  ~ScopedFd() {
    const int saved = errno;
    if (fd_ >= 0) {
      close(fd_);
    }
    errno = saved;
  }
  ScopedFd(const ScopedFd&) = delete;
  ScopedFd& operator=(const ScopedFd&) = delete;

  int Get() const { return fd_; }

 private:
  const int fd_;
};

}  // namespace kavo::local

#endif  // PLATFORM_LOCAL_SCOPED_FD_H_
