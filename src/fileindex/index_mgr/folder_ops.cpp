#include "fileindex/index_mgr/folder_ops.h"

#include <memory>
#include <set>
#include <vector>

#include "common/check.h"
#include "common/error.h"
#include "common/json.h"
#include "common/lock.h"
#include "common/sdk/share.h"
#include "fileindex/elastic_control/share_index.h"
#include "fileindex/folder_mgr.h"
#include "fileindex/index_mgr/monitor.h"
#include "fileindex/index_mgr/services.h"
#include "fileindex/optree/event.h"
#include "fileindex/paths.h"
#include "fileindex/status_mgr.h"
#include "fileindex/util/custom_event.h"
#include "fileindex/util/path_policy.h"
#include "fileindex/util/share_path.h"

namespace vexlo::fileindex {
namespace {

using FolderPtr = std::shared_ptr<Folder>;

void AddConfigChanged(const Folder& previous) {
  AddCustomEvent(EV_UPDATE_DIRECTORY, previous.GetFullPath(), /*path_old=*/"",
                 previous.GetIndexCfg());
}

void FolderUpsert(const Json::Value& folder_list, bool create, bool updater_mode) {
  const LockFile lock(kFileIndexFoldersLockPath.Get(), /*exclusive=*/true);
  FolderMgr folder_mgr;
  const FolderMgr folder_mgr_before;
  std::vector<FolderPtr> previous_folders;
  std::set<std::string> touched_shares;
  VEXLO_CHECK(!folder_list.isArray(), ERR_BAD_PARAMETER, JsonToStyledString(folder_list));
  for (const Json::Value& it : folder_list) {
    const auto folder_new = std::make_shared<Folder>(it);
    const std::string path = folder_new->GetPath();
    // The policy comes last, though the text has it first: an updater must not ask it.
    VEXLO_CHECK_AT((LogSite{VEXLO_SOURCE, __LINE__, __func__,
                            "!CanPathBeIndexed(folder_new->GetPath()) && !updater_mode"}),
                   !updater_mode && !CanPathBeIndexed(path), ERR_PATH_CANNOT_INDEX,
                   "Path cannot index: " + path);
    VEXLO_CHECK(create && folder_mgr.HasFolder(folder_new->GetPath()), ERR_FOLDER_DUPLICATED,
                "Duplicated ID: " + path);
    FolderPtr folder_old;
    folder_mgr.Upsert(folder_old, folder_new);
    previous_folders.push_back(
        create ? std::make_shared<Folder>(path, folder_new->GetName(), /*owner=*/"", /*group=*/"",
                                          /*document=*/true, /*audio=*/true, /*video=*/true,
                                          /*photo=*/true, /*privileged=*/false, /*paused=*/false)
               : folder_old);
    const sdk::SDKShare share(folder_new->GetShare());
    VEXLO_CHECK(!share.IsSpaceEnough(), ERR_SPACE_NOT_ENOUGH,
                "Share (" + share.GetName() + ") space not enough");
    touched_shares.insert(share.GetName());
  }
  SetupRelatedServices(/*starts=*/true, folder_mgr, touched_shares);
  for (const std::string& share : touched_shares) {
    if (create && !folder_mgr_before.IsShareIndexed(share)) {
      elastic::ShareIndexCreate(share);
    }
    UpsertEVNotifydCfg(share, folder_mgr);
  }
  folder_mgr.Save();
  for (const std::string& share : touched_shares) {
    NotifyShareSettingChanged(share, /*is_upsert=*/true);
  }
  for (const FolderPtr& previous : previous_folders) {
    if (previous != nullptr && !updater_mode) {
      AddConfigChanged(*previous);
    }
  }
}

}  // namespace

void FolderAdd(const Json::Value& folder_list, bool updater_mode) {
  FolderUpsert(folder_list, /*create=*/true, updater_mode);
}

void FolderSet(const Json::Value& folder_list, bool updater_mode) {
  FolderUpsert(folder_list, /*create=*/false, updater_mode);
}

void FolderDelete(const Json::Value& path_list) {
  const LockFile lock(kFileIndexFoldersLockPath.Get(), /*exclusive=*/true);
  FolderMgr folder_mgr;
  std::vector<FolderPtr> deleted_folders;
  std::set<std::string> touched_shares;
  VEXLO_CHECK(!path_list.isArray(), ERR_BAD_PARAMETER, JsonToStyledString(path_list));
  for (const Json::Value& it : path_list) {
    VEXLO_CHECK(!it.isString(), ERR_BAD_PARAMETER, JsonToStyledString(it));
    FolderPtr deleted;
    folder_mgr.Delete(deleted, it.asString());
    if (deleted != nullptr) {
      deleted_folders.push_back(deleted);
    }
    touched_shares.insert(GetShareNameByPath(it.asString()));
  }
  for (const std::string& share_name : touched_shares) {
    if (folder_mgr.IsShareIndexed(share_name)) {
      UpsertEVNotifydCfg(share_name, folder_mgr);
      continue;
    }
    const sdk::SDKShare share(share_name);
    elastic::ShareIndexDelete(share_name);
    DeleteEVNotifydCfg(share_name);
    CleanShareIndexData(share_name, share.GetPath());
  }
  folder_mgr.Save();
  for (const std::string& share : touched_shares) {
    NotifyShareSettingChanged(share, /*is_upsert=*/false);
  }
  for (const FolderPtr& deleted : deleted_folders) {
    if (folder_mgr.IsShareIndexed(deleted->GetShare())) {
      AddConfigChanged(*deleted);
    }
  }
  SetupRelatedServices(/*starts=*/false, folder_mgr, touched_shares);
}

void FolderDelete(const std::string& share_name) {
  // Without the lock, which the other one takes.
  const FolderMgr folder_mgr;
  Json::Value paths(Json::arrayValue);
  for (const FolderPtr& folder : folder_mgr.GetFolders()) {
    if (folder->GetShare() == share_name) {
      paths.append(folder->GetPath());
    }
  }
  FolderDelete(paths);
}

void FolderReindex(const Json::Value& path_list) {
  StatusMgr status_mgr;
  const FolderMgr folder_mgr;
  std::set<std::string> rebuilt_shares;
  std::set<std::string> reindexed_shares;
  VEXLO_CHECK(!path_list.isArray(), ERR_BAD_PARAMETER, JsonToStyledString(path_list));
  for (const Json::Value& it : path_list) {
    VEXLO_CHECK(!it.isString(), ERR_BAD_PARAMETER, JsonToStyledString(it));
  }
  for (const Json::Value& it : path_list) {
    const std::string path = it.asString();
    const std::string share = GetShareNameByPath(path);
    if (!folder_mgr.IsShareIndexed(share)) {
      continue;
    }
    if ((status_mgr.GetShareStatus(share) & SS_NEED_REBUILD) != 0) {
      rebuilt_shares.insert(share);
    } else {
      AddCustomEvent(EV_REINDEX, GetFullPath(path), /*path_old=*/"", Json::Value());
    }
    reindexed_shares.insert(share);
  }
  for (const std::string& share_name : rebuilt_shares) {
    const sdk::SDKShare share(share_name);
    elastic::ShareIndexDelete(share_name);
    elastic::ShareIndexCreate(share_name);
    AddCustomEvent(EV_REINDEX, share.GetPath(), /*path_old=*/"", Json::Value());
  }
  for (const std::string& share : reindexed_shares) {
    if ((status_mgr.GetShareStatus(share) & SS_NEED_REINDEX) != 0) {
      status_mgr.UnsetShareStatus(share, SS_NEED_REINDEX | SS_NEED_REBUILD);
    }
  }
}

void FolderGet(Json::Value& result, const std::string& path) {
  FolderPtr folder;
  FolderMgr().Get(folder, path);
  result = folder->GetData();
}

void FolderList(Json::Value& result, unsigned long offset, unsigned long limit,
                const std::string& sort_by, const std::string& sort_direction,
                const std::string& group, const std::string& keyword,
                const Json::Value& additional) {
  std::vector<FolderPtr> folders;
  size_t total = 0;
  FolderMgr().List(folders, total, offset, limit, sort_by, sort_direction, group, keyword);
  result = Json::objectValue;
  result["folder"] = Json::arrayValue;
  result["total"] = Json::UInt64{total};
  result["offset"] = Json::UInt64{offset};
  for (const FolderPtr& folder : folders) {
    result["folder"].append(folder->GetDataWithAdditional(additional));
  }
}

void FolderListGroups(Json::Value& result) {
  const std::set<std::string> groups = FolderMgr().GetGroups();
  result = Vec2JsonArr(std::vector<std::string>(groups.begin(), groups.end()));
}

}  // namespace vexlo::fileindex
