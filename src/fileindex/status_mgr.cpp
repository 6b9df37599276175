#include "fileindex/status_mgr.h"

#include <sys/stat.h>

#include <cerrno>
#include <cstring>

#include "common/check.h"
#include "common/error.h"
#include "common/file.h"
#include "common/json.h"
#include "common/lock.h"
#include "common/sdk/credentials.h"
#include "fileindex/paths.h"

namespace vexlo::fileindex {

StatusMgr::StatusMgr() {
  const std::string path = kFileIndexStatusCfgPath.Get();
  errno = 0;  // A text that is no JSON sets none.
  VEXLO_CHECK_AT((LogSite{VEXLO_SOURCE, __LINE__, __func__,
                          "IsFileExist(kFileIndexStatusCfgPath) && "
                          "!data_.fromFile(kFileIndexStatusCfgPath)"}),
                 IsFileExist(path) && !JsonFromFile(data_, path), ERR_LOAD,
                 "Cannot load json: " + path);
  if (data_.isNull()) {
    data_ = Json::objectValue;
  }
}

long StatusMgr::GetPauseInfo() const {
  long resume_time = -1;
  GetJsonValue(resume_time, data_, "resume_time", /*required=*/false);
  return resume_time;
}

unsigned int StatusMgr::GetShareStatus(const std::string& share) const {
  unsigned int bits = 0;
  GetJsonValue(bits, GetShares(), share, /*required=*/false);
  return bits;
}

void StatusMgr::SetShareStatus(const std::string& share, int bits) {
  const LockFile lock(kFileIndexStatusLockPath.Get(), /*exclusive=*/true);
  const unsigned int changed = GetShareStatus(share) | static_cast<unsigned int>(bits);
  data_["share"][share] = changed;
  Save();
}

void StatusMgr::UnsetShareStatus(const std::string& share, int bits) {
  const LockFile lock(kFileIndexStatusLockPath.Get(), /*exclusive=*/true);
  const unsigned int changed = GetShareStatus(share) & ~static_cast<unsigned int>(bits);
  data_["share"][share] = changed;
  Save();
}

void StatusMgr::ClearShareStatus(const std::string& share) {
  const LockFile lock(kFileIndexStatusLockPath.Get(), /*exclusive=*/true);
  if (GetShares().isMember(share)) {
    data_["share"].removeMember(share);
  }
  Save();
}

void StatusMgr::Save() const {
  const sdk::SDKCredentials root("root");
  const std::string path = kFileIndexStatusCfgPath.Get();
  VEXLO_CHECK_AT(
      (LogSite{VEXLO_SOURCE, __LINE__, __func__, "!data_.toFile(kFileIndexStatusCfgPath)"}),
      !JsonToFile(data_, path), ERR_SAVE, "Failed to save json: " + path);
  VEXLO_CHECK_AT(
      (LogSite{VEXLO_SOURCE, __LINE__, __func__, "-1 == chmod(kFileIndexStatusCfgPath, 0644)"}),
      -1 == chmod(path.c_str(), 0644), ERR_SYSTEM,
      std::string("chmod failed, reason=") + strerror(errno));
}

// The words of all shares: an object, also where the file has none or null.
Json::Value StatusMgr::GetShares() const {
  Json::Value shares;
  GetJsonValue(shares, data_, "share", /*required=*/false);
  VEXLO_CHECK(!shares.isNull() && !shares.isObject(), ERR_BAD_PARAMETER,
              "Not an object" + AppendData(data_));
  return shares.isNull() ? Json::Value(Json::objectValue) : shares;
}

}  // namespace vexlo::fileindex
