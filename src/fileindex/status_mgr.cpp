#include "fileindex/status_mgr.h"

#include <sys/stat.h>

#include <cerrno>
#include <cstdint>
#include <cstring>
#include <ctime>

#include "common/check.h"
#include "common/error.h"
#include "common/file.h"
#include "common/json.h"
#include "common/lock.h"
#include "common/sdk/credentials.h"
#include "fileindex/communication.h"
#include "fileindex/paths.h"

namespace vexlo::fileindex {
namespace {

// Of 32 bits, wrapping, as everybody who reads these pauses has always seen them.
Json::Int64 SecondsOf(int hours) {
  return static_cast<int32_t>(static_cast<uint32_t>(hours) * 3600U);
}

}  // namespace

StatusMgr::StatusMgr() {
  const std::string path = kFileIndexStatusCfgPath.Get();
  errno = 0;
  // Taking a file for missing that only cannot be looked at would end in a save over it.
  VEXLO_CHECK_AT((LogSite{VEXLO_SOURCE, __LINE__, __func__,
                          "IsFileExist(kFileIndexStatusCfgPath) && "
                          "!data_.fromFile(kFileIndexStatusCfgPath)"}),
                 MayFileExist(path) && !JsonFromFile(data_, path), ERR_LOAD,
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

void StatusMgr::Pause(int hours) {
  const LockFile lock(kFileIndexStatusLockPath.Get(), /*exclusive=*/true);
  VEXLO_CHECK(hours < 0, ERR_BAD_PARAMETER, "Pause length should NOT be negative");
  const Json::Int64 resume_time = hours == 0 ? 0 : time(nullptr) + SecondsOf(hours);
  SaveResumeTime(resume_time);
  Json::Value data;
  data["resume_time"] = resume_time;
  SendCommandToDaemon("pause", data);
}

void StatusMgr::Resume() {
  const LockFile lock(kFileIndexStatusLockPath.Get(), /*exclusive=*/true);
  SaveResumeTime(-1);
  SendCommandToDaemon("resume", Json::Value());
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
    data_["share"].removeMember(share.data(), share.data() + share.size(), nullptr);
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

void StatusMgr::SaveResumeTime(Json::Int64 resume_time) {
  VEXLO_CHECK(!data_.isObject(), ERR_BAD_PARAMETER, "Not an object" + AppendData(data_));
  data_["resume_time"] = resume_time;
  Save();
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
