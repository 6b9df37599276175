#include "platform/local/accounts.h"

#include <grp.h>
#include <pwd.h>
#include <unistd.h>

#include <cerrno>
#include <memory>

#include "platform/local/last_error.h"

namespace kavo::local {
namespace {

constexpr size_t kFirstBufferBytes = 1024;
constexpr size_t kMaxBufferBytes = size_t{1} << 24;  // No directory service's record comes near it.
constexpr int kFirstGroups = 32;

// find(entry, buffer, bytes, found) is one of the C library's reentrant look-ups.
template <typename Entry, typename Find, typename Take>
int LookUp(Find find, Take take) {
  for (size_t bytes = kFirstBufferBytes; bytes <= kMaxBufferBytes; bytes *= 2) {
    const auto buffer = std::make_unique_for_overwrite<char[]>(bytes);
    Entry entry{};
    Entry* found = nullptr;
    int error = 0;
    do {
      error = find(&entry, buffer.get(), bytes, &found);
    } while (error == EINTR);
    if (error == ERANGE) {
      continue;
    }
    if (found != nullptr) {
      take(*found);
      return 0;
    }
    // Some name services tell that there is no such entry by an error.
    return error == 0 || error == ESRCH ? ENOENT : error;
  }
  return ERANGE;
}

template <typename Find>
int LookUpUser(Find find, Account& account) {
  return LookUp<struct passwd>(find, [&account](const struct passwd& entry) {
    // Not every name service fills in what its users do without.
    account = {entry.pw_name, entry.pw_uid, entry.pw_gid,
               entry.pw_dir == nullptr ? "" : entry.pw_dir};
  });
}

}  // namespace

int FindUser(const char* name, Account& account) {
  return LookUpUser([name](auto... rest) { return getpwnam_r(name, rest...); }, account);
}

int FindUserByUid(uid_t uid, Account& account) {
  return LookUpUser([uid](auto... rest) { return getpwuid_r(uid, rest...); }, account);
}

int FindGroup(const char* name, gid_t& gid) {
  return LookUp<struct group>([name](auto... rest) { return getgrnam_r(name, rest...); },
                              [&gid](const struct group& entry) { gid = entry.gr_gid; });
}

int FailLookUp(int error) noexcept {
  errno = error;
  return SetLastError(error == ENOENT ? KAVO_ERR_NOT_FOUND : KAVO_ERR_SYSTEM);
}

int FindGroupsOf(const Account& account, std::vector<gid_t>& groups) {
  int room = kFirstGroups;
  while (true) {
    groups.resize(static_cast<size_t>(room));
    int count = room;
    if (getgrouplist(account.name.c_str(), account.gid, groups.data(), &count) >= 0) {
      groups.resize(static_cast<size_t>(count));
      return 0;
    }
    if (count <= room) {  // It is not for want of room.
      return ENOMEM;
    }
    room = count;
  }
}

bool GetOwnGroups(std::vector<gid_t>& groups) {
  while (true) {
    const int count = getgroups(0, nullptr);
    if (count < 0) {
      return false;
    }
    groups.resize(static_cast<size_t>(count));
    const int got = count == 0 ? 0 : getgroups(count, groups.data());
    if (got >= 0) {
      groups.resize(static_cast<size_t>(got));
      return true;
    }
    if (errno != EINVAL) {  // EINVAL: the list has grown in between.
      return false;
    }
  }
}

}  // namespace kavo::local
