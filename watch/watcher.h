// Watches folders and everything below them, and reports what changes as queue events.
#ifndef WATCH_WATCHER_H_
#define WATCH_WATCHER_H_

#include <chrono>
#include <cstddef>
#include <cstdint>
#include <functional>
#include <optional>
#include <set>
#include <stop_token>
#include <string>
#include <string_view>
#include <unordered_map>
#include <unordered_set>
#include <vector>

#include "watch/directory.h"
#include "watch/folder_hints.h"
#include "watch/folder_tree.h"
#include "watch/kernel_event.h"
#include "watch/queue_line.h"

namespace vexlo::watch {

struct WatchOptions {
  // The most folders to watch; 0 for as many as the system allows. Reaching it is the same as
  // reaching the system's own limit.
  size_t max_watches = 0;
  // How often folders that could not be watched are looked at, and whether the roots still stand.
  std::chrono::milliseconds rescan_interval{std::chrono::seconds(30)};
  // How long a file that moved away is waited for at its new place.
  std::chrono::milliseconds move_wait{50};
  // Full paths that are never reported: the files that the caller writes the events into.
  std::vector<std::string> ignored = {};
  // Names: what is called so, at any depth below a root, is neither watched nor reported. A root
  // itself may lie in such a thing.
  std::vector<std::string> ignored_names = {"@eaDir"};
  // Take a root that does not stand at the start for one that is gone, instead of throwing.
  bool takes_missing_roots = false;
  // Look also while all is live, every `rescan_interval`, whether the roots still stand: no event
  // tells of a mount over one or below it, or of a move of a folder above. Without it there is no
  // deadline at rest, and the caller calls CheckRoots() when it learns of such things.
  bool polls_roots = true;
  // Hear of changes in folders that could not be watched by a mark on their file system, where that
  // is permitted, and look at them then. Each event there, of whatever folder, wakes the caller.
  bool takes_hints = false;
  // Ends a walk under way when it is asked to stop. Of no use from then on, the watcher is only to
  // be destroyed.
  std::stop_token stop = {};
};

struct WatchState {
  bool live = true;       // Every readable folder is watched and every root stands; else degraded.
  std::string text;       // For people; empty when there is nothing to say.
  size_t watched = 0;     // Folders that the kernel tells about.
  size_t unwatched = 0;   // Folders that are looked at every `rescan_interval` instead.
  size_t unreadable = 0;  // Folders that could not be read; tried again as often or sooner.
  std::vector<std::string> gone;  // Roots that do not stand at the moment.
};

// - Symbolic links are reported as files and never followed. What is named as `ignored_names` has
//   it, and what is below, is neither watched nor reported. Mount points are crossed.
// - An event has one bit. A rename has both paths; what is moved in from outside is a create, what
//   is moved out a delete. Order is the kernel's.
// - A folder that appears is watched and then read, and what is in it reported as created, so a
//   create may be reported twice but not be missed.
// - Where the watcher cannot tell what happened (a folder that is not watched has changed, names
//   were exchanged, a file system was unmounted) it reports kMaskReindex for the folder; when the
//   kernel has lost events, kMaskCrashed for every root. Both come when watches are in place, so
//   whoever reads the folder afterwards misses nothing.
// - A root that is deleted, moved or covered by a mount is reported as deleted, once, and as
//   created when a folder stands at its path again, which is looked for every `rescan_interval`.
//
// Folders that exceed the system's or the caller's limit of watches are read every
// `rescan_interval`, or soon after a hint, and compared with what they held, by a hash of 8 bytes:
// slow, but never silent.
// See FolderTree on memory. Not for concurrent use; has no thread of its own.
class Watcher {
 public:
  // Called from Poll(), AddRoot() and CheckRoots() only. It must not throw and not call back.
  using Sink = std::function<void(QueueEvent&&)>;

  // Watches what is below `roots`, absolute paths without "." or ".." and without a slash at the
  // end (other than "/"). What is there already is not reported. A root below another one is
  // reported by it, unless a link leads there. Blocks until all folders are read. Throws Error 120
  // for a root that is no such path, 502 for one that cannot be opened as a folder (a symbolic link
  // is none) unless `takes_missing_roots`, 502 when the kernel has no more inotify instances or
  // descriptors.
  Watcher(const std::vector<std::string>& roots, WatchOptions options, Sink sink, TimePoint now);
  ~Watcher() = default;
  Watcher(const Watcher&) = delete;
  Watcher& operator=(const Watcher&) = delete;

  // Readable when there is something for Poll() to read. The watcher's own, for poll() and alike.
  int fd() const { return fd_.Get(); }
  // One more of this kind, with takes_hints; -1 while there is none.
  int HintsFd() const { return hints_ ? hints_->fd() : -1; }

  // Reads what the kernel has and does what is due; never waits for anything. To be called when
  // fd() is readable and when NextDeadline() has come. Nothing thrown: what cannot be done shows in
  // State().
  void Poll(TimePoint now);

  TimePoint NextDeadline() const;

