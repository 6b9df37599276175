#include "fileindex/folder.h"

#include <ctime>

#include "common/check.h"
#include "common/error.h"
#include "common/json.h"
#include "common/sdk/share.h"
#include "fileindex/queue_mgr.h"
#include "fileindex/status_mgr.h"
#include "fileindex/util/path_policy.h"
#include "fileindex/util/share_path.h"

namespace vexlo::fileindex {
namespace {

constexpr const char* kAll = "all";

// 0 is a pause without end, -1 none.
bool IsPauseOn(long resume_time) { return resume_time == 0 || resume_time > time(nullptr); }

}  // namespace

Folder::Folder(const Json::Value& data) {
  GetJsonValue(path_, data, "path", /*required=*/true);
  GetJsonValue(name_, data, "name", /*required=*/true);
  GetJsonValue(document_, data, "document", /*required=*/true);
  GetJsonValue(audio_, data, "audio", /*required=*/true);
  GetJsonValue(video_, data, "video", /*required=*/true);
  GetJsonValue(photo_, data, "photo", /*required=*/true);
  GetJsonValue(owner_, data, "owner", /*required=*/false);
  GetJsonValue(group_, data, "group", /*required=*/false);
  GetJsonValue(privileged_, data, "privileged", /*required=*/false);
  GetJsonValue(paused_, data, "paused", /*required=*/false);
  GetJsonValue(volume_to_be_clean_, data, "volume_to_be_clean", /*required=*/false);
  Validate();
}

Folder::Folder(const std::string& path, const std::string& name, const std::string& owner,
               const std::string& /*group*/, bool document, bool audio, bool video, bool photo,
               bool privileged, bool paused)
    : path_(path),
      name_(name),
      owner_(owner),
      document_(document),
      audio_(audio),
      video_(video),
      photo_(photo),
      privileged_(privileged),
      paused_(paused) {
  Validate();
}

std::string Folder::GetShare() const {
  if (share_.empty()) {
    GetShareNameByPath(share_, path_);
  }
  return share_;
}

std::string Folder::GetFullPath() const {
  if (full_path_.empty()) {
    fileindex::GetFullPath(full_path_, path_);
  }
  return full_path_;
}

void Folder::SetShare(const std::string& share) {
  path_ = ReplacePathShare(path_, share, GetShare());
  share_ = share;
}

Json::Value Folder::GetData() const {
  Json::Value data = GetIndexCfg();
  data["path"] = path_;
  data["name"] = name_;
  data["paused"] = paused_;
  data["owner"] = owner_;
  data["group"] = group_;
  data["privileged"] = privileged_;
  data["volume_to_be_clean"] = volume_to_be_clean_;
  return data;
}

Json::Value Folder::GetIndexCfg() const {
  Json::Value cfg;
  cfg["document"] = document_;
  cfg["audio"] = audio_;
  cfg["video"] = video_;
  cfg["photo"] = photo_;
  return cfg;
}

bool Folder::IsIndexing() const {
  const sdk::SDKShare share(GetShare());
  return QueueMgr(share.GetQueuePath()).IsFullPathProcessing(GetFullPath());
}

void Folder::GetStatus(Json::Value& out) const {
  const StatusMgr status;
  if (!CanPathBeIndexed(path_)) {
    out["text"] = "error";
    out["desc"] = "invalid_path";
  } else if ((status.GetShareStatus(GetShare()) & SS_NEED_REINDEX) != 0) {
    out["text"] = "need_reindex";
  } else if (!IsIndexing()) {
    out["text"] = "finished";
  } else {
    out["text"] = IsPauseOn(status.GetPauseInfo()) ? "paused" : "processing";
  }
}

Json::Value Folder::GetDataWithAdditional(const Json::Value& additional) const {
  Json::Value data = GetData();
  VEXLO_CHECK_AT((LogSite{VEXLO_SOURCE, __LINE__, __func__, "!addiitionals.isArray()"}),
                 !additional.isArray(), ERR_BAD_PARAMETER, JsonToStyledString(additional));
  for (const Json::Value& it : additional) {
    VEXLO_CHECK(!it.isString(), ERR_BAD_PARAMETER, JsonToStyledString(it));
    const std::string name = it.asString();
    VEXLO_CHECK(name != "status", ERR_BAD_PARAMETER, "Unknown additioal: " + name);
    GetStatus(data["additional"]["status"]);
  }
  return data;
}

void Folder::Validate() const {
  VEXLO_CHECK_AT((LogSite{VEXLO_SOURCE, __LINE__, __func__, "kAll == group_"}), kAll == group_,
                 ERR_BAD_PARAMETER, "\"all\" is reserved group name");
}

}  // namespace vexlo::fileindex
