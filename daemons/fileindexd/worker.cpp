#include "daemons/fileindexd/worker.h"

#include <sys/stat.h>

#include <algorithm>
#include <ctime>
#include <exception>
#include <utility>

#include "common/check.h"
#include "common/error.h"
#include "common/file.h"
#include "common/sdk/share.h"
#include "daemons/common/log.h"
#include "daemons/fileindexd/consequence.h"
#include "daemons/fileindexd/cycle.h"
#include "daemons/fileindexd/documents.h"
#include "daemons/fileindexd/file_version.h"
#include "fileindex/elastic_control/share_index.h"
#include "fileindex/paths.h"
#include "fileindex/queue_mgr.h"
#include "fileindex/status_mgr.h"
#include "fileindex/util/notification.h"

namespace vexlo::fileindexd {
namespace {

using fileindex::StatusMgr;

using Clock = std::chrono::steady_clock;

constexpr std::chrono::seconds kSpaceWait{60};
constexpr std::chrono::seconds kShortestUnreadWait{1};
constexpr std::chrono::seconds kLongestUnreadWait{60};
constexpr uint64_t kUsualLineBytes = 100;
constexpr std::chrono::seconds kLongestPauseWait{60};
constexpr int kBothBits = fileindex::SS_NEED_REINDEX | fileindex::SS_NEED_REBUILD;

// The engine's answers that make creating or deleting what is there, or not there, no failure.
constexpr int kIndexMissing = 2002;
constexpr int kIndexExists = 2003;

template <typename Deed>
void Unless(int code, const Deed& deed) {
  try {
    deed();
  } catch (const Error& error) {
    if (error.GetErrorCode() != code) {
      throw;
    }
  }
}

uint64_t BytesOf(const std::string& file) {
  struct stat info {};
  return lstat(file.c_str(), &info) == 0 ? static_cast<uint64_t>(info.st_size) : 0;
}

// Tells one snapshot from the next, also after a restart.
std::string SnapshotName(const std::string& file) {
  struct stat info {};
  if (lstat(file.c_str(), &info) != 0) {
    return "none";
  }
  return std::to_string(info.st_ino) + "-" + std::to_string(info.st_size) + "-" +
         std::to_string(info.st_mtim.tv_sec) + "." + std::to_string(info.st_mtim.tv_nsec);
}

}  // namespace

void Pause::Reload() {
  const long in_file = StatusMgr().GetPauseInfo();
  if (in_file_.exchange(in_file) != in_file) {
    resume_time_ = in_file;
  }
}

bool Pause::IsOn() const {
  const long resume_time = resume_time_;
  return resume_time == 0 || resume_time > time(nullptr);
}

std::optional<long> Pause::End() const {
  const long resume_time = resume_time_;
  return IsOn() && resume_time != 0 ? std::optional(resume_time) : std::nullopt;
}

Worker::Worker(std::string share, Pause& pause, std::chrono::milliseconds coalescing)
    : share_(std::move(share)),
      pause_(pause),
      coalescing_(coalescing),
      has_ended_(ended_.get_future()) {
  thread_ = std::thread([this] {
    LowerPriority();
    Run();
    ended_.set_value();
  });
}

Worker::~Worker() {
  Stop();
  thread_.join();
}

void Worker::Kick() {
  kicked_ = true;
  watch_.Wake();
}

void Worker::KickSettled() {
  settled_ = true;
  Kick();
}

void Worker::Stop() {
  stopping_ = true;
  watch_.Wake();
}

bool Worker::AwaitEnd(Clock::time_point until) {
  return has_ended_.wait_until(until) == std::future_status::ready;
}

Json::Value Worker::Describe() const {
  std::string queue_path;
  {
    const kavo::local::MutexLock lock(queue_path_mutex_);
    queue_path = queue_path_;
  }
  Json::Value value = stats_.ToJson();
  value["share"] = share_;
  const uint64_t bytes = BytesOf(queue_path) + BytesOf(queue_path + ".tmp");
  value["queue"] = queue_path;
  value["queue_bytes"] = static_cast<Json::UInt64>(bytes);
  value["queue_lines"] = static_cast<Json::UInt64>((bytes + kUsualLineBytes - 1) / kUsualLineBytes);
  return value;
}

void Worker::Run() {
  state_ = LoadShareState(ShareStateFile(share_));
  while (!stopping_) {
    settings_are_settled_ = settled_.exchange(false) || settings_are_settled_;
    if (kicked_.exchange(false)) {
      wait_ = std::chrono::seconds(0);
      has_unread_ = true;  // To be asked of the engine, which may have lost the index.
    }
    const Outcome outcome = RunGuarded();
    if (!stopping_) {
      WaitAfter(outcome);
    }
  }
}

Worker::Outcome Worker::RunGuarded() {
  try {
    return RunCycle();
  } catch (const Interrupted&) {
    return pause_.IsOn() ? Outcome::kPaused : Outcome::kAgain;
  } catch (const Error& error) {
    return Judge(error.GetErrorCode(), error.what());
  } catch (const std::exception& error) {
    return Judge(ERR_INTERNAL, error.what());
  }
}

Worker::Outcome Worker::RunCycle() {
  const sdk::SDKShare share(share_);
  const std::string queue_path = share.GetQueuePath();
  {
    const kavo::local::MutexLock lock(queue_path_mutex_);
    queue_path_ = queue_path;
  }
  watch_.Watch(queue_path);
  pause_.Reload();
  if (pause_.IsOn()) {
    return Outcome::kPaused;
  }
  // The folder first: of one that is not there the platform cannot tell whether it is read-only.
  const bool is_there = IsDirExist(share.GetPath(), /*follow_link=*/false);
  if (!is_there || !share.CanBeIndexed()) {
    // It is asked again when its queue has a line; where it could not be looked at, by itself.
    wait_ = is_there || IsGone(share.GetPath()) ? std::chrono::seconds(0) : NextWait(wait_);
    return Outcome::kUnavailable;
  }
  watch_.Forget();
  stats_.SetState(WorkerState::kProcessing);
  const std::string status_version = FileVersion(fileindex::kFileIndexStatusCfgPath.Get());
  const bool fills = MakeIndexIfAsked();
  fileindex::QueueMgr queue(queue_path);
  // Until the cycle's end tells.
  const bool may_have_unread = std::exchange(has_unread_, true);
  const bool was_left = MayFileExist(queue_path + ".tmp");
  // Made when the snapshot has been taken: settings that were changed before a line was queued go
  // for it.
  std::optional<Cycle> made;
  const auto cycle = [&]() -> Cycle& {
    if (!made) {
      made.emplace(share_, share.GetPath(), SnapshotName(queue_path + ".tmp"), state_, stats_,
                   [this] { return IsInterrupted(); });
      made->LookAheadIn(queue_path, coalescing_);
    }
    return *made;
  };
  queue.ProcessOP([&](std::shared_ptr<fileindex::OP> op) { cycle().Handle(*op); },
                  /*use_tmp=*/true);
  if (fills) {
    cycle().ReconcileShare();
  } else {
    cycle().ReconcileNewFolders();
  }
  // With a snapshot from before, the queue is still to be taken.
  if (settings_are_settled_ && !was_left) {
    cycle().ReconcileOtherSettings();
  }
  const bool all_is_read = !may_have_unread || cycle().IndexUnread();
  cycle().Finish();
  has_unread_ = cycle().TakeHasUnread() || !all_is_read;
  unread_since_ =
      has_unread_ ? unread_since_.value_or(Clock::now()) : std::optional<Clock::time_point>();
  bool is_marked = false;
  if (fills) {
    StatusMgr status;
    is_marked = (status.GetShareStatus(share_) & kBothBits) != 0;
    // Who has saved the status meanwhile may have marked the share for something that was behind
    // the comparison already: there is one more, which is short.
    if (is_marked && FileVersion(fileindex::kFileIndexStatusCfgPath.Get()) == status_version) {
      status.UnsetShareStatus(share_, kBothBits);
      is_marked = false;
    }
    state_.rebuilt = is_marked && state_.rebuilt;
    SaveShareState(ShareStateFile(share_), state_);
  }
  settings_are_settled_ = settings_are_settled_ && was_left;
  queue.DeleteTmp();  // Also where its lines came down to nothing.
  wait_ = std::chrono::seconds(0);
  space_is_told_ = false;
  // Behind a snapshot that was there before, lines may wait of which nobody will tell any more.
  return was_left || is_marked ? Outcome::kAgain : Outcome::kDone;
}

// Whether everything is to be compared, in an index that may be new.
bool Worker::MakeIndexIfAsked() {
  const unsigned bits = StatusMgr().GetShareStatus(share_);
  if (index_is_missing_ || ((bits & fileindex::SS_NEED_REBUILD) != 0 && !state_.rebuilt)) {
    // Made anew once: a crawl that is cut short goes on in the new one.
    MakeIndex();
    index_is_missing_ = false;
    return true;
  }
  return (bits & kBothBits) != 0 || state_.rebuilt;
}

void Worker::MakeIndex() {
  daemon::Log(daemon::Level::kNotice, VEXLO_SOURCE, __LINE__, share_ + ": making the index anew");
  Unless(kIndexMissing, [this] { fileindex::elastic::ShareIndexDelete(share_); });
  Unless(kIndexExists, [this] { fileindex::elastic::ShareIndexCreate(share_); });
  state_ = ShareState();
  state_.rebuilt = true;
  SaveShareState(ShareStateFile(share_), state_);
}

Worker::Outcome Worker::Judge(int code, const std::string& reason) {
  stats_.CountError(code, reason);
  switch (OfCycle(code)) {
    case Consequence::kUnavailable:
      if (wait_.count() == 0) {
        daemon::Log(daemon::Level::kWarning, VEXLO_SOURCE, __LINE__,
                    share_ + ": waiting for the share, reason=" + reason);
      }
      wait_ = NextWait(wait_);
      return Outcome::kUnavailable;
    case Consequence::kNoSpace:
      if (!std::exchange(space_is_told_, true)) {
        daemon::Log(daemon::Level::kWarning, VEXLO_SOURCE, __LINE__,
                    share_ + ": waiting for space, reason=" + reason);
        fileindex::SendQPXNotify();
      }
      return Outcome::kNoSpace;
    case Consequence::kRebuild:
      index_is_missing_ = true;
      if (wait_.count() == 0) {
        wait_ = NextWait(wait_);  // For the next time, should a new one be no better.
        return Outcome::kAgain;
      }
      break;
    case Consequence::kGoOn:
    case Consequence::kRetry:
      break;
  }
  wait_ = NextWait(wait_);
  daemon::Log(daemon::Level::kWarning, VEXLO_SOURCE, __LINE__,
              share_ + ": trying again in " + std::to_string(wait_.count()) +
                  " s, code=" + std::to_string(code) + ", reason=" + reason);
  return Outcome::kRetry;
}

// Returns when there is reason for another cycle.
void Worker::WaitAfter(Outcome outcome) {
  const auto in = [](auto duration) { return std::optional(Clock::now() + duration); };
  const auto is_called = [this] { return stopping_ || kicked_; };
  switch (outcome) {
    case Outcome::kDone:
      stats_.SetState(WorkerState::kIdle);
      // Whoever reads contents says nothing when he is back. As long again as it has lasted so far,
      // however many cycles there were meanwhile.
      AwaitLine(unread_since_
                    ? in(std::clamp<Clock::duration>(Clock::now() - *unread_since_,
                                                     kShortestUnreadWait, kLongestUnreadWait))
                    : std::nullopt);
      return;
    case Outcome::kUnavailable:
      stats_.SetState(WorkerState::kUnavailable);
      // A line in the queue of a share that was away tells that it is back. Where nothing could be
      // asked of the share, its queue may not be watched, so it is tried again.
      AwaitLine(wait_.count() > 0 ? in(wait_) : std::nullopt);
      return;
    case Outcome::kPaused: {
      stats_.SetState(WorkerState::kPaused);
      while (!is_called() && pause_.IsOn()) {
        std::optional<Clock::time_point> until;
        if (const auto end = pause_.End()) {
          // The clock of the pause may be set, and goes on while the machine sleeps.
          const long left = std::clamp<long>(*end - time(nullptr), 0, kLongestPauseWait.count());
          until = Clock::now() + std::chrono::seconds(left);
        }
        watch_.Wait(until, /*for_queue=*/false);
      }
      return;
    }
    case Outcome::kAgain:
      return;
    case Outcome::kRetry:
      stats_.SetState(WorkerState::kFailing);
      if (!is_called()) {
        watch_.Wait(in(wait_), /*for_queue=*/false);
      }
      return;
    case Outcome::kNoSpace:
      stats_.SetState(WorkerState::kFailing);
      do {
        if (!is_called()) {
          watch_.Wait(in(kSpaceWait), /*for_queue=*/false);
        }
      } while (!is_called() && !HasSpace());
      return;
  }
}

void Worker::AwaitLine(std::optional<Clock::time_point> until) {
  while (!stopping_ && !kicked_ && (!until || Clock::now() < *until)) {
    if (watch_.Wait(until, /*for_queue=*/true)) {
      watch_.Wait(Clock::now() + coalescing_, /*for_queue=*/false);
      return;
    }
  }
}

bool Worker::IsInterrupted() const { return stopping_ || pause_.IsOn(); }

bool Worker::HasSpace() const {
  try {
    return sdk::SDKShare(share_).IsSpaceEnough();
  } catch (const Error&) {
    return true;  // The next cycle finds out what is wrong.
  }
}

}  // namespace vexlo::fileindexd
