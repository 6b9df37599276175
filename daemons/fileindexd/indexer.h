// Documents on their way to the engine, several at a time.
#ifndef DAEMONS_FILEINDEXD_INDEXER_H_
#define DAEMONS_FILEINDEXD_INDEXER_H_

#include <cstddef>
#include <deque>
#include <exception>
#include <functional>
#include <string>
#include <thread>
#include <unordered_set>
#include <vector>

#include "daemons/fileindexd/stats.h"
#include "kavo/local/mutex.h"

namespace vexlo::fileindexd {

// Thrown where work ends early because the daemon stops or a pause began. No failure.
struct Interrupted {};

// Makes this thread give way to everybody else, for the processor and for the disk.
void LowerPriority();

// A few threads that extract and send, so that the disk and the engine are both at work. Each sends
// what it has gathered as one request when it is enough, or when nothing waits any more.
//
// A path is in work once at a time. What has to come behind an upsert, of the same path or of one
// above it, waits for Drain().
class Indexer {
 public:
  // `is_interrupted` is asked on every thread; `stats` outlives the indexer.
  Indexer(std::string id, Stats& stats, std::function<bool()> is_interrupted);
  // Drops what still waits, and waits for requests that are under way.
  ~Indexer();
  Indexer(const Indexer&) = delete;
  Indexer& operator=(const Indexer&) = delete;

  // Takes a path to be indexed; waits while many do already. Throws as Drain() does, for paths that
  // were taken before.
  void Upsert(const std::string& path, bool content);

  // Returns when everything that was taken has been answered. A document that fails alone is
  // logged and counted. Throws Interrupted, and Error for what stopped the rest, which is dropped.
  void Drain();

  // Paths that were taken and not answered yet.
  size_t InWork();

  // Paths that were gone when their turn came, since the last call.
  std::vector<std::string> TakeGone();

  // Whether something could not be read, as nobody was there to do it, since the last call.
  bool TakeHasUnread();

  // Whether anything was taken since the last call.
  bool TakeWasUsed();

 private:
  struct Job {
    std::string path;
    bool content;
  };
  struct Batch;

  void End();
  void Work();
  bool TakeJob(bool may_wait, Job* job);
  Json::Value MakePutTwice(const Job& job) const;
  void Extract(const Job& job, Batch* batch);
  void Send(Batch* batch);
  void Finish(const std::vector<std::string>& paths);
  // Ends everything with `failure`, unless something ended it before.
  void Fail(std::exception_ptr failure);
  void ThrowFailure() KAVO_REQUIRES(mutex_);

  const std::string id_;
  Stats& stats_;
  const std::function<bool()> is_interrupted_;

  kavo::local::Mutex mutex_;
  kavo::local::Condition changed_;
  std::deque<Job> waiting_ KAVO_GUARDED_BY(mutex_);
  std::unordered_set<std::string> in_work_
      KAVO_GUARDED_BY(mutex_);  // Taken and not answered, those that wait among them.
  std::exception_ptr failure_ KAVO_GUARDED_BY(mutex_);
  std::vector<std::string> gone_ KAVO_GUARDED_BY(mutex_);
  bool has_unread_ KAVO_GUARDED_BY(mutex_) = false;
  bool was_used_ KAVO_GUARDED_BY(mutex_) = false;
  bool ending_ KAVO_GUARDED_BY(mutex_) = false;

  std::vector<std::thread> threads_;  // Last: they use the others.
};

}  // namespace vexlo::fileindexd

#endif  // DAEMONS_FILEINDEXD_INDEXER_H_
