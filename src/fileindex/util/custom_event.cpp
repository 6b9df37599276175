#include "fileindex/util/custom_event.h"

#include <cerrno>
#include <exception>

#include "common/check.h"
#include "common/error.h"
#include "common/file.h"
#include "common/json.h"
#include "common/sdk/share.h"
#include "fileindex/optree/event.h"
#include "fileindex/queue_mgr.h"
#include "fileindex/status_mgr.h"
#include "fileindex/util/share_path.h"

namespace vexlo::fileindex {
namespace {

std::string LineOf(int event, const std::string& full_path, const std::string& path_old,
                   const Json::Value& data) {
  Json::Value members;
  members["event"] = event;
  members["path"] = full_path;
  members["path_old"] = path_old;
  members["data"] = data;
  return JsonToString(members);
}

void MarkForReindex(const std::string& share_name) {
  try {
    StatusMgr().SetShareStatus(share_name, SS_NEED_REINDEX);
  } catch (const std::exception& error) {
    LogContext({VEXLO_SOURCE, __LINE__, __func__, ""},
               "[" + share_name + "] is not marked for a reindex, reason=" + error.what(), errno);
  }
}

}  // namespace

void AddCustomEvent(int event, const std::string& full_path, const std::string& path_old,
                    const Json::Value& data) {
  std::string share_name;
  try {
    std::string share_dir;
    GetShareNamePathByFullPath(share_name, share_dir, full_path);
    const sdk::SDKShare share(share_name);
    const std::string queue_path = share.GetQueuePath();
    // Each ends here before the queue's lock is taken: taking it makes the file, and a queue file
    // is pending work.
    if (!share.CanBeIndexed() || QueueMgr(queue_path).IsFullPathHasReindex(full_path)) {
      return;
    }
    const std::string line = LineOf(event, full_path, path_old, data);
    // A line that readers refuse would fail every question about the queue while it is there.
    [[maybe_unused]] const Event readable(line);
    AppendLines(queue_path, line + "\n");
  } catch (const Error& error) {
    LogContext({"util", 868, "AddCustomEvent", ""},
               "AddCustomEvent failed, code=" + std::to_string(error.GetErrorCode()) +
                   ", reason=" + error.what() + ". Set [" + share_name + "] need reindex",
               errno);
    if (!share_name.empty()) {
      MarkForReindex(share_name);
    }
    throw;
  }
}

}  // namespace vexlo::fileindex
