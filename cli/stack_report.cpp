#include "cli/stack_report.h"

#include <map>
#include <string>

#include "cli/service.h"
#include "fileindex/index_mgr/status_report.h"
#include "fileindex/status_mgr.h"

namespace vexlo::cli {

Json::Value AskWholeStack() {
  Json::Value all;
  all["daemons"] = Json::Value(Json::arrayValue);
  all["shares"] = Json::Value(Json::arrayValue);
  std::map<std::string, Json::Value> watched;  // By queue file.
  for (const DaemonPlace& place : LocalDaemons()) {
    const Json::Value stats = AskStats(place.socket);
    Json::Value daemon;
    daemon["name"] = place.name;
    daemon["running"] = stats.isNull() && ReachOf(place.socket) == Reach::kClosed
                            ? Json::Value()
                            : Json::Value(!stats.isNull());
    daemon["socket"] = place.socket;
    daemon["stats"] = stats;
    all["daemons"].append(daemon);
    for (const Json::Value& queue : stats["queues"]) {
      watched[queue["queue"].asString()] = queue;
    }
    for (const Json::Value& share : stats["shares"]) {
      all["shares"].append(share);
    }
  }
  for (Json::Value& share : all["shares"]) {
    share["watch"] = watched[share["queue"].asString()];
  }
  all["status"] = fileindex::GetIndexProcessingStatus();
  all["resume_time"] = static_cast<Json::Int64>(fileindex::StatusMgr().GetPauseInfo());
  return all;
}

}  // namespace vexlo::cli
