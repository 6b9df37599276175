#include "daemons/evnotifyd/monitor.h"

#include <fcntl.h>
#include <sys/inotify.h>

#include <algorithm>
#include <cerrno>
#include <string_view>
#include <system_error>
#include <utility>

#include "common/check.h"
#include "common/error.h"
#include "daemons/common/folders.h"
#include "daemons/common/log.h"

namespace vexlo::evnotifyd {
namespace {

using kavo::local::RegisteredQueue;

// Several registrations that are changed one after the other are one change.
constexpr std::chrono::milliseconds kDebounce(50);
constexpr std::chrono::milliseconds kFirstPause(1000);
constexpr size_t kSpared = 3;  // Queues that give way to the daemon's own threads.
constexpr uint32_t kFolderMask =
    IN_MOVED_TO | IN_MOVED_FROM | IN_CLOSE_WRITE | IN_DELETE | IN_MOVE_SELF | IN_ONLYDIR;

QueueStats WaitingFor(const RegisteredQueue& registered, const std::string& reason) {
  QueueStats stats;
  stats.queue = registered.queue;
  stats.reason = "nothing is watched, but tried again: " + reason;
  stats.roots.reserve(registered.folders.size());
  for (const kavo::local::MonitoredFolder& folder : registered.folders) {
    stats.roots.push_back(folder.path);
  }
  return stats;
}

Json::Value JsonOf(const QueueStats& stats) {
  Json::Value value(Json::objectValue);
  value["queue"] = stats.queue;
  value["roots"] = Json::arrayValue;
  for (const std::string& root : stats.roots) {
    value["roots"].append(root);
  }
  value["watches"] = Json::UInt64{stats.watches};
  value["state"] = stats.live ? "live" : "degraded";
  value["reason"] = stats.reason;
  value["lines"] = Json::UInt64{stats.lines};
  value["overflows"] = Json::UInt64{stats.overflows};
  return value;
}

}  // namespace

Monitor::Monitor(const FeederOptions& options)
    : options_(options),
      folder_(kavo::local::MonitorQueuesFolder()),
      registrations_(inotify_init1(IN_NONBLOCK | IN_CLOEXEC)),
      mounts_(open("/proc/self/mountinfo", O_RDONLY | O_CLOEXEC)) {
  VEXLO_CHECK(!daemon::MakeFolders(folder_), ERR_SYSTEM,
              "the folder cannot be made, path=" + folder_ +
                  ", reason=" + std::generic_category().message(errno));
  WatchFolder();
  Read();
  thread_ = std::jthread([this](const std::stop_token& stop) { Run(stop); });
}

Monitor::~Monitor() {
  thread_.request_stop();
  wake_.Raise();
  thread_.join();
  std::vector<Queue> queues;
  for (auto& [key, queue] : queues_) {
    queues.push_back(std::move(queue));
  }
  Stop(std::move(queues), /*discard=*/false);
}

void Monitor::Run(const std::stop_token& stop) {
  while (!stop.stop_requested()) {
    // Without a watch there is only time to go by.
    const bool blind = folder_watch_ < 0 || !root_paths_.IsComplete();
    const TimePoint look_at = blind ? Clock::now() + options_.rescan : TimePoint::max();
    std::vector<pollfd> fds = {{registrations_.Get(), POLLIN, 0},
                               {mounts_.Get(), POLLPRI, 0},
                               {root_paths_.fd(), POLLIN, 0}};
    wake_.Wait(fds, std::min(read_at_, look_at));
    if (TakeFolderEvents()) {
      read_at_ = std::min(read_at_, Clock::now() + kDebounce);
    }
    const bool looks = blind && Clock::now() >= look_at;
    if (looks || Clock::now() >= read_at_) {
      WatchFolder();
      Read();
    }
    if (root_paths_.HasChanged() || fds[1].revents != 0 || looks) {
      CheckRoots();
    }
  }
}

// The folder is made anew when somebody has removed it or moved it away; where it was watched
// before, nothing changes.
void Monitor::WatchFolder() {
  daemon::MakeFolders(folder_);
  const int before = std::exchange(
      folder_watch_, inotify_add_watch(registrations_.Get(), folder_.c_str(), kFolderMask));
  if (folder_watch_ < 0 && before >= 0) {
    daemon::Log(daemon::Level::kWarning, VEXLO_SOURCE, __LINE__,
                "registrations are looked at time after time, as they cannot be watched, path=" +
                    folder_ + ", reason=" + std::system_category().message(errno));
  }
  if (before >= 0 && before != folder_watch_) {
    inotify_rm_watch(registrations_.Get(), before);  // It may stand elsewhere.
  }
}

// True when a registration may have changed.
bool Monitor::TakeFolderEvents() {
  bool changed = false;
  alignas(inotify_event) char events[1 << 12];
  ssize_t length = 0;
  while ((length = read(registrations_.Get(), events, sizeof(events))) > 0 ||
         (length < 0 && errno == EINTR)) {
    for (ssize_t at = 0; at < length;) {
      const auto* event = reinterpret_cast<const inotify_event*>(events + at);
      // Without a name it is about the folder.
      changed = changed || event->len == 0 ||
                std::string_view(static_cast<const char*>(event->name)).ends_with(".json");
      at += static_cast<ssize_t>(sizeof(inotify_event) + event->len);
    }
  }
  return changed;
}

void Monitor::Read() {
  const bool complete = ReadOnce();
  pause_ = complete ? std::chrono::milliseconds(0)
                    : std::min(std::max(2 * pause_, kFirstPause),
                               std::max(options_.rescan, kFirstPause));
  read_at_ = complete ? TimePoint::max() : Clock::now() + pause_;
}

// False when something is to be tried again.
bool Monitor::ReadOnce() {
  kavo::local::MonitorQueues read;
  try {
    read = kavo::local::ReadMonitorQueues();
  } catch (const kavo::local::MonitorQueuesError& error) {
    if (std::exchange(fault_, error.what()) != error.what()) {
      daemon::Log(daemon::Level::kWarning, VEXLO_SOURCE, __LINE__, error.what());
    }
    return false;
  }
  fault_.clear();
  for (const auto& [app, fault] : read.unreadable) {
    if (unreadable_[app] != fault) {
      daemon::Log(daemon::Level::kWarning, VEXLO_SOURCE, __LINE__,
                  fault + "; its queues stay as they were");
    }
  }
  unreadable_ = read.unreadable;
  std::map<Key, RegisteredQueue> wanted;
  for (RegisteredQueue& queue : read.queues) {
    wanted.emplace(Key(queue.app, queue.queue, queue.type), std::move(queue));
  }
  std::vector<Queue> ended;
  {
    const kavo::local::MutexLock lock(mutex_);
    for (auto queue = queues_.begin(); queue != queues_.end();) {
      const bool stays =
          wanted.count(queue->first) != 0 || unreadable_.count(queue->second.registered.app) != 0;
      if (!stays) {
        ended.push_back(std::move(queue->second));
      }
      queue = stays ? std::next(queue) : queues_.erase(queue);
    }
  }
  const bool all_started = StartQueues(std::move(wanted));
  Stop(std::move(ended), /*discard=*/true);
  CheckRoots();
  return all_started && unreadable_.empty();
}

// False when there is no thread, memory or descriptor for some of them. The others are not to
// suffer for it, and those that cannot be started are told of in the state.
bool Monitor::StartQueues(std::map<Key, RegisteredQueue> wanted) {
  std::string reason;
  const kavo::local::MutexLock lock(mutex_);
  const size_t waited = waiting_.size();
  waiting_.clear();
  for (auto& [key, registered] : wanted) {
    const auto queue = queues_.find(key);
    if (queue == queues_.end()) {
      try {
        auto watch = std::make_unique<QueueWatch>(registered, options_);
        queues_.emplace(key, Queue{std::move(registered), std::move(watch)});
      } catch (const std::exception& error) {
        reason = error.what();
        waiting_.emplace(key, WaitingFor(registered, reason));
      }
      continue;
    }
    if (queue->second.registered != registered) {
      queue->second.watch->SetFolders(registered.folders);
    }
    queue->second.registered = std::move(registered);
  }
  if (!waiting_.empty() && !thread_.joinable()) {
    // The daemon has threads of its own to start after these.
    for (size_t i = 0; i < kSpared && !queues_.empty(); ++i) {
      const auto last = std::prev(queues_.end());
      waiting_.emplace(last->first, WaitingFor(last->second.registered, reason));
      queues_.erase(last);
    }
  }
  if (waiting_.size() != waited) {
    daemon::Log(daemon::Level::kWarning, VEXLO_SOURCE, __LINE__,
                waiting_.empty()
                    ? "all queues have a thread again"
                    : "not watched, but tried again: " + std::to_string(waiting_.size()) + " of " +
                          std::to_string(waiting_.size() + queues_.size()) +
                          " queues, reason=" + reason);
  }
  return waiting_.empty();
}

// All at once, so that they are not waited for one by one.
void Monitor::Stop(std::vector<Queue> queues, bool discard) {
  for (const Queue& queue : queues) {
    queue.watch->RequestStop(discard);
  }
}

// What is watched on the way comes first: a root that comes between the two is seen by both.
void Monitor::CheckRoots() {
  std::set<std::string> roots;
  {
    const kavo::local::MutexLock lock(mutex_);
    for (const auto& [key, queue] : queues_) {
      for (const kavo::local::MonitoredFolder& folder : queue.registered.folders) {
        roots.insert(folder.path);
      }
    }
  }
  root_paths_.Set(roots);
  const kavo::local::MutexLock lock(mutex_);
  for (const auto& [key, queue] : queues_) {
    queue.watch->CheckRoots();
  }
}

Json::Value Monitor::Stats() const {
  Json::Value queues(Json::arrayValue);
  const kavo::local::MutexLock lock(mutex_);
  for (const auto& [key, queue] : queues_) {
    queues.append(JsonOf(queue.watch->Stats()));
  }
  for (const auto& [key, stats] : waiting_) {
    queues.append(JsonOf(stats));
  }
  Json::Value answer(Json::objectValue);
  answer["queues"] = std::move(queues);
  return answer;
}

}  // namespace vexlo::evnotifyd
