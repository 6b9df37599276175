#include "fileindex/index_mgr/monitor.h"

#include <json/value.h>

#include "common/check.h"
#include "common/error.h"
#include "common/sdk/share.h"
#include "fileindex/folder_mgr.h"
#include "kavo/monitor_queue.h"

using EVNOTIFYD::MONITOR_QUEUE_TYPE_APPLICATION;
using EVNOTIFYD::MonitorQueue;

namespace vexlo::fileindex {
namespace {

constexpr char kAppName[] = "fileindex";

// What an indexer needs to hear of. Without "modify" (0x2): a file is indexed when it was closed.
constexpr unsigned kMask = 0xFFCC;

// The platform's folder of hidden attributes.
constexpr char kIgnored[] = "@eaDir";

}  // namespace

void UpsertEVNotifydCfg(const std::string& share_name, FolderMgr& folder_mgr) {
  const sdk::SDKShare share(share_name);
  Json::Value ignore(Json::arrayValue);
  ignore.append(kIgnored);
  Json::Value config(Json::arrayValue);
  for (const std::shared_ptr<Folder>& folder : folder_mgr.GetFolders()) {
    if (folder->GetShare() != share_name) {
      continue;
    }
    Json::Value entry;
    entry["path"] = folder->GetFullPath();
    entry["mask"] = kMask;
    entry["ignore"] = ignore;
    config.append(entry);
  }
  Json::Value description;
  description["queue"] = share.GetQueuePath();
  description["config"] = config;
  const MonitorQueue monitor_queue(description);
  VEXLO_CHECK(!MonitorQueue::Upsert(monitor_queue, kAppName, MONITOR_QUEUE_TYPE_APPLICATION),
              ERR_SYSTEM, "MonitorQueue::Upsert failed, share=" + share_name);
}

void DeleteEVNotifydCfg(const std::string& share_name) {
  const sdk::SDKShare share(share_name);
  VEXLO_CHECK(!MonitorQueue::Delete(share.GetQueuePath(), kAppName, MONITOR_QUEUE_TYPE_APPLICATION),
              ERR_SYSTEM, "MonitorQueue::Delete failed, share=" + share_name);
}

}  // namespace vexlo::fileindex
