#include "daemons/fileindexd/queue_watch.h"

#include <poll.h>
#include <sys/eventfd.h>
#include <sys/inotify.h>
#include <unistd.h>

#include <algorithm>
#include <cerrno>
#include <cstdint>
#include <string_view>

#include "common/check.h"
#include "common/error.h"
#include "common/string.h"
#include "daemons/common/folders.h"

namespace vexlo::fileindexd {
namespace {

// The queue's own end is among them: it is made anew by the next line, perhaps in a folder that is
// made anew, too.
constexpr uint32_t kChanges = IN_CREATE | IN_MODIFY | IN_CLOSE_WRITE | IN_MOVED_TO;
constexpr uint32_t kEndOfFolder = IN_IGNORED | IN_MOVE_SELF;

}  // namespace

QueueWatch::QueueWatch() : wake_(eventfd(0, EFD_CLOEXEC | EFD_NONBLOCK)) {
  VEXLO_CHECK(wake_.Get() < 0, ERR_SYSTEM, "eventfd failed");
}

void QueueWatch::Wake() const {
  const uint64_t one = 1;
  while (write(wake_.Get(), &one, sizeof(one)) < 0 && errno == EINTR) {
  }
}

void QueueWatch::Watch(const std::string& queue_path) {
  if (queue_path == queue_path_ && inotify_.Get() >= 0) {
    return;
  }
  queue_path_ = queue_path;
  name_ = Basename(queue_path);
  const std::string folder = Dirname(queue_path);
  daemon::MakeFolders(folder);
  inotify_ = daemon::UniqueFd(inotify_init1(IN_CLOEXEC | IN_NONBLOCK));
  VEXLO_CHECK(inotify_.Get() < 0, ERR_SYSTEM, "inotify_init1 failed");
  const bool failed =
      inotify_add_watch(inotify_.Get(), folder.c_str(), kChanges | IN_MOVE_SELF | IN_ONLYDIR) < 0;
  if (failed) {
    inotify_.Reset();
  }
  VEXLO_CHECK(failed, ERR_SYSTEM, "inotify_add_watch failed, path=" + folder);
}

void QueueWatch::Forget() { TakeChanges(); }

bool QueueWatch::Wait(std::optional<std::chrono::steady_clock::time_point> until, bool for_queue) {
  for (;;) {
    int timeout = -1;
    if (until) {
      const auto left =
          std::chrono::ceil<std::chrono::milliseconds>(*until - std::chrono::steady_clock::now());
      if (left.count() <= 0) {
        return false;
      }
      timeout = static_cast<int>(std::min<int64_t>(left.count(), INT32_MAX));
    }
    struct pollfd fds[] = {{wake_.Get(), POLLIN, 0}, {for_queue ? inotify_.Get() : -1, POLLIN, 0}};
    if (poll(fds, 2, timeout) < 0) {
      VEXLO_CHECK(errno != EINTR, ERR_SYSTEM, "poll failed");
      continue;
    }
    if (fds[0].revents != 0) {
      uint64_t count = 0;
      while (read(wake_.Get(), &count, sizeof(count)) < 0 && errno == EINTR) {
      }
      return false;
    }
    if (fds[1].revents != 0 && TakeChanges()) {
      return true;
    }
  }
}

// Reads all that has come; whether any of it concerns the queue.
bool QueueWatch::TakeChanges() {
  bool is_changed = false;
  alignas(inotify_event) char buffer[4096];
  while (inotify_.Get() >= 0) {
    const ssize_t length = read(inotify_.Get(), buffer, sizeof(buffer));
    if (length < 0 && errno == EINTR) {
      continue;
    }
    if (length <= 0) {
      break;
    }
    for (ssize_t at = 0; at < length;) {
      const auto* const event = reinterpret_cast<const inotify_event*>(buffer + at);
      const std::string_view name(event->len > 0 ? static_cast<const char*>(event->name) : "");
      if ((event->mask & kEndOfFolder) != 0) {
        inotify_.Reset();  // The next cycle makes the folder, and watches it.
        return true;
      }
      is_changed = is_changed || (event->mask & IN_Q_OVERFLOW) != 0 || name == name_;
      at += static_cast<ssize_t>(sizeof(inotify_event)) + event->len;
    }
  }
  return is_changed;
}

}  // namespace vexlo::fileindexd
