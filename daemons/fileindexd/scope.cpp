#include "daemons/fileindexd/scope.h"

#include <fcntl.h>
#include <sys/stat.h>

#include <algorithm>
#include <cerrno>
#include <cstdint>
#include <utility>

#include "common/check.h"
#include "common/error.h"
#include "common/file.h"
#include "common/sdk/share.h"
#include "common/string.h"
#include "fileindex/util/file_type.h"
#include "fileindex/util/path_policy.h"
#include "fileindex/util/share_path.h"
#include "kavo/filesystem.h"
#include "kavo/local/shares.h"

namespace vexlo::fileindexd {
namespace {

constexpr char kHomesShare[] = "homes";  // In which each user's folder has a recycle bin.

// Whether the errno tells of the machine's state, and nothing of the path.
bool IsOfMachine(int error) {
  return error == EIO || error == EMFILE || error == ENFILE || error == ENOMEM || error == EINTR;
}

// Of what the path stands on, which is one for all that nothing else is mounted on; none where the
// kernel does not tell.
std::optional<uint64_t> MountOf(const std::string& path) {
  struct statx info {};
  if (statx(AT_FDCWD, path.c_str(), AT_SYMLINK_NOFOLLOW | AT_NO_AUTOMOUNT | AT_STATX_DONT_SYNC,
            STATX_MNT_ID, &info) != 0 ||
      (info.stx_mask & STATX_MNT_ID) == 0) {
    return std::nullopt;
  }
  return info.stx_mnt_id;
}

}  // namespace

Scope::Scope(std::string share, std::string share_path)
    : share_(std::move(share)), share_path_(std::move(share_path)) {
  for (const std::string& name : folders_.GetIndexedShares()) {
    if (name != share_) {
      folders_.DeleteByShare(name);
    }
  }
  full_paths_.reserve(folders_.GetFolders().size());
  for (const auto& folder : folders_.GetFolders()) {
    full_paths_.push_back(folder->GetFullPath());
  }
  std::sort(full_paths_.begin(), full_paths_.end());
  full_paths_.erase(std::unique(full_paths_.begin(), full_paths_.end()), full_paths_.end());
}

bool Scope::IsInShare(const std::string& path) const {
  if (!IsSameOrBelow(path, share_path_)) {
    return false;
  }
  // Shares may lie inside each other: the innermost has the path.
  std::string name;
  std::string directory;
  fileindex::GetShareNamePathByFullPath(name, directory, path);
  return name == share_;
}

bool Scope::LeadsToFolder(const std::string& path) const {
  return std::any_of(full_paths_.begin(), full_paths_.end(), [&](const std::string& folder) {
    return folder != path && IsSameOrBelow(folder, path);
  });
}

std::optional<ContentByType> Scope::ContentsIn(const std::string& folder) const {
  const auto config = folders_.GetMostSuitableCfg(folder);
  // An indexed folder may have become a file since, which goes by the settings made for it.
  const std::string prefix = folder + "/";
  const auto first = std::lower_bound(full_paths_.begin(), full_paths_.end(), prefix);
  const auto last = std::lower_bound(first, full_paths_.end(), folder + "0");
  if (config == nullptr || std::any_of(first, last, [&](const std::string& indexed) {
        return indexed.find('/', prefix.size()) == std::string::npos;
      })) {
    return std::nullopt;
  }
  ContentByType contents{};
  contents[fileindex::FILE_TYPE_DOCUMENT] = config->IsDocument();
  contents[fileindex::FILE_TYPE_AUDIO] = config->IsAudio();
  contents[fileindex::FILE_TYPE_VIDEO] = config->IsVideo();
  contents[fileindex::FILE_TYPE_PHOTO] = config->IsPhoto();
  contents[fileindex::FILE_TYPE_OTHER] = true;
  return contents;
}

std::string Scope::SettingsOf(const std::string& folder) const {
  const auto config = folders_.GetMostSuitableCfg(folder);
  const Json::Value types = config == nullptr ? Json::Value() : config->GetIndexCfg();
  std::string settings;
  for (const auto& type : types.isObject() ? types.getMemberNames() : Json::Value::Members()) {
    if (types[type].asBool()) {
      settings.append(settings.empty() ? "" : ",").append(type);
    }
  }
  return settings;
}

// Whether something below the folder goes by other rules than the folder: an indexed folder,
// another share, or a user's recycle bin.
bool Scope::HoldsRulesOfItsOwn(const std::string& folder) const {
  if (!inner_shares_) {
    inner_shares_.emplace();
    try {
      for (const kavo::local::Share& share : kavo::local::ReadShares(kavo::local::SharesFile())) {
        if (share.name != share_ && IsSameOrBelow(share.path, share_path_)) {
          inner_shares_->push_back(share.path);
        }
      }
    } catch (const kavo::local::SharesError& error) {
      throw Error(ERR_SHARE_ENUM, error.what());
    }
  }
  return LeadsToFolder(folder) || (share_ == kHomesShare && Dirname(folder) == share_path_) ||
         std::any_of(inner_shares_->begin(), inner_shares_->end(),
                     [&](const std::string& share) { return IsSameOrBelow(share, folder); });
}

bool Scope::HaveSameSettings(const std::string& a, const std::string& b) const {
  if (HoldsRulesOfItsOwn(a) || HoldsRulesOfItsOwn(b)) {
    return false;
  }
  const auto at_a = folders_.GetMostSuitableCfg(a);
  const auto at_b = folders_.GetMostSuitableCfg(b);
  return at_a == at_b ||
         (at_a != nullptr && at_b != nullptr && at_a->GetIndexCfg() == at_b->GetIndexCfg());
}

bool Scope::Allows(const std::string& path) const {
  if (fileindex::CanFullPathBeIndexed(path)) {
    return true;
  }
  CheckShare();
  // What is refused leaves the index, so that a question that failed must not count as a refusal.
  VEXLO_CHECK(KAVOGetFSType(path.c_str(), /*flags=*/0) < 0 && IsOfMachine(errno), ERR_SYSTEM,
              "the file system cannot be told, path=" + path);
  return fileindex::CanFullPathBeIndexed(path);
}

bool Scope::IsReached(const std::string& path) const {
  const auto config = folders_.GetMostSuitableCfg(path);
  const std::string from = config == nullptr ? path : config->GetFullPath();
  if (const auto mount = MountOf(from); mount && mount == MountOf(path)) {
    return true;
  }
  for (size_t end = from.size(); end < path.size(); end = path.find('/', end + 1)) {
    if (!Allows(path.substr(0, end))) {
      return false;
    }
  }
  return true;
}

void Scope::CheckShare() const {
  const sdk::SDKShare share(share_);
  if (!IsDirExist(share_path_, /*follow_link=*/false) || !share.CanBeIndexed()) {
    throw Error(ERR_SHARE_NOT_FOUND, share_ + " cannot be indexed at present");
  }
}

}  // namespace vexlo::fileindexd
