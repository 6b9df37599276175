// Waits for what a worker waits for: a change of its queue file, a call, or a moment.
#ifndef DAEMONS_FILEINDEXD_QUEUE_WATCH_H_
#define DAEMONS_FILEINDEXD_QUEUE_WATCH_H_

#include <chrono>
#include <optional>
#include <string>

#include "daemons/common/unique_fd.h"

namespace vexlo::fileindexd {

// Watches the folder of the queue, as the file itself comes and goes. For one thread but Wake().
class QueueWatch {
 public:
  QueueWatch();

  // Ends a Wait(), or the next one. Any thread, also before there is a path to watch.
  void Wake() const;

  // From now on this queue is watched; its folder is made when it is missing. A path that is
  // watched already is nothing new. Throws Error 502.
  void Watch(const std::string& queue_path);

  // Drops what is known of changes: what is done from here on sees them.
  void Forget();

  // Waits until Wake(), the instant, or with `for_queue` a change of the queue. True for a change.
  bool Wait(std::optional<std::chrono::steady_clock::time_point> until, bool for_queue);

 private:
  bool TakeChanges();

  daemon::UniqueFd wake_;
  daemon::UniqueFd inotify_;
  std::string queue_path_;
  std::string name_;
};

}  // namespace vexlo::fileindexd

#endif  // DAEMONS_FILEINDEXD_QUEUE_WATCH_H_
