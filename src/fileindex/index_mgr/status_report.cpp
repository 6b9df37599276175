#include "fileindex/index_mgr/status_report.h"

#include <cerrno>
#include <ctime>
#include <exception>

#include "common/check.h"
#include "common/file.h"
#include "common/sdk/share.h"
#include "fileindex/folder_mgr.h"
#include "fileindex/status_mgr.h"

namespace vexlo::fileindex {
namespace {

constexpr char kFinished[] = "finished";
constexpr char kProcessing[] = "processing";
constexpr char kPaused[] = "paused";
constexpr char kNeedReindex[] = "need_reindex";
constexpr char kError[] = "error";

bool HasPendingWork(const std::string& share_name) {
  const sdk::SDKShare share(share_name);
  if (!share.CanBeIndexed()) {
    return false;
  }
  const std::string queue_path = share.GetQueuePath();
  return IsFileExist(queue_path) || IsFileExist(queue_path + ".tmp");
}

bool HasPendingWorkLogged(const std::string& share_name) {
  errno = 0;
  try {
    return HasPendingWork(share_name);
  } catch (const std::exception&) {
    LogContext({VEXLO_SOURCE, __LINE__, "GetIndexProcessingStatus", ""},
               "Failed to get status from share[" + share_name + "]", errno);
    return false;
  }
}

// Depends on the order: "processing" prevails over "need_reindex" and the other way round.
void Merge(std::string& merged, const std::string& status) {
  if (status == kError) {
    merged = kError;
  } else if (status == kNeedReindex && merged != kError) {
    merged = kNeedReindex;
  } else if (status == kPaused && merged != kError && merged != kNeedReindex) {
    merged = kPaused;
  } else if (status != kFinished && status != kNeedReindex && status != kPaused &&
             merged != kError) {
    merged = kProcessing;
  }
}

Json::Value StatusOf(const Folder& folder) {
  Json::Value status(Json::objectValue);
  folder.GetStatus(status);
  return status;
}

}  // namespace

std::string GetIndexProcessingStatus() {
  const FolderMgr folder_mgr;
  bool is_pending = false;
  for (const std::string& share : folder_mgr.GetIndexedShares()) {
    is_pending = is_pending || HasPendingWorkLogged(share);
  }
  if (!is_pending) {
    return kFinished;
  }
  const long resume_time = StatusMgr().GetPauseInfo();
  return resume_time == 0 || time(nullptr) < resume_time ? kPaused : kProcessing;
}

void FolderSummary(Json::Value& result) {
  const FolderMgr folder_mgr;
  Json::Value items(Json::arrayValue);
  std::string merged = kFinished;
  for (const std::shared_ptr<Folder>& folder : folder_mgr.GetFolders()) {
    if (!folder->GetGroup().empty()) {
      continue;
    }
    Json::Value item = StatusOf(*folder);
    item["name"] = folder->GetName();
    Merge(merged, item["text"].asString());
    items.append(item);
  }
  for (const std::string& group : folder_mgr.GetGroups()) {
    std::string merged_in_group = kFinished;
    for (const std::shared_ptr<Folder>& folder : folder_mgr.GetFolders()) {
      if (folder->GetGroup() == group) {
        Merge(merged_in_group, StatusOf(*folder)["text"].asString());
      }
    }
    Json::Value item;
    item["name"] = group;
    item["text"] = merged_in_group;
    item["group"] = true;
    items.append(item);
    Merge(merged, merged_in_group);
  }
  Merge(merged, GetIndexProcessingStatus());
  result = Json::objectValue;
  result["items"] = items;
  result["status"] = merged;
}

}  // namespace vexlo::fileindex
