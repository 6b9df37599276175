// Feeds one queue file with what happens in the folders that are registered for it.
#ifndef DAEMONS_EVNOTIFYD_FEEDER_H_
#define DAEMONS_EVNOTIFYD_FEEDER_H_

#include <chrono>
#include <cstdint>
#include <map>
#include <memory>
#include <set>
#include <stop_token>
#include <string>
#include <vector>

#include "daemons/evnotifyd/backlog.h"
#include "kavo/local/monitor_queues.h"
#include "watch/watcher.h"

namespace vexlo::evnotifyd {

using Clock = std::chrono::steady_clock;
using watch::TimePoint;

struct FeederOptions {
  size_t max_watches = 0;  // For each queue; 0 for as many as the system allows.
  // How often what cannot be watched is looked at.
  std::chrono::milliseconds rescan{std::chrono::seconds(300)};
  size_t backlog_bytes = size_t{16} << 20;  // See Backlog.
};

struct QueueStats {
  std::string queue;
  std::vector<std::string> roots;
  size_t watches = 0;
  bool live = false;
  std::string reason;      // Why it is not live, for people; empty when it is.
  uint64_t lines = 0;      // Appended so far.
  uint64_t overflows = 0;  // Of these, lines of kMaskCrashed.
};

// - A folder that begins to be watched (at first, or when it is back) is told of by one
//   kMaskReindex line, behind which nothing is missed: the watches stand when it is written.
// - Of an event, the bits that the folder's mask wants are told. kMaskCrashed and kMaskReindex are
//   told whatever it wants. Where it wants no renames, a rename is a delete and a create.
// - Folders with the same list of ignored names share a Watcher. Where folders with different lists
//   lie one in the other, each path is told of by the Watcher of the innermost one.
// - A change of the registration leaves alone what it does not touch; only a folder that comes or
//   goes above others makes their Watcher start anew, and then each of its folders gets a reindex.
// - Lines that cannot be appended wait, and are tried again after 10 ms, then ever later, up to a
//   second.
//
// Not for concurrent use; has no thread of its own.
class Feeder {
 public:
  Feeder(std::string queue, const FeederOptions& options, std::stop_token stop);

  // Watches these folders from now on and no others. Blocks until new ones are read; returns early
  // when the stop token asks for it.
  void SetFolders(const std::vector<kavo::local::MonitoredFolder>& folders, TimePoint now);

  // Looks which folders stand. To be called when mounts or what leads to the folders have changed.
  void CheckRoots(TimePoint now);

  // Takes what the kernel has and appends; does what is due. To be called when one of Fds() is
  // readable and when NextDeadline() has come.
  void Poll(TimePoint now);

  // Takes and appends what there is for the last time; gives up, and says so in the log, when the
  // queue cannot be written for `patience`.
  void Finish(std::chrono::milliseconds patience);

  // Change with SetFolders() and Poll().
  std::vector<int> Fds() const;
  TimePoint NextDeadline() const;
  QueueStats Stats() const;

 private:
  using Names = std::set<std::string>;
  struct Folder {
    std::string path;
    uint32_t mask;
    Names ignored;
  };
  struct Group {
    std::set<std::string> roots;
    std::unique_ptr<watch::Watcher> watcher;  // None when it could not be made:
    std::string fault;                        // why,
    TimePoint retry;                          // and when to try again.
  };

  void Start(const Names& ignored, Group& group);  // Both as they stand in groups_.
  bool Adjust(Group& group, const std::set<std::string>& roots);
  void ReindexStanding(const Group& group, const std::vector<std::string>& roots);
  void PollWatchers(TimePoint now);
  void Take(const Names& ignored, watch::QueueEvent&& event);
  void Add(const watch::QueueEvent& event);
  void Append();
  uint32_t MaskOf(const Names& ignored, const std::string& path) const;

  const std::string queue_;
  const FeederOptions options_;
  const std::stop_token stop_;
  TimePoint now_;
  std::map<Names, Group> groups_;
  std::vector<Folder> folders_;  // Inner ones first.
  std::set<std::string> roots_;

  Backlog backlog_;
  uint64_t lines_ = 0;
  uint64_t overflows_ = 0;
  std::chrono::milliseconds pause_{0};  // Before the next try; 0 while writing works.
  TimePoint retry_;
  size_t tried_bytes_ = 0;  // Of the backlog, at the last try that failed.
  std::string fault_;       // Why the queue cannot be written, once it is worth telling.
};

}  // namespace vexlo::evnotifyd

#endif  // DAEMONS_EVNOTIFYD_FEEDER_H_
