// What a worker does and has done, for those who ask while it works.
#ifndef DAEMONS_FILEINDEXD_STATS_H_
#define DAEMONS_FILEINDEXD_STATS_H_

#include <json/value.h>

#include <chrono>
#include <cstdint>
#include <map>
#include <string>

#include "fileindex/optree/op.h"
#include "kavo/local/mutex.h"

namespace vexlo::fileindexd {

enum class WorkerState { kIdle, kProcessing, kCrawling, kPaused, kUnavailable, kFailing };

// Any thread. The lock is held for moments, never over a request, a file or another lock.
class Stats {
 public:
  void SetState(WorkerState state);
  void CountOperation(fileindex::FileIndexOP kind);
  // Documents that the engine has taken.
  void CountFiles(uint64_t count);
  void CountError(int code, const std::string& reason);
  // Where a crawl stands: how many paths it has met on the disk, and is done with.
  void SetProgress(uint64_t done, uint64_t found);

  // {"state","operations","kinds":{NUMBER:COUNT},"files","rate","errors":{CODE:COUNT},"last_error",
  // "progress"}; kinds by the numbers of FileIndexOP. The rate
  // is documents a second since the worker last began to work, 0 while it does not.
  Json::Value ToJson() const;

 private:
  using Clock = std::chrono::steady_clock;

  mutable kavo::local::Mutex mutex_;
  WorkerState state_ KAVO_GUARDED_BY(mutex_) = WorkerState::kIdle;
  uint64_t operations_ KAVO_GUARDED_BY(mutex_) = 0;
  std::map<int, uint64_t> kinds_ KAVO_GUARDED_BY(mutex_);
  uint64_t files_ KAVO_GUARDED_BY(mutex_) = 0;
  uint64_t files_before_ KAVO_GUARDED_BY(mutex_) = 0;  // When the work began.
  Clock::time_point began_ KAVO_GUARDED_BY(mutex_);
  std::map<int, uint64_t> errors_ KAVO_GUARDED_BY(mutex_);
  std::string last_error_ KAVO_GUARDED_BY(mutex_);
  uint64_t done_ KAVO_GUARDED_BY(mutex_) = 0;
  uint64_t found_ KAVO_GUARDED_BY(mutex_) = 0;
};

}  // namespace vexlo::fileindexd

#endif  // DAEMONS_FILEINDEXD_STATS_H_
