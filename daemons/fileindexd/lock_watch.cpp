#include "daemons/fileindexd/lock_watch.h"

#include <poll.h>
#include <sys/eventfd.h>
#include <sys/inotify.h>
#include <unistd.h>

#include <cerrno>
#include <cstdint>
#include <mutex>
#include <system_error>
#include <utility>

#include "common/check.h"
#include "common/error.h"
#include "common/lock.h"
#include "daemons/common/log.h"

namespace vexlo::fileindexd {
namespace {

constexpr int kForGood = -1;
constexpr int kQuietMilliseconds = 200;  // Several commands in a row are one matter.
constexpr int kArmAgainMilliseconds = 60'000;
constexpr uint32_t kClosing = IN_CLOSE_WRITE | IN_CLOSE_NOWRITE;
// The file's last name going changes its attributes as long as somebody has it open.
constexpr uint32_t kReplacing = IN_ATTRIB | IN_DELETE_SELF | IN_MOVE_SELF | IN_IGNORED;

}  // namespace

LockWatch::LockWatch(std::string path, std::function<void()> released)
    : path_(std::move(path)),
      released_(std::move(released)),
      stop_(eventfd(0, EFD_CLOEXEC | EFD_NONBLOCK)) {
  VEXLO_CHECK(stop_.Get() < 0, ERR_SYSTEM, "eventfd failed");
  thread_ = std::thread([this] { Run(); });
}

LockWatch::~LockWatch() {
  const uint64_t one = 1;
  while (write(stop_.Get(), &one, sizeof(one)) < 0 && errno == EINTR) {
  }
  thread_.join();
}

void LockWatch::Run() {
  bool is_armed = Arm();
  int timeout = 0;  // For the call at the start.
  for (;;) {
    struct pollfd fds[] = {{stop_.Get(), POLLIN, 0}, {inotify_.Get(), POLLIN, 0}};
    const int count = poll(fds, 2, timeout);
    if (fds[0].revents != 0) {
      return;
    }
    if (count == 0) {
      is_armed = is_armed || Arm();
      timeout = is_armed ? kForGood : kArmAgainMilliseconds;
      released_();
    } else if (count > 0) {
      const News news = Take();
      if (news == News::kReplaced) {
        is_armed = Arm();
      }
      timeout = news == News::kNone ? timeout : kQuietMilliseconds;
    }
  }
}

bool LockWatch::Arm() {
  // Before the watch, which would see it closed.
  { const LockFile made(path_, /*exclusive=*/false, std::try_to_lock); }
  inotify_ = daemon::UniqueFd(inotify_init1(IN_CLOEXEC | IN_NONBLOCK));
  if (inotify_.Get() >= 0 && inotify_add_watch(inotify_.Get(), path_.c_str(),
                                               kClosing | kReplacing | IN_DONT_FOLLOW) >= 0) {
    return true;
  }
  daemon::Log(daemon::Level::kWarning, VEXLO_SOURCE, __LINE__,
              "the lock is not watched at present, path=" + path_ +
                  ", reason=" + std::generic_category().message(errno));
  inotify_.Reset();
  return false;
}

// Reads all that has come.
LockWatch::News LockWatch::Take() const {
  News news = News::kNone;
  alignas(inotify_event) char buffer[4096];
  for (;;) {
    const ssize_t length = read(inotify_.Get(), buffer, sizeof(buffer));
    if (length < 0 && errno == EINTR) {
      continue;
    }
    if (length <= 0) {
      return news;
    }
    for (ssize_t at = 0; at < length;) {
      const auto* const event = reinterpret_cast<const inotify_event*>(buffer + at);
      if ((event->mask & kReplacing) != 0) {
        news = News::kReplaced;
      } else if (news == News::kNone) {
        news = News::kClosed;  // Or there were too many to be told apart.
      }
      at += static_cast<ssize_t>(sizeof(inotify_event)) + event->len;
    }
  }
}

}  // namespace vexlo::fileindexd
