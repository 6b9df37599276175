#include "cli/audit_scope.h"

#include <sys/stat.h>

#include <algorithm>
#include <utility>

#include "cli/command.h"
#include "cli/text.h"
#include "common/error.h"
#include "common/file.h"
#include "common/sdk/share.h"
#include "common/string.h"
#include "fileindex/util/path_policy.h"
#include "fileindex/util/share_path.h"

namespace vexlo::cli {
namespace {

bool HasBytes(const std::string& file) {
  struct stat info {};
  return lstat(file.c_str(), &info) == 0 && info.st_size > 0;
}

}  // namespace

AuditScope::AuditScope(std::string share) : share_(std::move(share)) {
  // A folder of another share that is gone makes every question fail.
  for (const std::string& name : folders_.GetIndexedShares()) {
    if (name != share_) {
      folders_.DeleteByShare(name);
    }
  }
  try {
    const sdk::SDKShare asked(share_);
    share_path_ = asked.GetPath();
    queue_path_ = asked.GetQueuePath();
    folder_paths_.reserve(folders_.GetFolders().size());
    for (const auto& folder : folders_.GetFolders()) {
      folder_paths_.push_back(folder->GetFullPath());
    }
  } catch (const Error& error) {
    if (error.GetErrorCode() != ERR_SHARE_NOT_FOUND) {
      throw;
    }
    throw Failure("the share is gone; 'fileindex folder prune' forgets its folders");
  }
}

bool AuditScope::IsFileWanted(const std::string& path) const {
  return folders_.IsFullPathIndexed(path) && fileindex::CanFullPathBeIndexed(path);
}

bool AuditScope::IsFolderWanted(const std::string& path) const {
  return folders_.IsFullPathIndexed(path) && MayEnter(path);
}

bool AuditScope::MayEnter(const std::string& path) const {
  const bool leads = folders_.IsFullPathIndexed(path) ||
                     std::any_of(folder_paths_.begin(), folder_paths_.end(),
                                 [&](const auto& folder) { return IsSameOrBelow(folder, path); });
  // What only leads to indexed folders need not be let in itself.
  return leads && IsInShare(path) &&
         (!folders_.IsFullPathIndexed(path) || fileindex::CanFullPathBeIndexed(path));
}

bool AuditScope::LeadsTo(const std::string& path) const {
  if (!IsSameOrBelow(path, share_path_)) {
    return false;
  }
  for (size_t end = share_path_.size(); end < path.size(); end = path.find('/', end + 1)) {
    if (!MayEnter(path.substr(0, end))) {
      return false;
    }
  }
  return true;
}

bool AuditScope::IsInShare(const std::string& path) const {
  if (!IsSameOrBelow(path, share_path_)) {
    return false;
  }
  std::string name;
  std::string folder;
  fileindex::GetShareNamePathByFullPath(name, folder, path);
  return name == share_;
}

void AuditScope::CheckShare() const {
  if (!IsDirExist(share_path_, /*follow_link=*/false)) {
    throw Failure("its folder '" + share_path_ + "' is not there");
  }
  if (!sdk::SDKShare(share_).CanBeIndexed()) {
    throw Failure("the share is locked or read-only at present");
  }
}

bool AuditScope::HasWaitingChanges() const {
  return HasBytes(queue_path_) || HasBytes(queue_path_ + ".tmp");
}

}  // namespace vexlo::cli
