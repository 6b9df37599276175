#include "daemons/fileindexd/rename_plan.h"

namespace vexlo::fileindexd {

RenameStep PlanRename(const RenameFacts& facts) {
  if (!facts.new_is_wanted) {
    return RenameStep::kForget;
  }
  if (!facts.new_inode) {
    // Renamed on, or deleted: whoever moves documents there sees to it that they do not stay.
    const bool is_of_the_moved =
        !facts.old_inode || (facts.document_inode && *facts.document_inode != *facts.old_inode);
    return facts.has_document && is_of_the_moved ? RenameStep::kMove : RenameStep::kForget;
  }
  if (!facts.has_document) {
    return RenameStep::kReconcile;
  }
  const bool is_of_the_moved =
      facts.document_inode ? *facts.document_inode == *facts.new_inode : !facts.old_inode;
  return is_of_the_moved ? RenameStep::kMove : RenameStep::kReconcile;
}

}  // namespace vexlo::fileindexd
