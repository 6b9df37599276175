// One shared folder of the NAS.
#ifndef COMMON_SDK_SHARE_H_
#define COMMON_SDK_SHARE_H_

#include <cstdint>
#include <map>
#include <set>
#include <string>

#include "common/export.h"

struct KAVO_SHARE;

// The platform as the library sees it: shares, and the identity of the process.
namespace vexlo::sdk {

// A share by its name, as the platform has it now. Built on the stack where it is needed: what is
// cached (the paths, the index name, privileges) is never looked up again by the same object. For
// one thread. Calls into the platform are made under SDKMutex(), except where a comment says
// otherwise, so a holder of that mutex must not call them.
class VEXLO_EXPORT SDKShare {
 public:
  // Throws Error 800 with the name when there is no such share.
  explicit SDKShare(const std::string& share_name);
  ~SDKShare();
  SDKShare(const SDKShare&) = delete;
  SDKShare& operator=(const SDKShare&) = delete;

  // As it was asked for.
  const std::string& GetName() const { return name_; }

  // The share's directory on its volume: "/volume1/photo".
  std::string GetPath() const;

  // False when the share is locked by encryption or cannot be written. Throws Error 502.
  bool CanBeIndexed() const;

  // The first of those two reasons: locked at present, so that nothing in it can be read. False,
  // too, when the platform cannot tell.
  bool IsLocked() const;

  // Whether the share is of the encrypted kind, be it open now: its folders are mount points by
  // nature. Not the question that CanBeIndexed() asks. Throws Error 502.
  bool IsEncryption() const;

  // Throws Error 502.
  bool IsEnableRecycleBin() const;

  // Whether users do not see what they may not read; false, too, when the platform cannot tell.
  // Takes no lock.
  bool IsHideUnReadable() const;

  // Whether the share's volume has 100 MiB left, which an index needs to grow. Only what the
  // platform calls lack of space or quota is a no: a question that fails otherwise holds nobody up.
  bool IsSpaceEnough() const;

  // As the administrator set it; takes no lock.
  uint32_t GetFTPPrivilege() const;

  // The file in which the share's changes are queued, the directory of its index database, and the
  // name of its index in the search engine. Cached. Throw Error 502.
  std::string GetQueuePath() const;
  std::string GetDBPath() const;
  std::string GetDBName() const;

  // What the user may do in the share: the platform's number, unchanged, be it an error of its own.
  // Cached. Takes no lock.
  int GetPrivilege(const std::string& user_name) const;

  // The names of all shares, those that cannot be indexed among them. Throws Error 121. Takes no
  // lock.
  static std::set<std::string> Enum();

 private:
  struct KAVO_SHARE* share_info_ = nullptr;  // Never null once constructed.
  std::string name_;
  mutable std::map<std::string, int32_t> privileges_;  // By user.
  mutable std::string queue_path_;
  mutable std::string db_path_;
  mutable std::string db_name_;
};

}  // namespace vexlo::sdk

#endif  // COMMON_SDK_SHARE_H_
