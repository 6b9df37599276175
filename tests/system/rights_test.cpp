// Who may do what: the daemons with the rights that they keep, and what other users get of them.
#include <gtest/gtest.h>
#include <linux/capability.h>
#include <sys/stat.h>
#include <unistd.h>

#include <fstream>
#include <initializer_list>

#include "support/stack.h"

namespace {

const PrivateRoot kRoot;
constexpr uid_t kSomebody = 12345;

// Of /proc/PID/status.
std::string StatusLine(pid_t pid, const std::string& name) {
  std::ifstream status("/proc/" + std::to_string(pid) + "/status");
  for (std::string line; std::getline(status, line);) {
    if (line.starts_with(name + ":\t")) {
      return line.substr(name.size() + 2);
    }
  }
  return "";
}

std::string CapabilityMask(std::initializer_list<int> capabilities) {
  uint64_t mask = 0;
  for (const int capability : capabilities) {
    mask |= uint64_t{1} << static_cast<unsigned>(capability);
  }
  char text[17];
  snprintf(text, sizeof(text), "%016lx", static_cast<unsigned long>(mask));
  return text;
}

TEST(Rights, DaemonsOfRootIndexEverybodysFilesWithFewCapabilities) {
  if (geteuid() != 0) {
    GTEST_SKIP() << "only root has capabilities to give up";
  }
  Stack stack(kRoot);
  const struct {
    const char* name;
    std::string kept;
  } rows[] = {
      {"kavoelasticd", CapabilityMask({})},
      {"kavocontentextractd", CapabilityMask({CAP_KILL, CAP_SETGID, CAP_SETUID})},
      {"fileindexd", CapabilityMask({CAP_DAC_READ_SEARCH})},
      {"evnotifyd", CapabilityMask({CAP_DAC_READ_SEARCH, CAP_SYS_ADMIN})},
  };
  for (const auto& row : rows) {
    const pid_t pid = stack.Pid(row.name);
    for (const char* const set : {"CapPrm", "CapEff", "CapBnd"}) {
      EXPECT_EQ(StatusLine(pid, set), row.kept) << row.name << " " << set;
    }
    EXPECT_EQ(StatusLine(pid, "NoNewPrivs"), "1") << row.name;
  }
  struct stat state {};
  ASSERT_EQ(stat((kRoot / "var/lib/kavo").c_str(), &state), 0);
  EXPECT_EQ(state.st_mode & 0777U, 0700U) << "state tells of everybody's files";
  const std::string folder = stack.In() + "/private";
  std::filesystem::create_directory(folder);
  WriteText(folder / std::filesystem::path("plain.txt"), "tokenofplain");
  WriteText(folder / std::filesystem::path("page.html"), "<html><body>tokenofpage</body></html>");
  for (const std::string& path : {folder + "/plain.txt", folder + "/page.html", folder}) {
    ASSERT_EQ(chown(path.c_str(), kSomebody, kSomebody), 0);
    ASSERT_EQ(chmod(path.c_str(), path == folder ? 0700 : 0600), 0);
  }
  EXPECT_TRUE(stack.AwaitQuiet());
  EXPECT_TRUE(stack.IsFound("tokenofplain"));
  EXPECT_TRUE(stack.IsFound("tokenofpage"));
  // It is watched as well, not read once.
  WriteText(folder + "/plain.txt", "tokenofchange");
  EXPECT_TRUE(stack.AwaitQuiet());
  EXPECT_TRUE(stack.IsFound("tokenofchange"));
}

}  // namespace
