#include "kavo/acl.h"

#include <fcntl.h>
#include <grp.h>
#include <gtest/gtest.h>
#include <sys/acl.h>
#include <sys/statvfs.h>

#include <algorithm>
#include <random>
#include <tuple>
#include <vector>

#include "kavo/last_error.h"
#include "kavo/share.h"
#include "support/accounts.h"
#include "support/faults.h"
#include "support/temp_folder.h"

// The library's own way to the file system's ACLs.
INTERPOSED acl_t acl_get_file(const char* path, acl_type_t type) {
  static const auto real = REAL_FUNCTION(acl_t, acl_get_file, (const char*, acl_type_t));
  return ScopedFault::Fires("acl_get_file") ? nullptr : real(path, type);
}

bool is_mounted_read_only = false;

INTERPOSED int statvfs(const char* path, struct statvfs* info) noexcept {
  static const auto real = REAL_FUNCTION(int, statvfs, (const char*, struct statvfs*));
  const int result = real(path, info);
  info->f_flag = (info->f_flag & ~ST_RDONLY) | (is_mounted_read_only ? ST_RDONLY : 0);
  return result;
}

int GetPrivilege(const std::string& user, std::string path) {
  const KAVO_SHARE share{nullptr, path.data(), 0};
  return KAVOShareUserPrivCalc(user.c_str(), &share);
}

int WantedPrivilege(unsigned rights) {
  const bool may_write = (rights & W_OK) != 0 && !is_mounted_read_only;
  return (rights & X_OK) == 0 ? 0 : ((rights & R_OK) != 0 ? 1 : 0) | (may_write ? 2 : 0);
}

bool SetAcl(const std::string& path, const std::string& text) {
  const acl_t acl = acl_from_text(text.c_str());
  const bool is_set = acl_set_file(path.c_str(), ACL_TYPE_ACCESS, acl) == 0;
  acl_free(acl);
  return is_set;
}

TEST(KAVOACLPermGet, AgreesWithTheKernel) {
  const TempFolder folder;
  if (chown(folder.Path().c_str(), 60001, 60001) != 0 || setgroups(0, nullptr) != 0 ||
      seteuid(60001) != 0 || seteuid(0) != 0) {
    GTEST_SKIP() << "only root takes on other identities";
  }
  WriteText(folder / "file", "x");
  ASSERT_EQ(mkdir((folder / "directory").c_str(), 0700), 0);
  for (unsigned seed = 0; seed < 2000; ++seed) {
    std::mt19937 random(seed);
    const auto below = [&random](unsigned limit) {
      return static_cast<unsigned>(random() % limit);
    };
    // Ids so few that entries, owners and callers meet often.
    const auto id = [&below] { return 60001 + below(4); };
    const auto perm = [&below] {
      return std::string{"-r"[below(2)], "-w"[below(2)], "-x"[below(2)]};
    };
    const std::string path = folder / (below(4) == 0 ? "directory" : "file");
    ASSERT_EQ(chown(path.c_str(), id(), id()), 0);
    std::string acl = "u::" + perm() + ",g::" + perm() + ",o::" + perm();
    if (below(4) != 0) {
      acl += ",m::" + perm();
      for (unsigned named = 60001; named <= 60004; ++named) {
        acl += below(3) == 0 ? ",u:" + std::to_string(named) + ":" + perm() : "";
        acl += below(3) == 0 ? ",g:" + std::to_string(named) + ":" + perm() : "";
      }
    }
    ASSERT_TRUE(SetAcl(path, acl)) << acl;
    // A file system without ACLs says so; the mode is all there is then.
    const ScopedFault fault(below(2) == 0 && acl.size() < 25 ? "acl_get_file" : "", ENOTSUP, 1,
                            /*lasting=*/true);
    std::vector<gid_t> groups(below(4));
    std::generate(groups.begin(), groups.end(), id);
    ASSERT_EQ(setgroups(groups.size(), groups.data()), 0);
    ASSERT_EQ(setegid(id()), 0);
    ASSERT_EQ(seteuid(below(20) == 0 ? 0 : id()), 0);
    unsigned mask = 99;
    EXPECT_EQ(KAVOACLPermGet(path.c_str(), &mask), 0) << strerror(errno);
    // Right by right: asked for all at once, the kernel wants one entry to allow them all.
    unsigned want = 0;
    for (const int right : {R_OK, W_OK, X_OK}) {
      want |= faccessat(AT_FDCWD, path.c_str(), right, AT_EACCESS) == 0 ? right : 0;
    }
    EXPECT_EQ(mask, want) << acl << " for " << geteuid() << ":" << getegid();
    groups.push_back(getegid());
    test_users = {{"tester", geteuid(), getegid(), groups}};
    ASSERT_TRUE(seteuid(0) == 0 && setegid(0) == 0 && setgroups(0, nullptr) == 0);
    if (path.ends_with("/directory")) {
      is_mounted_read_only = below(4) == 0;
      EXPECT_EQ(GetPrivilege("tester", path), WantedPrivilege(want)) << acl;
    }
    ASSERT_FALSE(HasFailure()) << "seed " << seed;
  }
}

TEST(KAVOACLPermGet, WhatCannotBeToldIsNoRight) {
  const TempFolder folder;
  unsigned mask = 99;
  EXPECT_EQ(KAVOACLPermGet((folder / "missing").c_str(), &mask), -1);
  EXPECT_EQ(errno, ENOENT);
  EXPECT_EQ(mask, 0U);
  WriteText(folder / "file", "x");
  test_users = {{"tester", 0, 0, {0}}};
  using Case = std::tuple<const char*, const char*, int, int>;
  for (const auto& [user, name, error, kind] :
       {Case{"no-such-user", ".", ENOENT, KAVO_ERR_NOT_FOUND},
        Case{"tester", "missing", ENOENT, KAVO_ERR_SYSTEM},
        Case{"tester", "file", ENOTDIR, KAVO_ERR_SYSTEM}}) {
    EXPECT_EQ(GetPrivilege(user, folder / name), -1) << name;
    EXPECT_EQ(errno, error) << name;
    EXPECT_EQ(KLIBCErrGet(), kind) << name;
  }
}
