#include "watch/kernel_event.h"

#include <sys/inotify.h>

#include <algorithm>
#include <utility>

namespace vexlo::watch {
namespace {

constexpr size_t kRenamesKept = 8;

std::optional<ChangeKind> KindOf(const KernelEvent& event) {
  struct Translation {
    uint32_t mask;
    ChangeKind of_entry;
    ChangeKind of_self;
  };
  static constexpr Translation kTranslations[] = {
      {IN_CREATE, ChangeKind::kCreated, ChangeKind::kCreated},
      {IN_MOVED_TO, ChangeKind::kCreated, ChangeKind::kCreated},
      {IN_DELETE, ChangeKind::kDeleted, ChangeKind::kDeleted},
      {IN_MOVED_FROM, ChangeKind::kDeleted, ChangeKind::kDeleted},
      {IN_CLOSE_WRITE, ChangeKind::kWritten, ChangeKind::kWritten},
      {IN_ATTRIB, ChangeKind::kAttributes, ChangeKind::kSelfAttributes},
      {IN_DELETE_SELF, ChangeKind::kSelfDeleted, ChangeKind::kSelfDeleted},
      {IN_MOVE_SELF, ChangeKind::kSelfMoved, ChangeKind::kSelfMoved},
      {IN_UNMOUNT, ChangeKind::kUnmounted, ChangeKind::kUnmounted},
      {IN_IGNORED, ChangeKind::kUnwatched, ChangeKind::kUnwatched},
      {IN_Q_OVERFLOW, ChangeKind::kOverflow, ChangeKind::kOverflow},
  };
  for (const Translation& translation : kTranslations) {
    if ((event.mask & translation.mask) != 0) {
      return event.name.empty() ? translation.of_self : translation.of_entry;
    }
  }
  return std::nullopt;
}

}  // namespace

void ChangeQueue::Push(KernelEvent event, TimePoint now) {
  const std::optional<ChangeKind> kind = KindOf(event);
  if (!kind) {
    return;
  }
  if ((event.mask & IN_MOVED_TO) != 0) {
    if (const auto half = halves_.find(event.cookie); half != halves_.end()) {
      Waiting& waiting = waiting_[half->second - taken_];
      Change& change = waiting.change;
      change.kind = ChangeKind::kRenamed;
      change.wd_old = std::exchange(change.wd, event.wd);
      change.name_old = std::exchange(change.name, std::move(event.name));
      waiting.cookie = 0;
      halves_.erase(half);
      return;
    }
  }
  Waiting waiting;
  waiting.change.kind = *kind;
  waiting.change.is_dir = (event.mask & IN_ISDIR) != 0;
  waiting.change.wd = event.wd;
  waiting.change.name = std::move(event.name);
  if ((event.mask & IN_MOVED_FROM) != 0 && event.cookie != 0) {
    waiting.cookie = event.cookie;
    waiting.deadline = now + move_wait_;
    halves_[event.cookie] = taken_ + waiting_.size();
  }
  waiting_.push_back(std::move(waiting));
}

std::optional<Change> ChangeQueue::Next(TimePoint now) {
  if (waiting_.empty()) {
    return std::nullopt;
  }
  Waiting& front = waiting_.front();
  if (front.cookie != 0) {
    if (now < front.deadline) {
      return std::nullopt;
    }
    halves_.erase(front.cookie);
  }
  Change change = std::move(front.change);
  waiting_.pop_front();
  ++taken_;
  if (change.kind == ChangeKind::kRenamed) {
    change.reverses =
        std::any_of(renames_.begin(), renames_.end(), [&change](const Change& before) {
          return change.wd == before.wd_old && change.name == before.name_old &&
                 change.wd_old == before.wd && change.name_old == before.name;
        });
    renames_.push_back(change);
    if (renames_.size() > kRenamesKept) {
      renames_.pop_front();
    }
  } else if (change.kind == ChangeKind::kDeleted) {
    change.reverses =
        last_.kind == ChangeKind::kCreated && change.wd == last_.wd && change.name == last_.name;
  }
  if (change.kind != ChangeKind::kSelfMoved) {  // Which stands between the two for folders.
    last_ = change;
  }
  return change;
}

std::optional<TimePoint> ChangeQueue::NextDeadline() const {
  if (waiting_.empty()) {
    return std::nullopt;
  }
  return waiting_.front().cookie != 0 ? waiting_.front().deadline : TimePoint::min();
}

}  // namespace vexlo::watch
