#include "daemons/fileindexd/settle.h"

#include <json/value.h>

#include <cerrno>
#include <map>
#include <mutex>
#include <optional>
#include <set>
#include <string>
#include <utility>
#include <vector>

#include "common/check.h"
#include "common/error.h"
#include "common/file.h"
#include "common/lock.h"
#include "common/sdk/share.h"
#include "daemons/common/log.h"
#include "daemons/fileindexd/documents.h"
#include "fileindex/elastic_control/share_index.h"
#include "fileindex/folder_mgr.h"
#include "fileindex/index_mgr/monitor.h"
#include "fileindex/optree/event.h"
#include "fileindex/paths.h"
#include "fileindex/status_mgr.h"
#include "fileindex/util/custom_event.h"
#include "kavo/local/monitor_queues.h"
#include "kavo/local/shares.h"

namespace vexlo::fileindexd {
namespace {

using fileindex::FolderMgr;

constexpr char kApp[] = "fileindex";  // Under which queues of shares are registered.
constexpr int kIndexMissing = 2002;   // The engine's word for it.

struct Unsettled {
  std::set<std::string> unwatched;              // Indexed shares, or not watched as they should.
  std::map<std::string, std::string> unlisted;  // Shares without folders, with their queues.

  bool IsNothing() const { return unwatched.empty() && unlisted.empty(); }
};

// Not by SDKShare::Enum(), each call of which leaves its list behind.
std::vector<std::string> ShareNames() {
  std::vector<std::string> names;
  try {
    for (kavo::local::Share& share : kavo::local::ReadShares(kavo::local::SharesFile())) {
      names.push_back(std::move(share.name));
    }
  } catch (const kavo::local::SharesError& error) {
    throw Error(ERR_SHARE_ENUM, error.what());
  }
  return names;
}

// The full paths of the folders that are registered for the shares, by queues.
std::map<std::string, std::set<std::string>> ReadRegistered() {
  kavo::local::MonitorQueues all;
  try {
    all = kavo::local::ReadMonitorQueues();
  } catch (const kavo::local::MonitorQueuesError& error) {
    throw Error(ERR_LOAD, error.what());
  }
  if (const auto unreadable = all.unreadable.find(kApp); unreadable != all.unreadable.end()) {
    throw Error(ERR_LOAD, unreadable->second);
  }
  std::map<std::string, std::set<std::string>> registered;
  for (const kavo::local::RegisteredQueue& queue : all.queues) {
    if (queue.app == kApp) {
      std::set<std::string>& paths = registered[queue.queue];
      for (const kavo::local::MonitoredFolder& folder : queue.folders) {
        paths.insert(folder.path);
      }
    }
  }
  return registered;
}

std::set<std::string> FoldersOf(const std::string& share, const FolderMgr& folders) {
  std::set<std::string> paths;
  for (const auto& folder : folders.GetFolders()) {
    if (folder->GetShare() == share) {
      paths.insert(folder->GetFullPath());
    }
  }
  return paths;
}

Unsettled FindUnsettled(const FolderMgr& folders) {
  const auto registered = ReadRegistered();
  const bool has_list = IsFileExist(fileindex::kFileIndexFoldersCfgPath.Get());
  Unsettled found;
  for (const std::string& share : ShareNames()) {
    const std::string queue = sdk::SDKShare(share).GetQueuePath();
    const auto watched = registered.find(queue);
    if (folders.IsShareIndexed(share)) {
      if (watched == registered.end() || watched->second != FoldersOf(share, folders)) {
        found.unwatched.insert(share);
      }
    } else if (has_list && watched != registered.end()) {
      found.unlisted.emplace(share, queue);
    }
  }
  return found;
}

void Watch(const std::string& share, FolderMgr& folders) {
  fileindex::UpsertEVNotifydCfg(share, folders);
  for (const std::string& path : FoldersOf(share, folders)) {
    fileindex::AddCustomEvent(fileindex::EV_REINDEX, path, /*path_old=*/"", Json::Value());
  }
}

// The registration last, by which the rest is found again.
void Forget(const std::string& share, const std::string& queue) {
  // At once: the library would wait for it, and commands for the lock.
  VEXLO_CHECK(EngineRun().empty(), ERR_ELASTIC_REQUEST, "the engine does not run");
  try {
    fileindex::elastic::ShareIndexDelete(share);
  } catch (const Error& error) {
    if (static_cast<int>(error.GetErrorCode()) != kIndexMissing) {
      throw;
    }
  }
  fileindex::StatusMgr().ClearShareStatus(share);
  fileindex::DeleteEVNotifydCfg(share);
  Unlink(queue);
  Unlink(queue + ".tmp");
}

}  // namespace

void SettleFolders() {
  if (FindUnsettled(FolderMgr()).IsNothing()) {
    return;
  }
  const LockFile lock(fileindex::kFileIndexFoldersLockPath.Get(), /*exclusive=*/true,
                      std::try_to_lock);
  if (!lock.IsHeld()) {
    VEXLO_CHECK(errno != EWOULDBLOCK, ERR_LOCK, "the folders cannot be locked");
    return;
  }
  FolderMgr folders;
  const Unsettled found = FindUnsettled(folders);
  // One share that fails keeps nothing from the others.
  std::optional<Error> failure;
  const auto settle = [&failure](const std::string& share, const char* done, const auto& act) {
    try {
      act();
      daemon::Log(daemon::Level::kNotice, VEXLO_SOURCE, __LINE__,
                  share + ": " + done + ", as a change of folders was cut short");
    } catch (const Error& error) {
      failure = error;
    }
  };
  for (const std::string& share : found.unwatched) {
    settle(share, "its folders are watched again", [&] { Watch(share, folders); });
  }
  for (const auto& unlisted : found.unlisted) {
    settle(unlisted.first, "what its index left is removed",
           [&unlisted] { Forget(unlisted.first, unlisted.second); });
  }
  if (failure) {
    throw Error(*failure);
  }
  VEXLO_CHECK(!FindUnsettled(folders).IsNothing(), ERR_SYSTEM,
              "the registrations are others than they were made");
}

}  // namespace vexlo::fileindexd
