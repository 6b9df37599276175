// What of a share belongs into its index.
#ifndef CLI_AUDIT_SCOPE_H_
#define CLI_AUDIT_SCOPE_H_

#include <string>
#include <vector>

#include "fileindex/folder_mgr.h"

namespace vexlo::cli {

// The share's folders as they were when the object was made, and the path policy as it is. Full
// paths everywhere. For one thread.
class AuditScope {
 public:
  // Throws Failure when the share is gone, and as FolderMgr does.
  explicit AuditScope(std::string share);

  const std::string& Share() const { return share_; }
  const std::string& SharePath() const { return share_path_; }
  const std::string& QueuePath() const { return queue_path_; }

  // Whether a file of the share is to have a document. The policy says no, too, of all files while
  // the share cannot be indexed: see CheckShare().
  bool IsFileWanted(const std::string& path) const;
  // The same for a folder.
  bool IsFolderWanted(const std::string& path) const;
  // Whether files below the folder may be wanted.
  bool MayEnter(const std::string& path) const;
  // MayEnter() of every folder from the share's down to the one that holds `path`.
  bool LeadsTo(const std::string& path) const;
  // Whether what stands in the file is to be in its document.
  bool WantsContent(const std::string& path) const { return folders_.IsFullPathNeedMeta(path); }
  // Shares may lie in each other: the innermost has the path.
  bool IsInShare(const std::string& path) const;

  // Throws Failure when the share is locked, read-only, or its folder is not there.
  void CheckShare() const;
  // Whether changes of the share wait to be indexed.
  bool HasWaitingChanges() const;

 private:
  const std::string share_;
  std::string share_path_;
  std::string queue_path_;
  fileindex::FolderMgr folders_;
  std::vector<std::string> folder_paths_;
};

}  // namespace vexlo::cli

#endif  // CLI_AUDIT_SCOPE_H_
