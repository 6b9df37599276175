#include "kavo/acl.h"

#include <sys/stat.h>
#include <unistd.h>

#include <cerrno>
#include <new>
#include <vector>

#include "platform/local/access.h"
#include "platform/local/accounts.h"

namespace {

bool GetOwnAccess(const char* path, unsigned& perm) {
  struct stat info {};
  std::vector<gid_t> groups;
  if (stat(path, &info) != 0 || !kavo::local::GetOwnGroups(groups)) {
    return false;
  }
  groups.push_back(getegid());
  return kavo::local::GetAccess(path, info, geteuid(), groups, perm);
}

}  // namespace

int KAVOACLPermGet(const char* path, unsigned* mask) {
  *mask = 0;
  try {
    unsigned perm = 0;
    if (!GetOwnAccess(path, perm)) {
      return -1;
    }
    *mask = perm;
    return 0;
  } catch (const std::bad_alloc&) {
    errno = ENOMEM;
    return -1;
  }
}
