#include "kavo/user.h"

#include <gtest/gtest.h>

#include <tuple>

#include "kavo/last_error.h"
#include "support/accounts.h"

TEST(KAVOUserGet, TellsOfUsersByNameAndNumber) {
  test_users = {{"big", 60001, 60002, {}, std::string(5000, 'x')}};  // Fills more than one buffer.
  using Case = std::tuple<const char*, uid_t, gid_t, size_t, int, int>;
  for (const auto& [name, uid, gid, home_bytes, error, kind] :
       {Case{"root", 0, 0, 5, 0, 0}, Case{"big", 60001, 60002, 5000, 0, 0},
        Case{"gone", 3999999999, 0, 0, ENOENT, KAVO_ERR_NOT_FOUND},
        Case{"gone", 3999999999, 0, 0, EIO, KAVO_ERR_SYSTEM}}) {
    const auto is_right = [error = error, kind = kind](int result) {
      return error == 0 ? result == 0 : result < 0 && errno == error && KLIBCErrGet() == kind;
    };
    for (const bool by_name : {true, false}) {
      const ScopedFault fault(error != EIO ? "" : by_name ? "getpwnam_r" : "getpwuid_r", error);
      KAVO_USER stale{};
      KAVO_USER* user = &stale;
      EXPECT_TRUE(is_right(by_name ? KAVOUserGet(name, &user) : KAVOUserGetByUID(uid, &user)));
      ASSERT_EQ(user != nullptr, error == 0) << name;
      EXPECT_TRUE(user == nullptr ||
                  (user->uid == uid && user->gid == gid && user->szName == std::string(name)));
      KAVOUserFree(user);
    }
    char home[5001] = "before";
    const ScopedFault fault(error == EIO ? "getpwnam_r" : "", error);
    EXPECT_TRUE(is_right(KAVOServiceHomePathGet(name, home, home_bytes + 1))) << name;
    EXPECT_EQ(strlen(home), error == 0 ? home_bytes : 6);
    EXPECT_TRUE(error != 0 || (KAVOServiceHomePathGet(name, home, home_bytes) < 0 &&
                               errno == ERANGE && strlen(home) == home_bytes));
  }
}

TEST(KLIBGroupIsAdminGroupMem, AsksTheFirstGroupThatExists) {
  test_users = {{"tester", 60001, 2, std::vector<gid_t>(100, 2)}};  // More than the first list has.
  test_users[0].groups.back() = 3;
  using Case = std::tuple<std::map<std::string, gid_t>, const char*, int, int>;
  for (const auto& [groups, fails, error, want] : {
           Case{{{"users", 3}}, "", 0, 0},
           Case{{{"wheel", 3}}, "", 0, 1},
           Case{{{"sudo", 7}, {"wheel", 3}}, "", 0, 0},
           Case{{{"administrators", 2}, {"sudo", 7}}, "", 0, 1},
           Case{{{"wheel", 3}}, "getgrnam_r", EIO, -1},
           Case{{{"wheel", 3}}, "getgrouplist", ENOMEM, -1},
       }) {
    test_groups = groups;
    const ScopedFault fault(fails, error);
    EXPECT_EQ(KLIBGroupIsAdminGroupMem("tester", 0), want) << testing::PrintToString(groups);
    EXPECT_TRUE(want >= 0 || errno == error) << fails;
    EXPECT_LT(KLIBGroupIsAdminGroupMem("gone", 0), 0);
  }
}
