#include "kavo/credentials.h"

#include <gtest/gtest.h>
#include <sys/wait.h>

#include <sstream>
#include <tuple>

#include "kavo/last_error.h"
#include "kavo/local/shares.h"
#include "support/accounts.h"
#include "support/temp_folder.h"

FAULTABLE(int, getgroups, (int count, gid_t* groups) noexcept, (count, groups))
FAULTABLE(int, setgroups, (size_t count, const gid_t* groups) noexcept, (count, groups))
FAULTABLE(int, setegid, (gid_t group) noexcept, (group))
FAULTABLE(int, seteuid, (uid_t user) noexcept, (user))

std::string root;

// Stands before the platform's own.
__attribute__((visibility("default"))) const std::string& kavo::local::Root() { return root; }

// User and group ids (real/effective/saved), the supplementary groups, and what of `secret` is
// read.
std::string Identity(const std::string& secret) {
  uid_t uid[3];
  gid_t gid[3];
  gid_t groups[64];
  getresuid(&uid[0], &uid[1], &uid[2]);
  getresgid(&gid[0], &gid[1], &gid[2]);
  std::ostringstream out;
  out << uid[0] << "/" << uid[1] << "/" << uid[2] << " " << gid[0] << "/" << gid[1] << "/"
      << gid[2];
  for (int i = 0, count = getgroups(64, groups); i < count; ++i) {
    out << " " << groups[i];
  }
  out << " " << ReadText(secret);
  return out.str();
}

struct Case {
  uid_t user, saved, owner;  // The owner of the root folder, or kNoFolder.
  std::vector<const char*> names;
  std::string want;
  const char* fails = "";  // In the last step.
  int nth = 1;
};
constexpr uid_t kNoFolder = 1;

// Becomes one user after the other; writes what came of each to `out`.
void RunCase(const Case& test, const std::string& secret, std::ostream& out) {
  const std::string start = Identity(secret);
  for (const char* const& name : test.names) {
    const std::string before = Identity(secret);
    const ScopedFault fault(&name == &test.names.back() ? test.fails : "", EAGAIN, test.nth);
    const bool done = ResetCredentialsByName(name, /*keep_saved=*/true);
    const int error = errno;
    const std::string after = Identity(secret);
    out << (after == start ? "start" : after == before ? "same" : after);
    out << (done ? "" : KLIBCErrGet() == KAVO_ERR_NOT_FOUND ? " unknown " : " ");
    out << (done ? "" : strerrorname_np(error)) << "\n";
  }
}

TEST(ResetCredentialsByName, ChangesAllOrNothing) {
  test_users = {{"ann", 60001, 60002, {60002, 60003}},
                {"ben", 60011, 60012, {60012, 60013}},
                {"root", 0, 0, {0}}};
  const TempFolder folder;
  WriteText(folder / "secret", "x");
  ASSERT_EQ(chmod((folder / "secret").c_str(), 0600), 0);
  const uid_t self = geteuid() == 0 ? 60001 : geteuid();
  const std::string ann = "0/60001/0 0/60002/0 60002 60003 <missing>\n";
  const std::string ben = "0/60011/0 0/60012/0 60012 60013 <missing>\n";
  int left_out = 0;
  for (const Case& test : {
           Case{self, self, kNoFolder, {"root", "ben"}, "start EPERM\nstart EPERM\n"},
           Case{self, self, self, {"root", "ben"}, "start\nstart EPERM\n"},
           Case{60001, 0, kNoFolder, {"root"}, "60001/0/0 0/0/0 0 x\n"},
           Case{0, 0, kNoFolder, {"ann", "ben", "root"}, ann + ben + "0/0/0 0/0/0 0 x\n"},
           Case{0, 0, kNoFolder, {"ann", "ann", "gone"}, ann + "same\nsame unknown ENOENT\n"},
           Case{0, 0, 0, {"root"}, "start\n"},
           Case{0, 0, 60001, {"root", "ben"}, ann + ben},
           Case{0, 0, 60099, {"root"}, "0/60099/0 0/60098/0 60098 <missing>\n"},  // No such user.
           Case{0, 0, kNoFolder, {"ben"}, "start EAGAIN\n", "getgroups"},
           Case{0, 0, kNoFolder, {"ben"}, "start EAGAIN\n", "seteuid"},
           Case{0, 0, kNoFolder, {"ann", "ben"}, ann + "same EAGAIN\n", "setgroups"},
           Case{0, 0, kNoFolder, {"ann", "ben"}, ann + "same EAGAIN\n", "setegid"},
           Case{0, 0, kNoFolder, {"ann", "ben"}, ann + "same EAGAIN\n", "seteuid", 2},
       }) {
    root = test.owner == kNoFolder ? "" : folder.Path();
    const bool is_owned =
        root.empty() || chown(root.c_str(), test.owner, 60098) == 0 || test.owner == self;
    const pid_t child = fork();
    if (child == 0) {
      std::ofstream out(folder / "out");
      const bool is_ready = is_owned && (geteuid() != 0 || setgroups(0, nullptr) == 0) &&
                            setresuid(test.user, test.user, test.saved) == 0;
      if (is_ready) {
        RunCase(test, folder / "secret", out);
      }
      out.close();
      _exit(is_ready ? 0 : 1);
    }
    int status = 0;
    ASSERT_EQ(waitpid(child, &status, 0), child);
    if (WIFEXITED(status) && WEXITSTATUS(status) == 1) {
      ++left_out;
      continue;
    }
    EXPECT_EQ(ReadText(folder / "out"), test.want)
        << test.user << " " << test.owner << " " << test.fails << test.nth;
  }
  if (left_out > 0) {
    GTEST_SKIP() << left_out << " cases want root's right to change ids";
  }
}
