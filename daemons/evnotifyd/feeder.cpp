#include "daemons/evnotifyd/feeder.h"

#include <algorithm>
#include <cerrno>
#include <system_error>
#include <thread>

#include "common/check.h"
#include "common/error.h"
#include "common/file.h"
#include "common/string.h"
#include "daemons/common/log.h"

namespace vexlo::evnotifyd {
namespace {

using std::chrono::milliseconds;
using watch::QueueEvent;
using watch::Watcher;

constexpr milliseconds kMoveWait(50);
constexpr milliseconds kFirstPause(10);
constexpr milliseconds kLongestPause(1000);
// Many events are appended in parts, so that the bound of the backlog is not for them.
constexpr size_t kAppendBytes = size_t{1} << 20;

void AddReason(std::string& reasons, const std::string& reason) {
  if (!reason.empty()) {
    reasons += reasons.empty() ? "" : "; ";
    reasons += reason;
  }
}

}  // namespace

Feeder::Feeder(std::string queue, const FeederOptions& options, std::stop_token stop)
    : queue_(std::move(queue)),
      options_(options),
      stop_(std::move(stop)),
      backlog_(options.backlog_bytes) {}

// --- What is watched

void Feeder::SetFolders(const std::vector<kavo::local::MonitoredFolder>& folders, TimePoint now) {
  PollWatchers(now);  // What has happened so far is told by the old list.
  folders_.clear();
  folders_.reserve(folders.size());
  roots_.clear();
  std::map<Names, std::set<std::string>> wanted;
  for (const kavo::local::MonitoredFolder& folder : folders) {
    folders_.push_back({folder.path, folder.mask, {folder.ignore.begin(), folder.ignore.end()}});
    roots_.insert(folder.path);
    wanted[folders_.back().ignored].insert(folder.path);
  }
  std::sort(folders_.begin(), folders_.end(), [](const Folder& left, const Folder& right) {
    return left.path.size() > right.path.size();
  });
  backlog_.SetRoots({roots_.begin(), roots_.end()});
  std::erase_if(groups_, [&](const auto& group) { return wanted.count(group.first) == 0; });
  for (const auto& [ignored, roots] : wanted) {
    const auto group = groups_.try_emplace(ignored).first;
    if (!Adjust(group->second, roots)) {
      group->second.roots = roots;
      Start(group->first, group->second);
    }
  }
  Append();
}

void Feeder::Start(const Names& ignored, Group& group) {
  watch::WatchOptions options;
  options.max_watches = options_.max_watches;
  options.rescan_interval = options_.rescan;
  options.move_wait = kMoveWait;
  options.ignored = {queue_, queue_ + ".tmp"};
  options.ignored_names = {ignored.begin(), ignored.end()};
  options.takes_missing_roots = true;
  options.polls_roots = false;
  options.takes_hints = true;
  options.stop = stop_;
  const std::vector<std::string> roots(group.roots.begin(), group.roots.end());
  group.watcher.reset();  // First: the system allows only so many.
  group.fault.clear();
  try {
    group.watcher = std::make_unique<Watcher>(
        roots, std::move(options),
        [this, &ignored](QueueEvent&& event) { Take(ignored, std::move(event)); }, now_);
    ReindexStanding(group, roots);
  } catch (const Error& error) {
    // Nothing tells of changes: whoever reads the queue is told to look for them, time after time.
    group.fault = "nothing is watched, but reindexed every " +
                  std::to_string(options_.rescan.count() / 1000) + " s: " + error.what();
    group.retry = now_ + options_.rescan;
    for (const std::string& root : roots) {
      Add({watch::kMaskReindex, true, root, ""});
    }
  }
}

// False when the group has to start anew.
bool Feeder::Adjust(Group& group, const std::set<std::string>& roots) {
  if (group.watcher == nullptr) {
    return false;
  }
  std::vector<std::string> added;
  for (const std::string& root : group.roots) {
    if (roots.count(root) == 0 && !group.watcher->RemoveRoot(root)) {
      return false;
    }
  }
  for (const std::string& root : roots) {
    if (group.roots.count(root) == 0) {
      if (!group.watcher->AddRoot(root, now_)) {
        return false;
      }
      added.push_back(root);
    }
  }
  group.roots = roots;
  ReindexStanding(group, added);
  return true;
}

void Feeder::ReindexStanding(const Group& group, const std::vector<std::string>& roots) {
  const std::vector<std::string> gone = group.watcher->State().gone;
  for (const std::string& root : roots) {
    if (std::find(gone.begin(), gone.end(), root) == gone.end()) {
      Add({watch::kMaskReindex, true, root, ""});
    }
  }
}

void Feeder::CheckRoots(TimePoint now) {
  now_ = now;
  for (auto& [ignored, group] : groups_) {
    if (group.watcher != nullptr) {
      group.watcher->CheckRoots(now);
    }
  }
  Append();
}

void Feeder::PollWatchers(TimePoint now) {
  now_ = now;
  for (auto& [ignored, group] : groups_) {
    if (group.watcher != nullptr) {
      group.watcher->Poll(now);
    } else if (now >= group.retry) {
      Start(ignored, group);
    }
  }
}

void Feeder::Poll(TimePoint now) {
  PollWatchers(now);
  Append();
}

void Feeder::Finish(milliseconds patience) {
  const TimePoint deadline = Clock::now() + patience;
  do {
    Poll(Clock::now());
  } while (NextDeadline() == TimePoint::min() && Clock::now() < deadline);
  Poll(Clock::now() + kMoveWait);  // A file that has moved out is not waited for.
  while (!backlog_.Text().empty() && Clock::now() < deadline) {
    std::this_thread::sleep_for(kFirstPause);
    now_ = retry_ = Clock::now();
    Append();
  }
  if (!backlog_.Text().empty()) {
    daemon::Log(daemon::Level::kError, VEXLO_SOURCE, __LINE__,
                std::to_string(backlog_.Lines()) + " lines could not be appended, queue=" + queue_ +
                    "; its folders are reindexed at the next start");
  }
}

std::vector<int> Feeder::Fds() const {
  std::vector<int> fds;
  for (const auto& [ignored, group] : groups_) {
    if (group.watcher != nullptr) {
      fds.push_back(group.watcher->fd());
      fds.push_back(group.watcher->HintsFd());
    }
  }
  return fds;
}

TimePoint Feeder::NextDeadline() const {
  TimePoint next = backlog_.Text().empty() ? TimePoint::max() : retry_;
  for (const auto& [ignored, group] : groups_) {
    next = std::min(next, group.watcher == nullptr ? group.retry : group.watcher->NextDeadline());
  }
  return next;
}

QueueStats Feeder::Stats() const {
  QueueStats stats;
  stats.queue = queue_;
  stats.roots = {roots_.begin(), roots_.end()};
  stats.live = fault_.empty();
  AddReason(stats.reason, fault_);
  for (const auto& [ignored, group] : groups_) {
    AddReason(stats.reason, group.fault);
    stats.live = stats.live && group.watcher != nullptr;
    if (group.watcher != nullptr) {
      const watch::WatchState state = group.watcher->State();
      stats.watches += state.watched;
      stats.live = stats.live && state.live && state.unreadable == 0;
      AddReason(stats.reason, state.text);
    }
  }
  stats.lines = lines_;
  stats.overflows = overflows_;
  return stats;
}

// --- What is told

void Feeder::Take(const Names& ignored, QueueEvent&& event) {
  switch (event.mask) {
    case watch::kMaskCrashed:
    case watch::kMaskReindex:
      Add(event);
      return;
    case watch::kMaskRename:
      if ((MaskOf(ignored, event.path) & MaskOf(ignored, event.path_old) & event.mask) == 0) {
        Take(ignored, {watch::kMaskDelete, event.is_dir, std::move(event.path_old), ""});
        Take(ignored, {watch::kMaskCreate, event.is_dir, std::move(event.path), ""});
        return;
      }
      break;
    case watch::kMaskCreate:
      if (event.is_dir && roots_.count(event.path) != 0) {
        event.mask = watch::kMaskReindex;  // It is back, with all that is in it.
        Add(event);
        return;
      }
      break;
    default:
      break;
  }
  if ((MaskOf(ignored, event.path) & event.mask) != 0) {
    Add(event);
  }
}

void Feeder::Add(const QueueEvent& event) {
  backlog_.Add(event);
  const size_t bytes = backlog_.Text().size();
  tried_bytes_ = std::min(tried_bytes_, bytes);
  if (bytes >= tried_bytes_ + kAppendBytes) {
    retry_ = now_;  // The clock stands while events are taken.
    Append();
  }
}

void Feeder::Append() {
  if (backlog_.Text().empty() || (pause_.count() != 0 && now_ < retry_)) {
    return;
  }
  if (TryAppendLines(queue_, backlog_.Text())) {
    lines_ += backlog_.Lines();
    overflows_ += backlog_.Crashed();
    backlog_.Clear();
    tried_bytes_ = 0;
    pause_ = milliseconds(0);
    if (!fault_.empty()) {
      fault_.clear();
      daemon::Log(daemon::Level::kNotice, VEXLO_SOURCE, __LINE__,
                  "can be written again, queue=" + queue_);
    }
    return;
  }
  const int error = errno;
  tried_bytes_ = backlog_.Text().size();
  pause_ = std::clamp(2 * pause_, kFirstPause, kLongestPause);
  retry_ = now_ + pause_;
  // A lock is held for a moment by everybody who uses it.
  if (fault_.empty() && (error != EWOULDBLOCK || pause_ == kLongestPause)) {
    fault_ = "cannot be written, queue=" + queue_ + ", reason=" +
             (error == EWOULDBLOCK ? "another process holds its lock"
                                   : std::system_category().message(error));
    daemon::Log(daemon::Level::kError, VEXLO_SOURCE, __LINE__, fault_);
  }
}

// The mask of the innermost folder that holds the path; 0 when another Watcher tells of that one.
uint32_t Feeder::MaskOf(const Names& ignored, const std::string& path) const {
  for (const Folder& folder : folders_) {
    if (IsSameOrBelow(path, folder.path)) {
      return folder.ignored == ignored ? folder.mask : 0;
    }
  }
  return 0;
}

}  // namespace vexlo::evnotifyd
