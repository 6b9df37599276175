#include "daemons/fileindexd/stats.h"

namespace vexlo::fileindexd {
namespace {

constexpr const char* kStateNames[] = {"idle",   "processing",  "crawling",
                                       "paused", "unavailable", "failing"};

bool IsAtWork(WorkerState state) {
  return state == WorkerState::kProcessing || state == WorkerState::kCrawling;
}

Json::Value Counts(const std::map<int, uint64_t>& counts) {
  Json::Value value(Json::objectValue);
  for (const auto& [number, count] : counts) {
    value[std::to_string(number)] = static_cast<Json::UInt64>(count);
  }
  return value;
}

}  // namespace

void Stats::SetState(WorkerState state) {
  const kavo::local::MutexLock lock(mutex_);
  if (IsAtWork(state) && !IsAtWork(state_)) {
    began_ = Clock::now();
    files_before_ = files_;
  }
  state_ = state;
}

void Stats::CountOperation(fileindex::FileIndexOP kind) {
  const kavo::local::MutexLock lock(mutex_);
  ++operations_;
  ++kinds_[kind];
}

void Stats::CountFiles(uint64_t count) {
  const kavo::local::MutexLock lock(mutex_);
  files_ += count;
}

void Stats::CountError(int code, const std::string& reason) {
  const kavo::local::MutexLock lock(mutex_);
  ++errors_[code];
  last_error_ = reason;
}

void Stats::SetProgress(uint64_t done, uint64_t found) {
  const kavo::local::MutexLock lock(mutex_);
  done_ = done;
  found_ = found;
}

Json::Value Stats::ToJson() const {
  const kavo::local::MutexLock lock(mutex_);
  Json::Value value(Json::objectValue);
  value["state"] = kStateNames[static_cast<size_t>(state_)];
  value["operations"] = static_cast<Json::UInt64>(operations_);
  value["kinds"] = Counts(kinds_);
  value["files"] = static_cast<Json::UInt64>(files_);
  const std::chrono::duration<double> seconds = Clock::now() - began_;
  const bool has_rate = IsAtWork(state_) && seconds.count() > 0;
  value["rate"] = has_rate ? static_cast<double>(files_ - files_before_) / seconds.count() : 0.0;
  value["errors"] = Counts(errors_);
  value["last_error"] = last_error_;
  value["progress"]["done"] = static_cast<Json::UInt64>(done_);
  value["progress"]["found"] = static_cast<Json::UInt64>(found_);
  return value;
}

}  // namespace vexlo::fileindexd
