#include "kavo/credentials.h"

#include <grp.h>
#include <sys/stat.h>
#include <syslog.h>
#include <unistd.h>

#include <cerrno>
#include <string_view>
#include <vector>

#include "kavo/local/shares.h"
#include "platform/local/accounts.h"
#include "platform/local/boundary.h"

using kavo::local::Account;
using kavo::local::FailLookUp;
using kavo::local::FindGroupsOf;
using kavo::local::SetLastError;

namespace {

// What setgroups(), setegid() and seteuid() set, for the whole process.
struct Identity {
  uid_t uid = 0;
  gid_t gid = 0;
  std::vector<gid_t> groups;
};

// Whether the name means the owner of the root folder.
bool IsFolderOwner(std::string_view name) { return name == "root" && !kavo::local::Root().empty(); }

// The owner of the root folder. 0, or -1 with errno and the last error.
int FindFolderOwner(Account& account) {
  struct stat info {};
  if (stat(kavo::local::Root().c_str(), &info) != 0) {
    return SetLastError(KAVO_ERR_SYSTEM);
  }
  const int error = kavo::local::FindUserByUid(info.st_uid, account);
  if (error == ENOENT) {  // Containers are run as users that no one has entered anywhere.
    account = {"", info.st_uid, info.st_gid, ""};
    return 0;
  }
  return error == 0 ? 0 : FailLookUp(error);
}

// Gives the process the supplementary groups, group and user of `target`, or leaves it as `before`
// and returns false with errno.
bool Switch(const Identity& before, const Identity& target) {
  // Only root sets groups. The real or the saved user id may still be root's.
  if (before.uid != 0 && seteuid(0) != 0) {
    return false;
  }
  const bool groups_set = setgroups(target.groups.size(), target.groups.data()) == 0;
  const bool group_set = groups_set && setegid(target.gid) == 0;
  if (group_set && seteuid(target.uid) == 0) {
    return true;
  }
  const int error = errno;
  bool restored = !groups_set || setgroups(before.groups.size(), before.groups.data()) == 0;
  restored = (!group_set || setegid(before.gid) == 0) && restored;
  restored = (before.uid == 0 || seteuid(before.uid) == 0) && restored;
  if (!restored) {
    syslog(LOG_CRIT,
           "kavoplatform: the identity before a failed change is not back: %u:%u for %u:%u",
           geteuid(), getegid(), before.uid, before.gid);
  }
  errno = error;
  return false;
}

// 0, or -1 with errno and the last error.
int BecomeUser(const char* name) {
  const bool is_folder_owner = IsFolderOwner(name);
  Account account;
  if (is_folder_owner) {
    if (FindFolderOwner(account) != 0) {
      return -1;
    }
  } else if (const int error = kavo::local::FindUser(name, account); error != 0) {
    return FailLookUp(error);
  }
  Identity before{geteuid(), getegid(), {}};
  // The folder's owner is who administers it under any group: an ordinary user could not get the
  // one that the user database gives.
  if (before.uid == account.uid && (before.gid == account.gid || is_folder_owner)) {
    return 0;
  }
  Identity target{account.uid, account.gid, {account.gid}};
  if (!account.name.empty()) {
    if (const int error = FindGroupsOf(account, target.groups); error != 0) {
      return FailLookUp(error);
    }
  }
  return kavo::local::GetOwnGroups(before.groups) && Switch(before, target)
             ? 0
             : SetLastError(KAVO_ERR_SYSTEM);
}

}  // namespace

bool ResetCredentialsByName(const char* name, bool /*keep_saved*/) {
  return kavo::local::Guarded([name] { return BecomeUser(name); }) == 0;
}
