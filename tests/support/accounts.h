// Users of the test's own beside the system's, and groups in place of those: what the C library's
// look-ups find in a program that includes this.
#ifndef SUPPORT_ACCOUNTS_H_
#define SUPPORT_ACCOUNTS_H_

#include <grp.h>
#include <pwd.h>

#include <algorithm>
#include <map>
#include <string>
#include <vector>

#include "support/faults.h"

struct TestUser {
  std::string name;
  uid_t uid;
  gid_t gid;
  std::vector<gid_t> groups;  // All of them.
  std::string home = "/";
};
inline std::vector<TestUser> test_users;
inline std::map<std::string, gid_t> test_groups;

// NOLINTBEGIN(misc-definitions-in-headers): a program includes this once.
#define TEST_USER_LOOK_UP(function, key, member)                                                   \
  INTERPOSED int function(key wanted, passwd* entry, char* buffer, size_t size, passwd** found) {  \
    for (TestUser & user : test_users) {                                                           \
      if (user.member == wanted) {                                                                 \
        *entry = {user.name.data(), buffer, user.uid, user.gid, buffer, user.home.data(), buffer}; \
        *found = size < user.home.size() ? nullptr : entry;                                        \
        return *found == nullptr ? ERANGE : 0;                                                     \
      }                                                                                            \
    }                                                                                              \
    const auto real = REAL_FUNCTION(int, function, (key, passwd*, char*, size_t, passwd**));       \
    return ScopedFault::Fires(#function) ? errno : real(wanted, entry, buffer, size, found);       \
  }
TEST_USER_LOOK_UP(getpwnam_r, const char*, name)
TEST_USER_LOOK_UP(getpwuid_r, uid_t, uid)

INTERPOSED int getgrnam_r(const char* name, group* entry, char*, size_t, group** found) {
  *entry = {nullptr, nullptr, test_groups.contains(name) ? test_groups[name] : 0, nullptr};
  *found = test_groups.contains(name) ? entry : nullptr;
  return ScopedFault::Fires("getgrnam_r") ? *found = nullptr, errno : 0;
}

INTERPOSED int getgrouplist(const char* name, gid_t, gid_t* groups, int* count) {
  for (const TestUser& user : test_users) {
    if (user.name == name && !ScopedFault::Fires("getgrouplist")) {
      const int room = *count;
      *count = static_cast<int>(user.groups.size());
      std::copy_n(user.groups.begin(), std::min(room, *count), groups);
      return *count > room ? -1 : *count;
    }
  }
  return -1;  // Memory is short; the count stays.
}
// NOLINTEND(misc-definitions-in-headers)

#endif  // SUPPORT_ACCOUNTS_H_
