#include "daemons/evnotifyd/queue_watch.h"

#include <utility>

namespace vexlo::evnotifyd {
namespace {

constexpr std::chrono::milliseconds kPatienceAtEnd(300);

}  // namespace

QueueWatch::QueueWatch(const kavo::local::RegisteredQueue& registered, const FeederOptions& options)
    : queue_(registered.queue), options_(options), folders_(registered.folders) {
  stats_.queue = queue_;
  stats_.reason = "the folders are being read";
  stats_.roots.reserve(registered.folders.size());
  for (const kavo::local::MonitoredFolder& folder : registered.folders) {
    stats_.roots.push_back(folder.path);
  }
  thread_ = std::jthread([this](const std::stop_token& stop) { Run(stop); });
}

QueueWatch::~QueueWatch() { RequestStop(/*discard=*/false); }

void QueueWatch::SetFolders(std::vector<kavo::local::MonitoredFolder> folders) {
  {
    const kavo::local::MutexLock lock(mutex_);
    folders_ = std::move(folders);
  }
  wake_.Raise();
}

void QueueWatch::CheckRoots() {
  {
    const kavo::local::MutexLock lock(mutex_);
    check_roots_ = true;
  }
  wake_.Raise();
}

void QueueWatch::RequestStop(bool discard) {
  {
    const kavo::local::MutexLock lock(mutex_);
    discard_ = discard_ || discard;
  }
  thread_.request_stop();
  wake_.Raise();
}

QueueStats QueueWatch::Stats() const {
  const kavo::local::MutexLock lock(mutex_);
  return stats_;
}

void QueueWatch::Run(const std::stop_token& stop) {
  Feeder feeder(queue_, options_, stop);
  while (!stop.stop_requested()) {
    std::optional<std::vector<kavo::local::MonitoredFolder>> folders;
    bool check_roots = false;
    {
      const kavo::local::MutexLock lock(mutex_);
      folders = std::exchange(folders_, std::nullopt);
      check_roots = std::exchange(check_roots_, false);
    }
    if (folders.has_value()) {
      feeder.SetFolders(*folders, Clock::now());
    }
    if (check_roots) {
      feeder.CheckRoots(Clock::now());
    }
    feeder.Poll(Clock::now());
    QueueStats stats = feeder.Stats();
    std::vector<pollfd> fds;
    for (const int fd : feeder.Fds()) {
      fds.push_back({fd, POLLIN, 0});
    }
    {
      const kavo::local::MutexLock lock(mutex_);
      stats_ = std::move(stats);
    }
    wake_.Wait(fds, feeder.NextDeadline());
  }
  bool discard = false;
  {
    const kavo::local::MutexLock lock(mutex_);
    discard = discard_;
  }
  if (!discard) {
    feeder.Finish(kPatienceAtEnd);
  }
}

}  // namespace vexlo::evnotifyd
