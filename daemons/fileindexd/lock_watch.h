// Tells when somebody has let go of a lock file.
#ifndef DAEMONS_FILEINDEXD_LOCK_WATCH_H_
#define DAEMONS_FILEINDEXD_LOCK_WATCH_H_

#include <functional>
#include <string>
#include <thread>

#include "daemons/common/unique_fd.h"

namespace vexlo::fileindexd {

// A lock goes with its holder, however he ends: the kernel closes the file then. The file alone is
// watched, as the folder around it may be a busy one. One thread, which sleeps meanwhile.
class LockWatch {
 public:
  // Calls `released` once at the start, and from then on whenever the file was closed by somebody
  // and nobody has closed it for a moment since; also when it was replaced. The file is made when
  // it is missing.
  LockWatch(std::string path, std::function<void()> released);
  // Waits for a call that is under way.
  ~LockWatch();
  LockWatch(const LockWatch&) = delete;
  LockWatch& operator=(const LockWatch&) = delete;

 private:
  enum class News { kNone, kClosed, kReplaced };

  void Run();
  bool Arm();
  News Take() const;

  const std::string path_;
  const std::function<void()> released_;
  const daemon::UniqueFd stop_;
  daemon::UniqueFd inotify_;  // The thread's own.
  std::thread thread_;
};

}  // namespace vexlo::fileindexd

#endif  // DAEMONS_FILEINDEXD_LOCK_WATCH_H_
