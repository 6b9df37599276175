// A thread that feeds one queue.
#ifndef DAEMONS_EVNOTIFYD_QUEUE_WATCH_H_
#define DAEMONS_EVNOTIFYD_QUEUE_WATCH_H_

#include <optional>
#include <stop_token>
#include <string>
#include <thread>
#include <vector>

#include "daemons/evnotifyd/feeder.h"
#include "daemons/evnotifyd/wake.h"
#include "kavo/local/monitor_queues.h"
#include "kavo/local/mutex.h"

namespace vexlo::evnotifyd {

// One thread and one Feeder for each queue, so that a large share that is read at first, a queue
// that is locked or a disk that is full holds up nobody else, and a loss of events is that of one
// queue. All calls may come from any thread and return at once, but for the destructor.
class QueueWatch {
 public:
  QueueWatch(const kavo::local::RegisteredQueue& registered, const FeederOptions& options);
  ~QueueWatch();  // Waits for the thread, up to a second.
  QueueWatch(const QueueWatch&) = delete;
  QueueWatch& operator=(const QueueWatch&) = delete;

  // As those of Feeder, done soon.
  void SetFolders(std::vector<kavo::local::MonitoredFolder> folders);
  void CheckRoots();

  // What the kernel has reported so far is still appended, unless the queue is nobody's any more.
  void RequestStop(bool discard);

  QueueStats Stats() const;

 private:
  void Run(const std::stop_token& stop);

  const std::string queue_;
  const FeederOptions options_;
  const Wake wake_;

  mutable kavo::local::Mutex mutex_;  // Held for moments.
  std::optional<std::vector<kavo::local::MonitoredFolder>> folders_
      KAVO_GUARDED_BY(mutex_);  // To be watched from now on.
  bool check_roots_ KAVO_GUARDED_BY(mutex_) = false;
  bool discard_ KAVO_GUARDED_BY(mutex_) = false;
  QueueStats stats_ KAVO_GUARDED_BY(mutex_);

  std::jthread thread_;
};

}  // namespace vexlo::evnotifyd

#endif  // DAEMONS_EVNOTIFYD_QUEUE_WATCH_H_
