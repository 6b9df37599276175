#include "common/sdk/share.h"

#include <sys/types.h>

#include "common/check.h"
#include "common/error.h"
#include "common/lock.h"
#include "common/sdk/mutex.h"
#include "kavo/index_path.h"
#include "kavo/last_error.h"
#include "kavo/quota.h"
#include "kavo/share.h"
#include "kavo/string_list.h"

namespace vexlo::sdk {
namespace {

constexpr uid_t kRoot = 0;
constexpr uint64_t kIndexRoomBytes = uint64_t{100} * 1024 * 1024;
constexpr size_t kPathBytes = 4096;
constexpr size_t kIndexIdBytes = 1024;
constexpr int kListBytes = 1024;

}  // namespace

// The conditions are logged as they are written here, and log monitors match them.

SDKShare::SDKShare(const std::string& share_name) : name_(share_name) {
  const LockMutex lock(SDKMutex());
  // Of which the platform would see the part before the NUL, which is another share.
  VEXLO_CHECK(share_name.find('\0') != std::string::npos, ERR_SHARE_NOT_FOUND, share_name);
  VEXLO_CHECK(0 > KAVOShareGet(share_name.c_str(), &share_info_) || !share_info_,
              ERR_SHARE_NOT_FOUND, share_name);
}

SDKShare::~SDKShare() {
  const LockMutex lock(SDKMutex());
  if (share_info_ != nullptr) {
    KAVOShareFree(share_info_);
  }
}

std::string SDKShare::GetPath() const { return share_info_->szPath; }

bool SDKShare::CanBeIndexed() const {
  int is_encrypted = 0;
  int is_readonly = 0;
  const LockMutex lock(SDKMutex());
  VEXLO_CHECK(0 > KLIBShareIsEncryptedGet(share_info_, &is_encrypted), ERR_SYSTEM,
              "KLIBShareis_encryptedGet failed, share=" + name_);
  VEXLO_CHECK(0 > KLIBShareIsReadOnlyGet(share_info_, &is_readonly), ERR_SYSTEM,
              "KLIBShareis_readonlyGet failed, share=" + name_);
  return is_encrypted == 0 && is_readonly == 0;
}

bool SDKShare::IsLocked() const {
  int is_encrypted = 0;
  const LockMutex lock(SDKMutex());
  return KLIBShareIsEncryptedGet(share_info_, &is_encrypted) >= 0 && is_encrypted != 0;
}

bool SDKShare::IsEncryption() const {
  int is_encryption = 0;
  const LockMutex lock(SDKMutex());
  VEXLO_CHECK(0 > KLIBShareIsEncryptionGet(share_info_, &is_encryption), ERR_SYSTEM,
              "KLIBShareIsEncryptionGet failed, share=" + name_);
  return is_encryption == 1;
}

bool SDKShare::IsEnableRecycleBin() const {
  int is_enabled = 0;
  const LockMutex lock(SDKMutex());
  VEXLO_CHECK(0 > KLIBShareRecycleStatusGet(share_info_, &is_enabled), ERR_SYSTEM,
              "KLIBShareRecycleStatusGet failed, share=" + name_);
  return is_enabled == 1;
}

bool SDKShare::IsHideUnReadable() const {
  int is_hidden = 0;
  return KLIBShareHideUnreadableGet(share_info_, &is_hidden) >= 0 && is_hidden == 1;
}

bool SDKShare::IsSpaceEnough() const {
  const LockMutex lock(SDKMutex());
  if (KAVOQuotaIsEnough(kRoot, share_info_->szPath, kIndexRoomBytes) != 0) {
    return true;
  }
  const int error = KLIBCErrGet();
  return error != KAVO_ERR_QUOTA && error != KAVO_ERR_NO_SPACE;
}

uint32_t SDKShare::GetFTPPrivilege() const { return share_info_->ftpPrivilege; }

std::string SDKShare::GetQueuePath() const {
  if (queue_path_.empty()) {
    char path[kPathBytes] = {};
    const LockMutex lock(SDKMutex());
    VEXLO_CHECK(0 > FILEIDXQueuePathCompose(share_info_->szPath, path, sizeof(path)), ERR_SYSTEM,
                "FILEIDXQueuePathCompose failed, share=" + name_);
    queue_path_ = path;
  }
  return queue_path_;
}

std::string SDKShare::GetDBPath() const {
  if (db_path_.empty()) {
    char path[kPathBytes] = {};
    const LockMutex lock(SDKMutex());
    VEXLO_CHECK(0 > FILEIDXDBPathCompose(share_info_->szPath, path, sizeof(path)), ERR_SYSTEM,
                "FILEIDXDBPathCompose failed, share=" + name_);
    db_path_ = path;
  }
  return db_path_;
}

std::string SDKShare::GetDBName() const {
  if (db_name_.empty()) {
    char name[kIndexIdBytes] = {};
    const LockMutex lock(SDKMutex());
    VEXLO_CHECK(0 > FILEIDXGetIndexID(share_info_->szName, name, sizeof(name)), ERR_SYSTEM,
                "FILEIDXGetIndexID failed, share=" + name_);
    db_name_ = name;
  }
  return db_name_;
}

int SDKShare::GetPrivilege(const std::string& user_name) const {
  const auto cached = privileges_.find(user_name);
  if (cached != privileges_.end()) {
    return cached->second;
  }
  const int privilege = KAVOShareUserPrivCalc(user_name.c_str(), share_info_);
  privileges_.emplace(user_name, privilege);
  return privilege;
}

std::set<std::string> SDKShare::Enum() {
  std::set<std::string> names;
  KLIBCSZLIST* share_list = KLIBCSzListAlloc(kListBytes);
  VEXLO_CHECK_AT((LogSite{VEXLO_SOURCE, __LINE__, __func__,
                          "nullptr == (share_list = KLIBCSzListAlloc(BUFSIZ))"}),
                 share_list == nullptr, ERR_SHARE_ENUM, "KLIBCSzListAlloc failed");
  const KLIB_SHARE_ENUM enum_func = {[](const KAVO_SHARE*) { return 0; }, 0};
  VEXLO_CHECK(0 > KLIBShareEnum(&share_list, &enum_func), ERR_SHARE_ENUM, "KLIBShareEnum failed");
  for (int i = 0; i < share_list->nItem; ++i) {
    names.insert(KLIBCSzListGet(share_list, i));
  }
  // The list is left alone: whose its strings are is not the same on every platform.
  return names;
}

}  // namespace vexlo::sdk
