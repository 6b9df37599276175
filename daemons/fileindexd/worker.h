// The thread that keeps one share's index up to date.
#ifndef DAEMONS_FILEINDEXD_WORKER_H_
#define DAEMONS_FILEINDEXD_WORKER_H_

#include <json/value.h>

#include <atomic>
#include <chrono>
#include <future>
#include <optional>
#include <string>
#include <thread>

#include "daemons/fileindexd/queue_watch.h"
#include "daemons/fileindexd/share_state.h"
#include "daemons/fileindexd/stats.h"
#include "kavo/local/mutex.h"

namespace vexlo::fileindexd {

// Until when the whole service is paused: what the status file said when it last changed, or what a
// command has said since. Any thread.
class Pause {
 public:
  void Set(long resume_time) { resume_time_ = resume_time; }
  // Looks at the status file, where a pause stands that began while nobody could be told. Throws as
  // StatusMgr does.
  void Reload();

  // Whether work rests now.
  bool IsOn() const;
  // Seconds since the epoch when it ends; none while it is off or has no end.
  std::optional<long> End() const;

 private:
  std::atomic<long> resume_time_ = -1;
  std::atomic<long> in_file_ = -1;
};

// Waits for the share's queue, and carries out what comes. Everything it needs to go on after a
// kill is on disk: the queue's snapshot, which goes when its work is committed, and the share's
// state file.
class Worker {
 public:
  // Starts the thread. `pause` outlives the worker; a cycle begins `coalescing` after the first new
  // line.
  Worker(std::string share, Pause& pause, std::chrono::milliseconds coalescing);
  // Stops it, and waits for what is under way.
  ~Worker();
  Worker(const Worker&) = delete;
  Worker& operator=(const Worker&) = delete;

  // The rest is for any thread, and never waits.

  const std::string& Share() const { return share_; }
  // The settings, the pause or the share may be others: looks at everything anew.
  void Kick();
  // The same, and nobody is changing the folders: what was to be queued of it is.
  void KickSettled();
  void Stop();
  // True when the thread has ended within the time.
  bool AwaitEnd(std::chrono::steady_clock::time_point until);

  // As the command "stats" tells it. How many lines wait is told from how many bytes do.
  Json::Value Describe() const;

 private:
  enum class Outcome { kDone, kAgain, kPaused, kRetry, kNoSpace, kUnavailable };

  void Run();
  Outcome RunGuarded();
  Outcome RunCycle();
  Outcome Judge(int code, const std::string& reason);
  void WaitAfter(Outcome outcome);
  // Until a line comes into the queue, and as long as others may come with it; or to the instant.
  void AwaitLine(std::optional<std::chrono::steady_clock::time_point> until);
  bool MakeIndexIfAsked();
  void MakeIndex();
  bool IsInterrupted() const;
  bool HasSpace() const;

  const std::string share_;
  Pause& pause_;
  const std::chrono::milliseconds coalescing_;
  std::atomic<bool> stopping_ = false;
  std::atomic<bool> kicked_ = false;
  std::atomic<bool> settled_ = true;
  Stats stats_;
  QueueWatch watch_;
  mutable kavo::local::Mutex queue_path_mutex_;
  std::string queue_path_ KAVO_GUARDED_BY(queue_path_mutex_);

  // The thread's own:
  ShareState state_;
  std::chrono::seconds wait_{0};
  // Since when some documents lack their text because nobody was there to read it.
  std::optional<std::chrono::steady_clock::time_point> unread_since_;
  bool has_unread_ = true;             // Perhaps: nobody has looked yet.
  bool settings_are_settled_ = false;  // And were not looked at since.
  bool space_is_told_ = false;
  bool index_is_missing_ = false;

  std::promise<void> ended_;
  std::future<void> has_ended_;
  std::thread thread_;
};

}  // namespace vexlo::fileindexd

#endif  // DAEMONS_FILEINDEXD_WORKER_H_
