#include "fileindex/elastic_control/share_index.h"

#include "common/check.h"
#include "common/error.h"
#include "common/json.h"
#include "common/sdk/share.h"
#include "fileindex/elastic_control/request.h"
#include "fileindex/elastic_control/schema.h"

namespace vexlo::fileindex::elastic {
namespace {

constexpr char kEventHandlerText[] =
    R"({"lib_path": "/var/packages/Vexlo/target/handler/fileindex_event_handler.so"})";

}  // namespace

std::string GetFileIndexID(const std::string& share) { return "fileindex_" + share; }

Json::Value GetFileIndexSettings() { return Json::objectValue; }

Json::Value GetFileIndexMappings() {
  Json::Value mappings;
  VEXLO_CHECK_AT((LogSite{VEXLO_SOURCE, __LINE__, __func__, "!ret.fromString(mappings)"}),
                 !JsonFromString(mappings, kMappingsText), ERR_SYSTEM, "");
  return mappings;
}

Json::Value GetFileIndexEventHandler() {
  Json::Value event_handler;
  VEXLO_CHECK_AT((LogSite{VEXLO_SOURCE, __LINE__, __func__, "!ret.fromString(event_handler)"}),
                 !JsonFromString(event_handler, kEventHandlerText), ERR_SYSTEM, "");
  return event_handler;
}

void ShareIndexCreate(const std::string& share) {
  const sdk::SDKShare sdk_share(share);
  Json::Value request = MakeRequest("index_create", GetFileIndexID(share));
  Json::Value& data = request["data"];
  data["path"] = sdk_share.GetDBPath();
  data["settings"] = GetFileIndexSettings();
  data["mappings"] = GetFileIndexMappings();
  data["event_handler"] = GetFileIndexEventHandler();
  SendRequest(request);
}

void ShareIndexDelete(const std::string& share) {
  SendRequest(MakeRequest("index_delete", GetFileIndexID(share)));
}

void ShareIndexPause(const std::string& share) {
  SendRequest(MakeRequest("index_pause", GetFileIndexID(share)));
}

void ShareIndexResume(const std::string& share) {
  SendRequest(MakeRequest("index_resume", GetFileIndexID(share)));
}

void ShareIndexRename(const std::string& old_share, const std::string& new_share,
                      const std::string& new_path) {
  Json::Value request = MakeRequest("index_config_set", GetFileIndexID(old_share));
  Json::Value& changes = request["data"]["data"];
  changes["id"] = GetFileIndexID(new_share);
  changes["path"] = new_path;
  SendRequest(request);
}

void ShareIndexMigrate(const std::string& share, const std::string& new_path) {
  Json::Value request = MakeRequest("index_config_set", GetFileIndexID(share));
  request["data"]["data"]["path"] = new_path;
  SendRequest(request);
}

}  // namespace vexlo::fileindex::elastic
