// The processes that read files. What a damaged or malicious file does to a format's library it
// does to one of them, within limits, and the daemon goes on with another.
#ifndef DAEMONS_KAVOCONTENTEXTRACTD_POOL_H_
#define DAEMONS_KAVOCONTENTEXTRACTD_POOL_H_

#include <sys/types.h>

#include <chrono>
#include <cstddef>
#include <memory>
#include <set>
#include <string>
#include <vector>

#include "daemons/common/sandbox.h"
#include "daemons/common/unique_fd.h"
#include "kavo/local/mutex.h"

namespace vexlo::extractd {

// The descriptor on which a worker finds its socket.
inline constexpr int kWorkerSocket = 3;
// The exit status of a worker that had no memory left for a file.
inline constexpr int kOutOfMemory = 3;
// A worker's reply is refused when it is longer.
inline constexpr size_t kMaxReplyBytes = size_t{8} << 20;

// What a sanitizer takes of the address space is no fault of the files.
inline constexpr size_t kUsualMemory = daemon::kCanBeConfined ? 512 : 0;
// The user "nobody" of every system.
inline constexpr daemon::Account kNobody = {65534, 65534};

struct PoolOptions {
  std::string program;                           // Started as "PROGRAM --worker MIB UID GID".
  size_t workers = 2;                            // At most; started when they are needed.
  size_t memory = kUsualMemory;                  // Address space of each in MiB; 0 for no limit.
  daemon::Account account = kNobody;             // What workers of a superuser run as.
  std::chrono::milliseconds deadline{10000};     // For one file.
  std::chrono::milliseconds start_limit{10000};  // Until a new worker is ready.
  std::chrono::milliseconds wait_limit{4000};    // For one to come free.
  // A worker that has read so many files is replaced: libraries leak, and heaps crumble.
  size_t files_per_worker = 500;
};

// Any thread may call.
class Pool {
 public:
  struct Outcome {
    enum Kind {
      kReply,
      kNoWorker,  // None came free in time, or none could be started: no fault of the file.
      kKilled,    // By SIGKILL, which was not the daemon's. These four cost a worker.
      kDeadline,
      kMemory,
      kDied,
    };
    Kind kind;
    std::string text;  // The reply; otherwise what happened, for people.
  };

  explicit Pool(PoolOptions options);
  ~Pool();
  Pool(const Pool&) = delete;
  Pool& operator=(const Pool&) = delete;

  // Has a worker answer the request about the file, with `new_worker` one that has read no other.
  Outcome Run(const std::string& request, int file, bool new_worker);

  // Cuts all files in work short, and refuses others: kNoWorker.
  void Stop();

  // How many there are at present, and how many were lost while they read a file.
  size_t Workers();
  size_t Deaths();

 private:
  class Worker;

  std::unique_ptr<Worker> Take(bool new_worker, Outcome& refusal);
  std::unique_ptr<Worker> TakeIdle(bool new_worker) KAVO_REQUIRES(mutex_);
  void GiveBack(std::unique_ptr<Worker> worker);

  const PoolOptions options_;
  kavo::local::Mutex mutex_;
  kavo::local::Condition came_free_;
  std::vector<std::unique_ptr<Worker>> idle_ KAVO_GUARDED_BY(mutex_);
  std::set<int> busy_ KAVO_GUARDED_BY(mutex_);  // The sockets of workers that read.
  size_t taken_ KAVO_GUARDED_BY(mutex_) = 0;
  bool stopping_ KAVO_GUARDED_BY(mutex_) = false;
  size_t deaths_ KAVO_GUARDED_BY(mutex_) = 0;
};

}  // namespace vexlo::extractd

#endif  // DAEMONS_KAVOCONTENTEXTRACTD_POOL_H_
