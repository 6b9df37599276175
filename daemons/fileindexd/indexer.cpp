#include "daemons/fileindexd/indexer.h"

#include <sys/resource.h>
#include <sys/syscall.h>
#include <unistd.h>

#include <utility>

#include "common/check.h"
#include "common/error.h"
#include "common/json.h"
#include "daemons/fileindexd/consequence.h"
#include "daemons/fileindexd/documents.h"

namespace vexlo::fileindexd {
namespace {

constexpr size_t kThreads = 3;
constexpr size_t kMostWaiting = 256;
constexpr Json::ArrayIndex kMostInRequest = 64;
// Of text; what else is in a document is small.
constexpr size_t kEnoughBytes = size_t{1} << 20;
constexpr int kNice = 10;

// As in <linux/ioprio.h>, of which some versions are no C++.
constexpr int kThread = 1;
constexpr int kBestEffort = 2 << 13;
constexpr int kLowestOfBestEffort = 7;

size_t TextBytes(const Json::Value& item) {
  const Json::Value& fields = item["data"]["data"];
  size_t bytes = 0;
  for (const Json::Value& value : fields) {
    const char* begin = nullptr;
    const char* end = nullptr;
    if (value.isString() && value.getString(&begin, &end)) {
      bytes += static_cast<size_t>(end - begin);
    }
  }
  return bytes;
}

}  // namespace

void LowerPriority() {
  // Both are a thread's own on Linux. Where they are refused the work is done all the same.
  const auto thread = static_cast<id_t>(gettid());
  setpriority(PRIO_PROCESS, thread, kNice);
  syscall(SYS_ioprio_set, kThread, 0, kBestEffort | kLowestOfBestEffort);
}

struct Indexer::Batch {
  Json::Value requests = Json::Value(Json::arrayValue);
  std::vector<std::string> paths;
  size_t bytes = 0;
};

Indexer::Indexer(std::string id, Stats& stats, std::function<bool()> is_interrupted)
    : id_(std::move(id)), stats_(stats), is_interrupted_(std::move(is_interrupted)) {
  threads_.reserve(kThreads);
  try {
    for (size_t i = 0; i < kThreads; ++i) {
      threads_.emplace_back([this] {
        try {
          Work();
        } catch (...) {  // There is no memory even to begin.
          Fail(std::current_exception());
        }
      });
    }
  } catch (...) {
    End();
    throw;
  }
}

Indexer::~Indexer() { End(); }

void Indexer::End() {
  {
    const kavo::local::MutexLock lock(mutex_);
    ending_ = true;
  }
  changed_.NotifyAll();
  for (std::thread& thread : threads_) {
    thread.join();
  }
}

void Indexer::Upsert(const std::string& path, bool content) {
  kavo::local::MutexLock lock(mutex_);
  // The same file twice at a time might end with the older of two readings.
  changed_.Wait(lock, [&]() KAVO_REQUIRES(mutex_) {
    return failure_ != nullptr || (waiting_.size() < kMostWaiting && !in_work_.contains(path));
  });
  ThrowFailure();
  was_used_ = true;
  in_work_.insert(path);
  waiting_.push_back({path, content});
  lock.Unlock();
  changed_.NotifyAll();
}

void Indexer::Drain() {
  kavo::local::MutexLock lock(mutex_);
  changed_.Wait(lock,
                [this]() KAVO_REQUIRES(mutex_) { return failure_ != nullptr || in_work_.empty(); });
  ThrowFailure();
}

size_t Indexer::InWork() {
  const kavo::local::MutexLock lock(mutex_);
  return in_work_.size();
}

std::vector<std::string> Indexer::TakeGone() {
  const kavo::local::MutexLock lock(mutex_);
  return std::exchange(gone_, {});
}

bool Indexer::TakeHasUnread() {
  const kavo::local::MutexLock lock(mutex_);
  return std::exchange(has_unread_, false);
}

bool Indexer::TakeWasUsed() {
  const kavo::local::MutexLock lock(mutex_);
  return std::exchange(was_used_, false);
}

void Indexer::ThrowFailure() {
  if (failure_ != nullptr) {
    std::rethrow_exception(failure_);
  }
}

void Indexer::Fail(std::exception_ptr failure) {
  {
    const kavo::local::MutexLock lock(mutex_);
    if (failure_ == nullptr) {
      failure_ = std::move(failure);
    }
    waiting_.clear();
  }
  changed_.NotifyAll();
}

void Indexer::Work() {
  LowerPriority();
  Batch batch;
  Job job;
  for (;;) {
    const bool has_job = TakeJob(/*may_wait=*/batch.paths.empty(), &job);
    if (!has_job && batch.paths.empty()) {
      return;
    }
    try {
      if (is_interrupted_()) {
        throw Interrupted{};
      }
      if (has_job) {
        Extract(job, &batch);
      }
      if (!has_job || batch.bytes >= kEnoughBytes || batch.requests.size() >= kMostInRequest) {
        Send(&batch);
      }
    } catch (...) {
      Fail(std::current_exception());
      batch.requests.clear();
    }
    // What was sent is answered, and what a failure left will not be.
    if (batch.requests.empty()) {
      Finish(std::exchange(batch.paths, {}));
    }
  }
}

bool Indexer::TakeJob(bool may_wait, Job* job) {
  kavo::local::MutexLock lock(mutex_);
  if (may_wait) {
    changed_.Wait(lock, [this]() KAVO_REQUIRES(mutex_) { return ending_ || !waiting_.empty(); });
  }
  if (waiting_.empty() || ending_) {
    return false;
  }
  *job = std::move(waiting_.front());
  waiting_.pop_front();
  return true;
}

Json::Value Indexer::MakePutTwice(const Job& job) const {
  try {
    return MakePut(id_, job.path, job.content);
  } catch (const Error& error) {
    if (error.GetErrorCode() != ERR_SYSTEM) {
      throw;
    }
  }
  return MakePut(id_, job.path, job.content);
}

void Indexer::Extract(const Job& job, Batch* batch) {
  batch->paths.push_back(job.path);
  try {
    Json::Value item = MakePutTwice(job);
    if (IsDelete(item)) {
      const kavo::local::MutexLock lock(mutex_);
      gone_.push_back(job.path);
    } else if (IsUnread(item)) {
      const kavo::local::MutexLock lock(mutex_);
      has_unread_ = true;
    }
    batch->bytes += TextBytes(item);
    batch->requests.append(std::move(item));
  } catch (const Error& error) {
    stats_.CountError(error.GetErrorCode(), error.what());
  }
}

void Indexer::Send(Batch* batch) {
  Json::Value requests = std::exchange(batch->requests, Json::Value(Json::arrayValue));
  batch->bytes = 0;
  if (requests.empty()) {
    return;
  }
  const uint64_t count = requests.size();
  const std::vector<FailedItem> failed = SendList(std::move(requests));
  stats_.CountFiles(count - failed.size());
  for (const FailedItem& item : failed) {
    stats_.CountError(item.code, item.reason);
    if (OfOperation(item.code) != Consequence::kGoOn) {
      throw Error(static_cast<ErrorCode>(item.code), item.reason);
    }
  }
}

void Indexer::Finish(const std::vector<std::string>& paths) {
  {
    const kavo::local::MutexLock lock(mutex_);
    for (const std::string& path : paths) {
      in_work_.erase(path);
    }
  }
  changed_.NotifyAll();
}

}  // namespace vexlo::fileindexd
