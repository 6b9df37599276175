#include <sys/stat.h>
#include <sys/statvfs.h>

#include <cerrno>
#include <vector>

#include "kavo/acl.h"
#include "kavo/share.h"
#include "platform/local/access.h"
#include "platform/local/accounts.h"
#include "platform/local/boundary.h"

using kavo::local::SetLastError;

namespace {

// 1 when the path lies on a file system that is mounted read-only, 0 when not, -1 with errno.
int IsMountedReadOnly(const char* path) {
  struct statvfs file_system {};
  while (statvfs(path, &file_system) != 0) {
    if (errno != EINTR) {
      return -1;
    }
  }
  return (file_system.f_flag & ST_RDONLY) != 0 ? 1 : 0;
}

int GetPrivilege(const char* user, const char* path) {
  kavo::local::Account account;
  std::vector<gid_t> groups;
  int error = kavo::local::FindUser(user, account);
  if (error == 0) {
    error = kavo::local::FindGroupsOf(account, groups);
  }
  if (error != 0) {
    return kavo::local::FailLookUp(error);
  }
  struct stat info {};
  if (stat(path, &info) != 0) {
    return SetLastError(KAVO_ERR_SYSTEM);
  }
  if (!S_ISDIR(info.st_mode)) {
    errno = ENOTDIR;
    return SetLastError(KAVO_ERR_SYSTEM);
  }
  unsigned perm = 0;
  if (!kavo::local::GetAccess(path, info, account.uid, groups, perm)) {
    return SetLastError(KAVO_ERR_SYSTEM);
  }
  const int is_read_only = IsMountedReadOnly(path);
  if (is_read_only < 0) {
    return SetLastError(KAVO_ERR_SYSTEM);
  }
  // Without the right to search a directory nothing in it is reached.
  if ((perm & KAVO_ACL_EXECUTE) == 0) {
    return KAVO_SHARE_PRIVILEGE_NONE;
  }
  int privilege = KAVO_SHARE_PRIVILEGE_NONE;
  privilege |= (perm & KAVO_ACL_READ) != 0 ? KAVO_SHARE_PRIVILEGE_READ : 0;
  privilege |= (perm & KAVO_ACL_WRITE) != 0 && is_read_only == 0 ? KAVO_SHARE_PRIVILEGE_WRITE : 0;
  return privilege;
}

}  // namespace

int KAVOShareUserPrivCalc(const char* user, const struct KAVO_SHARE* share) {
  return kavo::local::Guarded([user, share] { return GetPrivilege(user, share->szPath); });
}
