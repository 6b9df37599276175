#include "fileindex/folder_mgr.h"

#include <sys/stat.h>

#include <algorithm>
#include <cerrno>
#include <iterator>
#include <utility>

#include "common/check.h"
#include "common/error.h"
#include "common/file.h"
#include "common/json.h"
#include "common/sdk/credentials.h"
#include "common/string.h"
#include "fileindex/paths.h"
#include "fileindex/util/file_type.h"
#include "fileindex/util/path_index.h"
#include "fileindex/util/share_path.h"

namespace vexlo::fileindex {
namespace {

using Field = const std::string& (Folder::*)() const;

// Null is the order of the file.
Field FieldOf(const std::string& sort_by) {
  static constexpr std::pair<const char*, Field> kFields[] = {{"", nullptr},
                                                              {"name", &Folder::GetName},
                                                              {"path", &Folder::GetPath},
                                                              {"owner", &Folder::GetOwner},
                                                              {"group", &Folder::GetGroup}};
  const auto* const field = std::find_if(std::begin(kFields), std::end(kFields),
                                         [&](const auto& known) { return sort_by == known.first; });
  VEXLO_CHECK(field == std::end(kFields), ERR_BAD_PARAMETER, "Unknown sort_by: " + sort_by);
  return field->second;
}

bool IsDescending(const std::string& sort_direction) {
  const std::string lower = ToLower(sort_direction);
  VEXLO_CHECK(!lower.empty() && lower != "asc" && lower != "desc", ERR_BAD_PARAMETER,
              "Unknown sort_direction: " + sort_direction);
  return lower == "desc";
}

}  // namespace

FolderMgr::FolderMgr() {
  const std::string path = kFileIndexFoldersCfgPath.Get();
  Json::Value folders;
  errno = 0;
  // Taking a file for missing that only cannot be looked at would end in a save over it. So would
  // taking an object for a list.
  VEXLO_CHECK_AT((LogSite{VEXLO_SOURCE, __LINE__, __func__,
                          "IsFileExist(kFileIndexFoldersCfgPath) && "
                          "!folders.fromFile(kFileIndexFoldersCfgPath)"}),
                 MayFileExist(path) &&
                     (!JsonFromFile(folders, path) || !(folders.isArray() || folders.isNull())),
                 ERR_LOAD, "Cannot load json: " + path);
  folders_.reserve(folders.size());
  for (const Json::Value& folder : folders) {
    folders_.push_back(std::make_shared<Folder>(folder));
  }
}

void FolderMgr::Save() const {
  const sdk::SDKCredentials root("root");
  const std::string path = kFileIndexFoldersCfgPath.Get();
  Json::Value folders(Json::arrayValue);
  for (const std::shared_ptr<Folder>& folder : folders_) {
    folders.append(folder->GetData());
  }
  VEXLO_CHECK_AT(
      (LogSite{VEXLO_SOURCE, __LINE__, __func__, "!folders.toFile(kFileIndexFoldersCfgPath)"}),
      !JsonToFile(folders, path), ERR_SAVE, path);
  VEXLO_CHECK_AT(
      (LogSite{VEXLO_SOURCE, __LINE__, __func__, "-1 == chmod(kFileIndexFoldersCfgPath, 0644)"}),
      -1 == chmod(path.c_str(), 0644), ERR_SYSTEM, path);
}

void FolderMgr::Get(std::shared_ptr<Folder>& out, const std::string& path) const {
  const auto it = std::find_if(folders_.begin(), folders_.end(),
                               [&](const auto& folder) { return folder->GetPath() == path; });
  VEXLO_CHECK(it == folders_.end(), ERR_FOLDER_NOT_FOUND, path);
  out = *it;
}

bool FolderMgr::HasFolder(const std::string& path) const {
  return std::any_of(folders_.begin(), folders_.end(),
                     [&](const auto& folder) { return folder->GetPath() == path; });
}

void FolderMgr::Upsert(std::shared_ptr<Folder>& diff, std::shared_ptr<Folder> folder) {
  diff = DiffCfg(folder, GetMostSuitableCfg(folder->GetFullPath()));
  Erase([path = folder->GetPath()](const Folder& old) { return old.GetPath() == path; });
  folders_.push_back(std::move(folder));
}

void FolderMgr::Delete(std::shared_ptr<Folder>& diff, const std::string& path) {
  const std::string full_path = GetFullPath(path);
  const std::shared_ptr<Folder> before = GetMostSuitableCfg(full_path);
  // A copy: `path` may be the text of the very folder that goes.
  Erase([path = std::string(path)](const Folder& folder) { return folder.GetPath() == path; });
  diff = DiffCfg(before, GetMostSuitableCfg(full_path));
}

void FolderMgr::DeleteByShare(const std::string& share) {
  Erase([&share](const Folder& folder) { return folder.GetShare() == share; });
}

std::shared_ptr<Folder> FolderMgr::DiffCfg(std::shared_ptr<Folder> a,
                                           std::shared_ptr<Folder> b) const {
  if (a == nullptr) {
    return nullptr;
  }
  const auto differs = [&](bool (Folder::*type)() const) {
    return b == nullptr || ((*a).*type)() != ((*b).*type)();
  };
  return std::make_shared<Folder>(a->GetPath(), a->GetName(), /*owner=*/"", /*group=*/"",
                                  differs(&Folder::IsDocument), differs(&Folder::IsAudio),
                                  differs(&Folder::IsVideo), differs(&Folder::IsPhoto),
                                  /*privileged=*/false, /*paused=*/false);
}

std::shared_ptr<Folder> FolderMgr::GetMostSuitableCfg(const std::string& full_path) const {
  return At(GetIndex().FindCovering(full_path));
}

bool FolderMgr::IsFullPathIndexed(const std::string& full_path) const {
  return GetIndex().FindCovering(full_path) != PathIndex::kNone;
}

bool FolderMgr::IsFullPathHasOwnCfg(const std::string& full_path) const {
  return GetIndex().FindExactly(full_path) != PathIndex::kNone;
}

bool FolderMgr::IsFullPathNeedMeta(const std::string& full_path) const {
  const std::shared_ptr<Folder> cfg = GetMostSuitableCfg(full_path);
  if (cfg == nullptr) {
    return false;
  }
  switch (GetFileTypeByFullPath(full_path)) {
    case FILE_TYPE_DOCUMENT:
      return cfg->IsDocument();
    case FILE_TYPE_AUDIO:
      return cfg->IsAudio();
    case FILE_TYPE_VIDEO:
      return cfg->IsVideo();
    case FILE_TYPE_PHOTO:
      return cfg->IsPhoto();
    case FILE_TYPE_OTHER:
      break;
  }
  return true;
}

bool FolderMgr::IsShareIndexed(const std::string& share) const {
  // From the path each time: it is the path that is saved, whatever the record keeps beside it.
  return std::any_of(folders_.begin(), folders_.end(), [&](const auto& folder) {
    return GetShareNameByPath(folder->GetPath()) == share;
  });
}

std::set<std::string> FolderMgr::GetIndexedShares() const {
  std::set<std::string> shares;
  for (const std::shared_ptr<Folder>& folder : folders_) {
    shares.insert(folder->GetShare());
  }
  return shares;
}

std::set<std::string> FolderMgr::GetGroups() const {
  std::set<std::string> groups;
  for (const std::shared_ptr<Folder>& folder : folders_) {
    if (!folder->GetGroup().empty()) {
      groups.insert(folder->GetGroup());
    }
  }
  return groups;
}

void FolderMgr::List(std::vector<std::shared_ptr<Folder>>& out, size_t& total, unsigned long offset,
                     unsigned long limit, const std::string& sort_by,
                     const std::string& sort_direction, const std::string& group,
                     const std::string& keyword) const {
  const Field field = FieldOf(sort_by);
  const bool descending = IsDescending(sort_direction);
  const std::string wanted = ToLower(keyword);
  const auto holds = [&wanted](const std::string& text) {
    return ToLower(text).find(wanted) != std::string::npos;
  };
  std::vector<std::shared_ptr<Folder>> passing;
  for (const std::shared_ptr<Folder>& folder : folders_) {
    if ((group.empty() || group == "all" || folder->GetGroup() == group) &&
        (holds(folder->GetName()) || holds(folder->GetPath()))) {
      passing.push_back(folder);
    }
  }
  if (field != nullptr) {
    std::stable_sort(passing.begin(), passing.end(), [&](const auto& a, const auto& b) {
      const int order = ((*a).*field)().compare(((*b).*field)());
      return descending ? order > 0 : order < 0;
    });
  }
  total = passing.size();
  const size_t begin = std::min<size_t>(offset, total);
  const size_t count = limit == 0 ? total - begin : std::min<size_t>(limit, total - begin);
  const auto first = passing.begin() + static_cast<ptrdiff_t>(begin);
  out.assign(first, first + static_cast<ptrdiff_t>(count));
}

const PathIndex& FolderMgr::GetIndex() const {
  if (index_ == nullptr) {
    std::vector<std::string> full_paths;
    full_paths.reserve(folders_.size());
    for (const std::shared_ptr<Folder>& folder : folders_) {
      full_paths.push_back(folder->GetFullPath());
    }
    index_ = std::make_shared<const PathIndex>(std::move(full_paths));
  }
  return *index_;
}

std::shared_ptr<Folder> FolderMgr::At(size_t place) const {
  return place == PathIndex::kNone ? nullptr : folders_[place];
}

template <typename Matches>
void FolderMgr::Erase(Matches matches) {
  std::vector<std::shared_ptr<Folder>> rest;
  rest.reserve(folders_.size());
  // A folder whose share cannot be told throws, and the list stays as it was.
  std::copy_if(folders_.begin(), folders_.end(), std::back_inserter(rest),
               [&](const auto& folder) { return !matches(*folder); });
  index_ = nullptr;
  folders_ = std::move(rest);
}

}  // namespace vexlo::fileindex
