// One turn of a share's worker: the operations that its queue came down to, carried out.
#ifndef DAEMONS_FILEINDEXD_CYCLE_H_
#define DAEMONS_FILEINDEXD_CYCLE_H_

#include <json/value.h>

#include <chrono>
#include <functional>
#include <map>
#include <memory>
#include <optional>
#include <set>
#include <string>
#include <vector>

#include "daemons/fileindexd/crawl.h"
#include "daemons/fileindexd/indexer.h"
#include "daemons/fileindexd/queue_tail.h"
#include "daemons/fileindexd/scope.h"
#include "daemons/fileindexd/share_state.h"
#include "daemons/fileindexd/stamp.h"
#include "daemons/fileindexd/stats.h"
#include "fileindex/optree/event.h"
#include "fileindex/optree/op.h"

namespace vexlo::fileindexd {

// For one thread. Every call may throw Interrupted, and Error for what must end the cycle: see
// OfCycle() for what to do then.
class Cycle {
 public:
  // `cause` tells this cycle's work from that of others, so that a crawl that was cut short goes on
  // only for who began it. `state` is saved to the share's file as crawls proceed. Both references
  // outlive the cycle. Throws as Scope does.
  Cycle(const std::string& share, const std::string& share_path, std::string cause,
        ShareState& state, Stats& stats, std::function<bool()> is_interrupted);

  // From now on looks at the queue every `step` while it works, so that a change need not wait for
  // the end of all this to be found: files that were written or renamed are indexed at once, and
  // those that are gone removed, as if a crawl had come by. The lines stay for the next cycle.
  void LookAheadIn(const std::string& queue_path, std::chrono::milliseconds step);

  // Carries out one operation. What is wrong with it alone is logged, counted, and passed over.
  void Handle(const fileindex::OP& op);

  // Compares all folders of the share with the index.
  void ReconcileShare();
  // Those that were never crawled, and those that were and are not configured any more.
  void ReconcileNewFolders();

  // Those whose settings are others than they were compared with. To be called when no operation
  // that tells of the change is to come: that one says what is to be read again.
  void ReconcileOtherSettings();

  // Takes what is in the index without what stands in it, as nobody was there to read it. False
  // when there is such a thing left: still nobody is there, or nothing is at its path (any more).
  bool IndexUnread();

  // Whether something was taken that nobody was there to read. To be asked after Finish().
  bool TakeHasUnread() { return indexer_.TakeHasUnread(); }

  // Returns when everything is in the index, and on disk. Then the state is saved.
  void Finish();

 private:
  void CarryTwice(const fileindex::OP& op, const std::string& path);
  void Carry(const fileindex::OP& op, const std::string& path);
  void LeaveToInnerShare(const fileindex::OP& op, const std::string& path);
  void CarryKnown(const fileindex::OP& op, const std::string& path);
  void Delete(const std::string& path);
  void Upsert(const std::string& path);
  void UpdateAttributes(const std::string& path);
  void Rename(const std::string& path, const std::string& path_old);
  bool Move(const std::string& path, const std::string& path_old);
  void FinishMove(const std::string& path, const std::string& path_old,
                  const std::optional<Stamp>& before, const Stamp& now);

  // Compares what is at and below the path with the index. `types` names the types of files that
  // are indexed anew even so, or is null. The cycle's cause where `cause` is null.
  void Reconcile(const std::string& root, const Json::Value& types, const char* cause = nullptr);
  void ReconcileMixed(const std::string& path);
  void LookAhead();
  void LookAt(const fileindex::Event& event, std::vector<GoneList::Gone>* gone);
  void Compare(const DiskEntry& entry, const IndexedPath* indexed, const Json::Value& types);
  void Remove(const std::vector<GoneList::Gone>& gone);
  void MarkCrawled(const std::string& root);

  // Whether the path belongs into the index. One that does not exist does not.
  bool IsWanted(const std::string& path) const;
  void Submit(const std::string& path);
  // An upsert's or an attribute update's path that is not there.
  void DeleteUnwanted(const std::string& path);
  void NoteMissed(const std::string& path);
  void ForgetMissed(const std::string& path);
  void NoteGone();
  void ForgetTaken(const std::string& path);
  void NoteMove(const std::string& path, const std::string& path_old);
  void ReconcileMovedFrom(const std::string& path, bool only_from_above);
  void NoteTouched(const std::string& path);
  bool WasTouched(const std::string& path) const;
  void FlushDeletes();
  // Sends them as one; what fails alone is counted.
  void SendCounted(Json::Value requests);
  void RemoveGhosts();
  // Returns when the engine has everything that was taken.
  void Settle();
  void Commit();
  void Check();
  void Count(int code, const std::string& reason, const std::string& path);

  const std::string share_;
  const std::string id_;
  const std::string cause_;
  const Scope scope_;
  ShareState& state_;
  // What is left of the state's. There nothing is forgotten before the commit: a cycle that is done
  // again has to find what this one has found.
  MissedPaths missed_;
  Stats& stats_;
  const std::function<bool()> is_interrupted_;
  Indexer indexer_;

  std::optional<QueueTail> tail_;
  std::chrono::milliseconds look_step_{0};
  std::chrono::steady_clock::time_point looked_;

  std::string engine_run_;  // That has taken what was sent since the last commit.
  Json::Value deletes_ = Json::Value(Json::arrayValue);  // Wait to be sent as one request.
  bool has_sent_ = false;                                // Something to be committed.
  bool state_changed_ = false;
  // What was taken in this cycle, as it was then: an editor's save is one rename and one change of
  // the same file.
  std::map<std::string, Stamp> taken_;
  // Paths of the operations so far. The tree folds events into operations that are pending already,
  // so what happened at a path after a rename may be handed over before it.
  std::set<std::string> touched_;
  bool touched_too_much_ = false;
  // Where this cycle has moved the documents of a path to, by the path.
  std::multimap<std::string, std::string> moves_;
  bool inodes_count_ = false;  // In this crawl a document of another inode is another file's.
  std::set<std::string>
      moved_to_nothing_;  // Paths that documents were moved to, and nothing stood.
  std::map<int, unsigned> failures_;
};

}  // namespace vexlo::fileindexd

#endif  // DAEMONS_FILEINDEXD_CYCLE_H_
