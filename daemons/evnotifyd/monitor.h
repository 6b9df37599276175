// Every registered queue, watched.
#ifndef DAEMONS_EVNOTIFYD_MONITOR_H_
#define DAEMONS_EVNOTIFYD_MONITOR_H_

#include <json/value.h>

#include <map>
#include <memory>
#include <set>
#include <stop_token>
#include <string>
#include <thread>
#include <tuple>

#include "daemons/common/unique_fd.h"
#include "daemons/evnotifyd/queue_watch.h"
#include "daemons/evnotifyd/root_paths.h"
#include "daemons/evnotifyd/wake.h"
#include "kavo/local/mutex.h"

namespace vexlo::evnotifyd {

// A thread that waits for three things, and at rest has no timer: the registrations change (what is
// new in them is watched, what is gone is not any more); mounts change, or what leads to a root
// does (each queue sees which of its folders stand).
//
// Registrations of an application that cannot be read stay as they were: a file that somebody broke
// by hand must not cost an index. What cannot be read or started, for want of a thread, of memory
// or of a descriptor, is tried again, at first after a second, then ever later.
class Monitor {
 public:
  // Reads the registrations and starts. Throws Error 502 when their folder cannot be made, and
  // std::system_error without a descriptor or thread for itself.
  explicit Monitor(const FeederOptions& options);
  ~Monitor();  // Stops all queues, within a second.
  Monitor(const Monitor&) = delete;
  Monitor& operator=(const Monitor&) = delete;

  // {"queues":[{"queue","roots","watches","state","reason","lines","overflows"}]}. Any thread.
  Json::Value Stats() const;

 private:
  using Key = std::tuple<std::string, std::string, int>;  // Application, queue, type.
  struct Queue {
    kavo::local::RegisteredQueue registered;
    std::unique_ptr<QueueWatch> watch;
  };

  void Run(const std::stop_token& stop);
  void WatchFolder();
  bool TakeFolderEvents();
  void Read();
  bool ReadOnce();
  bool StartQueues(std::map<Key, kavo::local::RegisteredQueue> wanted);
  void Stop(std::vector<Queue> queues, bool discard);
  void CheckRoots();

  const FeederOptions options_;
  const std::string folder_;
  const Wake wake_;
  daemon::UniqueFd registrations_;
  daemon::UniqueFd mounts_;
  int folder_watch_ = -1;
  std::chrono::milliseconds pause_{0};  // Before what failed is tried again; 0 when nothing did.
  TimePoint read_at_ = TimePoint::max();
  RootPaths root_paths_;
  std::map<std::string, std::string> unreadable_;  // What has been logged.
  std::string fault_;                              // So has been that nothing can be read.

  mutable kavo::local::Mutex mutex_;                           // Held for moments.
  std::map<Key, Queue> queues_ KAVO_GUARDED_BY(mutex_);        // Changed by the thread alone.
  std::map<Key, QueueStats> waiting_ KAVO_GUARDED_BY(mutex_);  // Those that could not be started.

  std::jthread thread_;
};

}  // namespace vexlo::evnotifyd

#endif  // DAEMONS_EVNOTIFYD_MONITOR_H_
