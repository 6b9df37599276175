// Users and groups as the system knows them, those of directory services included. All functions
// are safe to call from several threads. Not installed.
#ifndef PLATFORM_LOCAL_ACCOUNTS_H_
#define PLATFORM_LOCAL_ACCOUNTS_H_

#include <sys/types.h>

#include <string>
#include <vector>

namespace kavo::local {

struct Account {
  std::string name;  // As the system spells it.
  uid_t uid = 0;
  gid_t gid = 0;  // The primary group.
  std::string home;
};

// Each returns 0, or the error: ENOENT when there is none of that name or number. They leave the
// last error alone, as a caller may have another answer to that.
int FindUser(const char* name, Account& account);
int FindUserByUid(uid_t uid, Account& account);
int FindGroup(const char* name, gid_t& gid);

// Sets errno and the last error for what one of those returned. Returns -1.
int FailLookUp(int error) noexcept;

// All groups of a user, the primary one among them; 0 or the error.
int FindGroupsOf(const Account& account, std::vector<gid_t>& groups);

// The supplementary groups of the process; false with errno when they cannot be told.
bool GetOwnGroups(std::vector<gid_t>& groups);

}  // namespace kavo::local

#endif  // PLATFORM_LOCAL_ACCOUNTS_H_
