#include "kavo/user.h"

#include <algorithm>
#include <cerrno>
#include <cstdlib>
#include <cstring>
#include <vector>

#include "platform/local/accounts.h"
#include "platform/local/boundary.h"

using kavo::local::Account;
using kavo::local::FailLookUp;
using kavo::local::Guarded;
using kavo::local::SetLastError;

namespace {

// The first of these that exists is the administrators' group: a NAS's own, then what the
// distributions have.
constexpr const char* kAdminGroups[] = {"administrators", "sudo", "wheel"};

template <typename Find>
int GetUser(Find find, KAVO_USER** user) {
  *user = nullptr;
  return Guarded([find, user] {
    Account account;
    if (const int error = find(account); error != 0) {
      return FailLookUp(error);
    }
    auto* record = static_cast<KAVO_USER*>(malloc(sizeof(KAVO_USER)));
    char* name = strdup(account.name.c_str());
    if (record == nullptr || name == nullptr) {
      free(record);
      free(name);
      errno = ENOMEM;
      return SetLastError(KAVO_ERR_SYSTEM);
    }
    *record = {name, account.uid, account.gid};
    *user = record;
    return 0;
  });
}

int IsAdmin(const char* user) {
  Account account;
  if (const int error = kavo::local::FindUser(user, account); error != 0) {
    return FailLookUp(error);
  }
  for (const char* name : kAdminGroups) {
    gid_t admins = 0;
    int error = kavo::local::FindGroup(name, admins);
    if (error == ENOENT) {
      continue;
    }
    std::vector<gid_t> groups;
    if (error == 0) {
      error = kavo::local::FindGroupsOf(account, groups);
    }
    if (error != 0) {
      return FailLookUp(error);
    }
    return std::find(groups.begin(), groups.end(), admins) == groups.end() ? 0 : 1;
  }
  return 0;
}

}  // namespace

int KAVOUserGet(const char* name, struct KAVO_USER** user) {
  return GetUser([name](Account& account) { return kavo::local::FindUser(name, account); }, user);
}

int KAVOUserGetByUID(uid_t uid, struct KAVO_USER** user) {
  return GetUser([uid](Account& account) { return kavo::local::FindUserByUid(uid, account); },
                 user);
}

void KAVOUserFree(struct KAVO_USER* user) {
  if (user != nullptr) {
    free(user->szName);
    free(user);
  }
}

int KLIBGroupIsAdminGroupMem(const char* user, int /*flags*/) {
  return Guarded([user] { return IsAdmin(user); });
}

int KAVOServiceHomePathGet(const char* user, char* path, size_t bytes) {
  return Guarded([user, path, bytes] {
    Account account;
    if (const int error = kavo::local::FindUser(user, account); error != 0) {
      return FailLookUp(error);
    }
    if (account.home.size() >= bytes) {
      errno = ERANGE;
      return SetLastError(KAVO_ERR_SYSTEM);
    }
    memcpy(path, account.home.c_str(), account.home.size() + 1);
    return 0;
  });
}