  // Watches one more root, or one less, and nothing is missed of the others meanwhile. False, and
  // nothing has changed, for one that is there already or is not there, and for one that has others
  // below it. AddRoot() blocks and throws as the constructor does.
  bool AddRoot(const std::string& path, TimePoint now);
  bool RemoveRoot(const std::string& path);

  // Looks at once which roots stand and what is mounted below them, as Poll() does every
  // `rescan_interval`.
  void CheckRoots(TimePoint now);

  WatchState State() const;

 private:
  struct Root {
    std::string path;
    FolderId folder = kNoFolder;  // kNoFolder while it is gone.
    bool covered = false;         // Below another root: only its name counts, when events are lost.
  };
  struct Visit {
    FolderId parent;  // kNoFolder for a root, whose name is its path.
    std::string name;
    bool announced = false;  // Has been reported by whoever asked for the visit.
  };
  struct VisitMode {
    bool report = false;  // Report what is found as created.
    bool deep = false;    // Also enter folders that are known and watched.
  };
  enum class Standing { kNothing, kFile, kFolder, kUnreachable };
  class Chain;
  // What Walk() found at a place.
  struct Entered {
    FolderId folder = kNoFolder;
    Fd fd;                           // Open when the folder is to be read.
    bool appeared = false;           // Was not known at this place.
    bool replaced = false;           // Another folder was known at this place.
    std::optional<uint64_t> before;  // The hash of an unwatched folder at the last look.
  };

  void Pull();
  FolderId FolderOf(int wd) const;
  void Apply(const Change& change);
  void ApplyToSelf(const Change& change, FolderId folder);
  void ApplyToEntry(const Change& change, FolderId parent);
  void ApplyRecreated(FolderId parent, const std::string& name);
  void ApplyRenamed(const Change& change);
  void ReportExchanged(FolderId from, FolderId to, const Change& change);
  void ApplyFolderRenamed(FolderId from, FolderId to, const Change& change);
  void ApplyOverflow();

  // Visits the places and, below them, all folders that are new. True when another folder than the
  // known one stood at one of them.
  bool Walk(std::vector<Visit> visits, VisitMode mode);
  Entered Enter(const Visit& visit, int parent_fd, bool deep);
  Entered EnterUnopened(const Visit& visit, int parent_fd, bool deep, int error);
  FolderId PlaceHolder(const Visit& visit, FolderId known, int fd, int* wd);
  void List(FolderId folder, int fd, VisitMode mode, std::optional<uint64_t> before,
            std::vector<Visit>* visits);
  Fd OpenFolder(FolderId folder) const;
  int AddWatch(int fd);
  void Drop(FolderId folder);

  void Settle();
  bool Stands(const Root& root) const;
  Root* RootOf(FolderId folder);
  void RootGone(Root& root);
  void CheckRoots();
  void TakeHints();
  void CheckMounts();
  void CheckPath(const std::string& path) const;
  bool Covers(const std::string& root, const std::string& path) const;
  bool IsCovered(const std::string& path) const;
  bool CoversARoot(const std::string& path) const;
  bool IsAtRest() const;
  void Rescan();
  void LogChangedState();

  bool IsHidden(const std::string& path, std::string_view name) const;
  Standing WhatStands(FolderId parent, const std::string& name) const;
  std::string PathOf(FolderId parent, std::string_view name) const;
  void Emit(QueueMask mask, bool is_dir, std::string path, std::string path_old = {});

  const WatchOptions options_;
  const std::unordered_set<std::string> ignored_;
  const Sink sink_;
  const Fd fd_;
  TimePoint now_;
  bool drained_ = false;  // The last read found nothing more.
  std::vector<char> buffer_;
  ChangeQueue changes_;
  FolderTree tree_;
  std::vector<Root> roots_;
  bool root_ended_ = false;  // Since the last look, and its path may hold a folder again.
  // Watches that we removed and whose last event is still to come: until then their numbers mean
  // the old folder, even if the kernel gives them out anew.
  std::unordered_set<int> leaving_;
  std::unordered_map<FolderId, uint64_t> unwatched_;  // With the hash of what was in them.
  std::unordered_set<FolderId> unreadable_;
  // Folders that could not be reached where the events so far place them. The events to come tell
  // of the move; when all are read, these are looked at again.
  std::unordered_set<FolderId> unsettled_;
  std::optional<FolderHints> hints_;  // There while folders are not watched, if at all.
  std::unordered_set<FolderId> hinted_;
  TimePoint next_hinted_;         // When these are looked at.
  std::vector<FolderId> rescan_;  // What is left of the rescan under way.
  TimePoint next_rescan_;
  // When folders are tried again that could not be opened for want of something that may soon be
  // had: later each time, up to the interval.
  TimePoint next_retry_ = TimePoint::max();
  std::chrono::milliseconds retry_pause_{0};
  std::set<std::string> mounts_;      // As they were at the last look, before anything was opened.
  std::vector<std::string> changed_;  // Folders to report for a reindex when the walk is over.
  size_t removed_watches_ = 0;
  std::string logged_;  // The state that was logged last; empty before the first.
};

}  // namespace vexlo::watch

#endif  // WATCH_WATCHER_H_
