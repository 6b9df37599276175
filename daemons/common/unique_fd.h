// A file descriptor that is closed with its owner.
#ifndef DAEMONS_COMMON_UNIQUE_FD_H_
#define DAEMONS_COMMON_UNIQUE_FD_H_

#include <unistd.h>

#include <utility>

namespace vexlo::daemon {

class UniqueFd {
 public:
  UniqueFd() = default;
  explicit UniqueFd(int fd) : fd_(fd) {}
  ~UniqueFd() { Reset(); }
  UniqueFd(UniqueFd&& other) noexcept : fd_(std::exchange(other.fd_, -1)) {}
  UniqueFd& operator=(UniqueFd&& other) noexcept {
    if (this != &other) {
      Reset();
      fd_ = std::exchange(other.fd_, -1);
    }
    return *this;
  }
  UniqueFd(const UniqueFd&) = delete;
  UniqueFd& operator=(const UniqueFd&) = delete;

  int Get() const { return fd_; }
  void Reset() {
    if (fd_ >= 0) {
      close(std::exchange(fd_, -1));
    }
  }

 private:
  int fd_ = -1;
};

}  // namespace vexlo::daemon

#endif  // DAEMONS_COMMON_UNIQUE_FD_H_
