#include "fileindex/index_mgr/services.h"

#include <json/value.h>

#include <cerrno>

#include "common/check.h"
#include "common/error.h"
#include "fileindex/communication.h"
#include "fileindex/folder_mgr.h"
#include "fileindex/status_mgr.h"
#include "kavo/exec.h"
#include "kavo/index_path.h"
#include "kavo/service.h"

namespace vexlo::fileindex {
namespace {

constexpr char kDaemonService[] = "pkg-Vexlo-fileindexd";
constexpr char kExtractionService[] = "kavocontentextractd";
constexpr size_t kPathBytes = 4096;

void RemoveAll(const std::string& path) { KLIBCExec("/bin/rm", "-rf", path.c_str(), nullptr); }

}  // namespace

void NotifyShareSettingChanged(const std::string& share_name, bool is_upsert) {
  Json::Value data;
  data["share_name"] = share_name;
  data["is_upsert"] = is_upsert;
  SendCommandToDaemon("notify_setting_changed", data);
}

void CleanShareIndexData(const std::string& share_name, const std::string& share_path) {
  char path[kPathBytes] = {};
  VEXLO_CHECK(0 > FILEIDXQueuePathCompose(share_path.c_str(), path, sizeof(path)), ERR_SYSTEM,
              "FILEIDXQueuePathCompose failed, share_path=" + share_path);
  const std::string queue_path = path;
  RemoveAll(queue_path);
  RemoveAll(queue_path + ".tmp");
  VEXLO_CHECK(0 > FILEIDXDBPathCompose(share_path.c_str(), path, sizeof(path)), ERR_SYSTEM,
              "FILEIDXDBPathCompose failed, share_path=" + share_path);
  RemoveAll(path);
  StatusMgr().ClearShareStatus(share_name);
}

void SetupRelatedServices(bool starts, const FolderMgr& folders,
                          const std::set<std::string>& touched_shares) {
  const auto log_failure = [](int result, const char* call, const std::string& what) {
    if (result < 0) {
      LogFailure({VEXLO_SOURCE, __LINE__, "SetupRelatedServices", call}, what, errno);
    }
  };
  if (starts) {
    log_failure(KLIBServiceStart(kExtractionService), "0 > KLIBServiceStart(kExtractionService)",
                kExtractionService);
    log_failure(KLIBServicectlStart(kDaemonService), "0 > KLIBServicectlStart(kDaemonService)",
                kDaemonService);
  } else if (folders.GetFolders().empty()) {
    log_failure(KLIBServicectlStop(kDaemonService), "0 > KLIBServicectlStop(kDaemonService)",
                kDaemonService);
    log_failure(KLIBServicectlStop(kExtractionService),
                "0 > KLIBServicectlStop(kExtractionService)", kExtractionService);
  }
  for (const std::string& share : touched_shares) {
    log_failure(KAVOSMBSetSpotlight(share.c_str(), folders.IsShareIndexed(share) ? 1 : 0),
                "0 > KAVOSMBSetSpotlight(share, is_indexed)", share);
  }
}

}  // namespace vexlo::fileindex
