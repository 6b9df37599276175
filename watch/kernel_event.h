// What the kernel reports, turned into changes: moves paired, order kept. No I/O and no clock.
#ifndef WATCH_KERNEL_EVENT_H_
#define WATCH_KERNEL_EVENT_H_

#include <chrono>
#include <cstdint>
#include <deque>
#include <optional>
#include <string>
#include <unordered_map>

namespace vexlo::watch {

using TimePoint = std::chrono::steady_clock::time_point;

// One inotify event. `name` is empty for an event about the watched folder itself.
struct KernelEvent {
  int wd = -1;
  uint32_t mask = 0;
  uint32_t cookie = 0;
  std::string name;
};

enum class ChangeKind {
  kCreated,  // Made, or moved in from where nobody watches.
  kWritten,
  kAttributes,
  kDeleted,  // Removed, or moved to where nobody watches.
  kRenamed,
  // About the watched folder itself; `name` is empty.
  kSelfAttributes,
  kSelfDeleted,
  kSelfMoved,
  kUnmounted,
  kUnwatched,  // The last event of this wd: the kernel has dropped the watch.
  kOverflow,   // Events were lost; there is no wd.
};

struct Change {
  ChangeKind kind = ChangeKind::kOverflow;
  bool is_dir = false;
  int wd = -1;  // For kRenamed, the folder it is in now.
  std::string name;
  int wd_old = -1;  // For kRenamed, where it was before.
  std::string name_old;
  // A rename that is the very reverse of one shortly before it, or a delete of what was created
  // just before it. The kernel reports an exchange of two names as two moves, the second of which
  // seems to undo the first although a thing stands at either name; where one name is not watched,
  // as a create and a delete. What others do may fall between two moves.
  bool reverses = false;
};

// Takes kernel events and gives changes in the order in which the kernel reported them. A move
// comes as two halves with one cookie, which two reads may separate: a first half waits up to
// `move_wait` for its second, and all that was reported behind it waits with it, since an outcome
// may depend on the order (a folder that moves and what is then made in it).
class ChangeQueue {
 public:
  explicit ChangeQueue(std::chrono::milliseconds move_wait) : move_wait_(move_wait) {}

  void Push(KernelEvent event, TimePoint now);

  // The next change, or none until more is pushed or NextDeadline() has come.
  std::optional<Change> Next(TimePoint now);

  // When a waiting half is given up.
  std::optional<TimePoint> NextDeadline() const;

  size_t size() const { return waiting_.size(); }
  bool empty() const { return waiting_.empty(); }

 private:
  struct Waiting {
    Change change;
    uint32_t cookie = 0;  // Non-zero: a first half without its second, given up at `deadline`.
    TimePoint deadline;
  };

  const std::chrono::milliseconds move_wait_;
  std::deque<Waiting> waiting_;
  uint64_t taken_ = 0;  // How many have left `waiting_`.
  // First halves in `waiting_` by cookie; the value less `taken_` is the index.
  std::unordered_map<uint32_t, uint64_t> halves_;
  Change last_;                 // The one before, less kSelfMoved.
  std::deque<Change> renames_;  // The last few.
};

}  // namespace vexlo::watch

#endif  // WATCH_KERNEL_EVENT_H_
