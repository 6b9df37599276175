// What of a share is indexed: its folders, as they were when a cycle began, and the path policy.
#ifndef DAEMONS_FILEINDEXD_SCOPE_H_
#define DAEMONS_FILEINDEXD_SCOPE_H_

#include <optional>
#include <string>
#include <vector>

#include "daemons/fileindexd/disk_scan.h"
#include "fileindex/folder_mgr.h"

namespace vexlo::fileindexd {

// For one thread.
class Scope {
 public:
  // Loads the list of folders and keeps the share's: one of another share that is unknown by now
  // makes every question fail else. `share_path` is the share's directory. Throws as FolderMgr and
  // Folder::GetFullPath() do.
  Scope(std::string share, std::string share_path);

  const std::string& SharePath() const { return share_path_; }
  // Full paths, each once, in order.
  const std::vector<std::string>& Folders() const { return full_paths_; }

  // Whether the path lies in the share's directory, or is it.
  bool IsInShare(const std::string& path) const;
  bool Covers(const std::string& path) const { return folders_.IsFullPathIndexed(path); }
  // Whether an indexed folder lies below the path.
  bool LeadsToFolder(const std::string& path) const;
  // Whether what stands in the file is to be indexed, too.
  bool WantsContent(const std::string& path) const { return folders_.IsFullPathNeedMeta(path); }
  // The same for the files directly in a covered folder; none where it depends on more.
  std::optional<ContentByType> ContentsIn(const std::string& folder) const;
  // The types whose contents are indexed in the folder, in alphabetical order with commas between.
  std::string SettingsOf(const std::string& folder) const;
  // Whether all at and below both paths is treated alike: by the same settings, and by the policy.
  bool HaveSameSettings(const std::string& a, const std::string& b) const;

  // Asks the policy. Throws Error 800 when it refuses because the share cannot be indexed now: that
  // says nothing about the path.
  bool Allows(const std::string& path) const;

  // Whether the policy lets in the folders from the indexed one down to the covered path, too, so
  // that a crawl comes to it. Below a mount point, which is refused, the policy sees nothing wrong.
  // Throws as Allows().
  bool IsReached(const std::string& path) const;

  // Throws Error 800 when the share is gone, locked, read-only, or its directory is not there.
  void CheckShare() const;

 private:
  bool HoldsRulesOfItsOwn(const std::string& folder) const;

  const std::string share_;
  const std::string share_path_;
  fileindex::FolderMgr folders_;
  std::vector<std::string> full_paths_;
  mutable std::optional<std::vector<std::string>> inner_shares_;  // Their paths, once asked for.
};

}  // namespace vexlo::fileindexd

#endif  // DAEMONS_FILEINDEXD_SCOPE_H_
