// Wakes a thread that waits in poll().
#ifndef DAEMONS_EVNOTIFYD_WAKE_H_
#define DAEMONS_EVNOTIFYD_WAKE_H_

#include <poll.h>
#include <sys/eventfd.h>

#include <algorithm>
#include <cerrno>
#include <chrono>
#include <cstdint>
#include <system_error>
#include <vector>

#include "daemons/common/unique_fd.h"

namespace vexlo::evnotifyd {

// Raised by any thread, waited for by one.
class Wake {
 public:
  Wake() : fd_(eventfd(0, EFD_CLOEXEC | EFD_NONBLOCK)) {
    if (fd_.Get() < 0) {
      throw std::system_error(errno, std::system_category(), "eventfd failed");
    }
  }

  void Raise() const {
    const uint64_t one = 1;
    while (write(fd_.Get(), &one, sizeof(one)) < 0 && errno == EINTR) {
    }
  }

  // Returns when it was raised since the last call, one of the descriptors (first, what to wait
  // for) has something, or the time has come, max() for never. Also returns early at times.
  void Wait(std::vector<pollfd>& fds, std::chrono::steady_clock::time_point until) const {
    constexpr int64_t kLongest = 3'600'000;
    fds.push_back({fd_.Get(), POLLIN, 0});
    int timeout = -1;
    if (until != std::chrono::steady_clock::time_point::max()) {
      // What is long past is too early to count from.
      const auto now = std::chrono::steady_clock::now();
      const auto wait =
          std::chrono::ceil<std::chrono::milliseconds>(std::max(until, now) - now).count();
      timeout = static_cast<int>(std::min<int64_t>(wait, kLongest));
    }
    poll(fds.data(), fds.size(), timeout);
    uint64_t times = 0;
    while (read(fd_.Get(), &times, sizeof(times)) < 0 && errno == EINTR) {
    }
  }

 private:
  const daemon::UniqueFd fd_;
};

}  // namespace vexlo::evnotifyd

#endif  // DAEMONS_EVNOTIFYD_WAKE_H_
