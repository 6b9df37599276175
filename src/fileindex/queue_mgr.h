// One share's event queue file.
#ifndef FILEINDEX_QUEUE_MGR_H_
#define FILEINDEX_QUEUE_MGR_H_

#include <functional>
#include <memory>
#include <string>

#include "common/export.h"
#include "fileindex/optree/optree.h"

// What indexing is made of: queues and what they come down to, the indexed folders, which paths are
// indexed, the state of the service, and its administration.
namespace vexlo::fileindex {

// Moves the live queue aside to a snapshot (its path with ".tmp" behind it), so that the notify
// daemon can go on appending, and folds the snapshot into operations. A cycle is
// ProcessOP(callback, true), then DeleteTmp() once the work is done; a snapshot that an earlier run
// left is processed first.
//
// Trees are built on first use and kept, also over DeleteTmp(): make a new manager for each cycle.
// Not for use by two threads at a time.
class VEXLO_EXPORT QueueMgr {
 public:
  // Touches no file yet; the queue need not exist.
  explicit QueueMgr(const std::string& queue_path);

  // Renames the live queue to the snapshot under the queue's LockFile, unless there is no live
  // queue or a snapshot stands already. Throws Error 502 when the rename fails, 506 from the lock.
  void PrepareTmpQueue();

  // The tree of the live queue, and of the snapshot. Throw as OPTree's constructor does.
  std::shared_ptr<OPTree> GetOPTree() const;
  std::shared_ptr<OPTree> GetOPTreeTmp() const;

  // Unlinks the snapshot and returns unlink's result (-1 when there was none). Takes no lock.
  int DeleteTmp();

  // Takes a snapshot with `use_tmp`, and delivers the operations of the snapshot, else of the live
  // queue, to `callback`. Returns the number of entries in the tree's list, 1 for a crashed queue,
  // 0 when there is no file. Throws what PrepareTmpQueue(), OPTree and the callback throw.
  int ProcessOP(std::function<void(std::shared_ptr<OP>)> callback, bool use_tmp);

  // Whether an event is pending, live or in the snapshot, for `full_path` or anything below it (by
  // "path" or "path_old"). Throws Error 502 when a queue cannot be read, and 906 or 120 at a bad
  // line that stands before the first match. Takes no lock: a last line that is being written is
  // waited for for a tenth of a second. Throws what FolderMgr's constructor does, too, when the
  // list of folders cannot be loaded.
  bool IsFullPathProcessing(const std::string& full_path);

  // Whether a reindex of `full_path` or of a folder above it is pending: an event of exactly
  // EV_REINDEX. Throws as above.
  bool IsFullPathHasReindex(const std::string& full_path);

 private:
  std::string queue_path_;
  std::string queue_path_tmp_;
  mutable std::shared_ptr<OPTree> op_tree_;
  mutable std::shared_ptr<OPTree> op_tree_tmp_;
};

}  // namespace vexlo::fileindex

#endif  // FILEINDEX_QUEUE_MGR_H_
