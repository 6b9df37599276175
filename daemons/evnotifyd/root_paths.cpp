#include "daemons/evnotifyd/root_paths.h"

#include <sys/inotify.h>
#include <sys/stat.h>

#include <algorithm>
#include <cerrno>
#include <filesystem>
#include <system_error>
#include <utility>

#include "common/check.h"
#include "daemons/common/log.h"

namespace vexlo::evnotifyd {
namespace {

constexpr int kMostLinks = 40;  // As many as the kernel follows.
constexpr uint32_t kSelf = IN_MOVE_SELF | IN_DELETE_SELF;
constexpr uint32_t kNames = IN_CREATE | IN_DELETE | IN_MOVED_FROM | IN_MOVED_TO;

bool Exists(const std::string& path) {
  struct stat there {};
  return stat(path.c_str(), &there) == 0;
}

// The path that a link names; empty for what is no link.
std::string TargetOf(const std::string& path) {
  std::error_code error;
  const std::filesystem::path target = std::filesystem::read_symlink(path, error);
  return error ? "" : (std::filesystem::path(path).parent_path() / target).lexically_normal();
}

}  // namespace

void RootPaths::Set(const std::set<std::string>& roots) {
  fd_ = daemon::UniqueFd(inotify_init1(IN_NONBLOCK | IN_CLOEXEC));
  error_ = errno;
  names_.clear();
  const bool was_complete = std::exchange(complete_, fd_.Get() >= 0);
  for (const std::string& root : roots) {
    WatchWay(root, kMostLinks);
  }
  if (was_complete && !complete_) {
    daemon::Log(daemon::Level::kWarning, VEXLO_SOURCE, __LINE__,
                "the ways to the folders cannot be watched, and are looked at time after time, "
                "reason=" +
                    std::system_category().message(error_));
  }
}

// From above, and each before what is below it is looked for: what comes meanwhile is heard of.
void RootPaths::WatchWay(const std::string& root, int links) {
  bool heard = true;  // Whether a watch tells when `folder` comes.
  for (size_t slash = 0; slash != std::string::npos;) {
    const std::string folder = root.substr(0, std::max<size_t>(slash, 1));
    const size_t next = root.find('/', slash + 1);
    if (const std::string target = TargetOf(folder); !target.empty() && links > 0) {
      Watch(folder, kSelf | IN_DONT_FOLLOW);
      WatchWay(target, links - 1);
    }
    int watch = Watch(folder, kSelf);
    if (watch < 0 && (heard || !complete_)) {
      return;
    }
    heard = next == std::string::npos || !Exists(root.substr(0, next));
    // Where what is below the next one is missing, that one's own end is heard of by its name
    // alone: the kernel keeps its own word back for as long as anybody stands in it.
    const size_t second = heard ? next : root.find('/', next + 1);
    const bool ends = heard || !Exists(root.substr(0, second));
    if (watch >= 0 && ends && (watch = Watch(folder, kNames)) >= 0) {
      names_[watch].insert(root.substr(slash + 1, next - slash - 1));
    }
    // What went since it was found is looked for again, from above.
    slash = watch < 0 ? 0 : next;
  }
}

// -1 when there is nothing, which whoever watches the folder above hears of.
int RootPaths::Watch(const std::string& path, uint32_t mask) {
  const int watch = inotify_add_watch(fd_.Get(), path.c_str(), mask | IN_MASK_ADD);
  if (watch < 0 && errno != ENOENT && errno != ENOTDIR) {
    error_ = errno;
    complete_ = false;
  }
  return watch;
}

bool RootPaths::HasChanged() {
  bool changed = false;
  alignas(inotify_event) char events[1 << 12];
  ssize_t length = 0;
  while ((length = read(fd_.Get(), events, sizeof(events))) > 0 || (length < 0 && errno == EINTR)) {
    for (ssize_t at = 0; at < length;) {
      const auto* event = reinterpret_cast<const inotify_event*>(events + at);
      const auto names = names_.find(event->wd);
      // Without a name it is about the folder, or events were lost.
      changed = changed || event->len == 0 ||
                (names != names_.end() && names->second.count(event->name) != 0);
      at += static_cast<ssize_t>(sizeof(inotify_event) + event->len);
    }
  }
  return changed;
}

}  // namespace vexlo::evnotifyd
