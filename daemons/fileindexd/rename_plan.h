// What becomes of the documents when a file or folder was renamed. Pure.
#ifndef DAEMONS_FILEINDEXD_RENAME_PLAN_H_
#define DAEMONS_FILEINDEXD_RENAME_PLAN_H_

#include <cstdint>
#include <optional>

namespace vexlo::fileindexd {

// What is known when the operation's turn has come. The disk may be further by then, and so may the
// index: a cycle that was cut short is done again from its first operation.
struct RenameFacts {
  bool new_is_wanted = false;              // Covered, and allowed where it is on the disk.
  bool has_document = false;               // At the old path.
  std::optional<uint64_t> document_inode;  // None where the document has no stamp.
  std::optional<uint64_t> old_inode;       // What is on the disk now.
  std::optional<uint64_t> new_inode;
};

enum class RenameStep {
  kMove,       // The documents at and below the old path move.
  kReconcile,  // Those there are not the new path's: it is compared with the disk.
  kForget,     // Nothing is to be found at the new path.
};

// A document moves only where it is that of the object that has moved, which the inode tells.
// Otherwise doing a cycle again would take what was made at the old path since for what was there
// before.
RenameStep PlanRename(const RenameFacts& facts);

}  // namespace vexlo::fileindexd

#endif  // DAEMONS_FILEINDEXD_RENAME_PLAN_H_
