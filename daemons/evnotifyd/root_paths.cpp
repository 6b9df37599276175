#include "daemons/evnotifyd/root_paths.h"

#include <sys/inotify.h>

#include <algorithm>
#include <cerrno>
#include <system_error>
#include <utility>

#include "common/check.h"

namespace vexlo::evnotifyd {
namespace {

constexpr uint32_t kMask =
    IN_CREATE | IN_DELETE | IN_MOVED_FROM | IN_MOVED_TO | IN_ONLYDIR | IN_MASK_ADD;

}  // namespace

void RootPaths::Set(const std::set<std::string>& roots) {
  fd_ = daemon::UniqueFd(inotify_init1(IN_NONBLOCK | IN_CLOEXEC));
  names_.clear();
  const bool was_complete = std::exchange(complete_, fd_.Get() >= 0);
  int error = errno;
  std::map<std::string, int> watches;
  for (const std::string& root : roots) {
    // From above: a folder that is made meanwhile is told of by the one above it, which is watched.
    for (size_t slash = 0; slash != std::string::npos;) {
      const std::string folder = root.substr(0, std::max<size_t>(slash, 1));
      const size_t next = root.find('/', slash + 1);
      const std::string name = root.substr(slash + 1, next - slash - 1);
      auto [watch, added] = watches.try_emplace(folder, -1);
      if (added && (watch->second = inotify_add_watch(fd_.Get(), folder.c_str(), kMask)) < 0 &&
          errno != ENOENT && errno != ENOTDIR) {
        error = errno;
        complete_ = false;
      }
      if (watch->second >= 0) {
        names_[watch->second].insert(name);
      }
      slash = next;
    }
  }
  if (was_complete && !complete_) {
    LogLine(
        VEXLO_SOURCE, __LINE__,
        "the ways to the folders cannot be watched, and are looked at time after time, reason=" +
            std::system_category().message(error));
  }
}

bool RootPaths::HasChanged() {
  bool changed = false;
  alignas(inotify_event) char events[1 << 12];
  ssize_t length = 0;
  while ((length = read(fd_.Get(), events, sizeof(events))) > 0 || (length < 0 && errno == EINTR)) {
    for (ssize_t at = 0; at < length;) {
      const auto* event = reinterpret_cast<const inotify_event*>(events + at);
      const auto names = names_.find(event->wd);
      const std::string name = event->len == 0 ? "" : static_cast<const char*>(event->name);
      changed = changed || (event->mask & (IN_Q_OVERFLOW | IN_UNMOUNT | IN_IGNORED)) != 0 ||
                (names != names_.end() && names->second.count(name) != 0);
      at += static_cast<ssize_t>(sizeof(inotify_event) + event->len);
    }
  }
  return changed;
}

}  // namespace vexlo::evnotifyd
