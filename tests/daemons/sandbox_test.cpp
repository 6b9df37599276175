#include "daemons/common/sandbox.h"

#include <fcntl.h>
#include <gtest/gtest.h>
#include <netinet/in.h>
#include <sched.h>
#include <sys/capability.h>
#include <sys/mman.h>
#include <sys/mount.h>
#include <sys/prctl.h>
#include <sys/socket.h>
#include <sys/stat.h>
#include <sys/wait.h>
#include <unistd.h>

#include <cerrno>
#include <csignal>
#include <functional>

#include "support/temp_folder.h"

namespace vexlo::daemon {
namespace {

constexpr int kKilled = 1000;

// What the deed comes to in a process of its own: errno (0 when it succeeds), or kKilled and the
// signal that ended it.
int InChild(const std::function<bool()>& deed) {
  const pid_t child = fork();
  if (child == 0) {
    prctl(PR_SET_DUMPABLE, 0);  // A killed one leaves no core.
    errno = 0;
    _exit(deed() ? 0 : errno);
  }
  int status = 0;
  waitpid(child, &status, 0);
  return WIFSIGNALED(status) ? kKilled + WTERMSIG(status) : WEXITSTATUS(status);
}

// Something that a process tries, and what InChild() is to say of it.
struct Attempt {
  const char* name;
  std::function<bool()> deed;
  int outcome;
};

// Makes each attempt in a process that has confined itself.
void Check(const std::vector<Attempt>& attempts, const std::function<bool()>& confine) {
  for (const Attempt& attempt : attempts) {
    EXPECT_EQ(InChild([&] { return confine() && attempt.deed(); }), attempt.outcome)
        << attempt.name;
  }
}

bool Opens(const std::string& path, int flags = O_RDONLY) {
  return open(path.c_str(), flags | O_CLOEXEC, 0600) >= 0;
}

bool MapsExecutable() {
  return mmap(nullptr, 4096, PROT_READ | PROT_EXEC, MAP_PRIVATE | MAP_ANONYMOUS, -1, 0) !=
         MAP_FAILED;
}

TEST(Sandbox, LeavesAReaderItsFileAndNothingElse) {
  if (!kCanBeConfined) {
    GTEST_SKIP() << "a sanitizer's run-time has system calls of its own";
  }
  const TempFolder folder;
  const std::string path = folder / "file";
  WriteText(path, "text");
  int ends[2];
  ASSERT_EQ(socketpair(AF_UNIX, SOCK_STREAM | SOCK_CLOEXEC, 0, ends), 0);
  const int file = open(path.c_str(), O_RDWR | O_CLOEXEC);
  char text[8] = {};
  struct iovec part = {text, 1};
  struct msghdr message {};
  message.msg_iov = &part;
  message.msg_iovlen = 1;
  const pid_t parent = getpid();
  const std::vector<Attempt> attempts = {
      {"reads", [&] { return pread(file, text, 4, 0) == 4; }, 0},
      {"maps", [&] { return mmap(nullptr, 4, PROT_READ, MAP_PRIVATE, file, 0) != MAP_FAILED; }, 0},
      {"answers", [&] { return sendmsg(ends[0], &message, 0) == 1; }, 0},
      {"allocates", [] { return std::string(1 << 24, 'x').size() > 1; }, 0},
      {"opens", [&] { return Opens(path); }, EACCES},
      {"opens to write", [&] { return Opens(path, O_RDWR); }, kKilled + SIGSYS},
      {"writes", [&] { return write(file, "x", 1) == 1; }, kKilled + SIGSYS},
      {"truncates", [&] { return ftruncate(file, 0) == 0; }, kKilled + SIGSYS},
      {"removes", [&] { return unlink(path.c_str()) == 0; }, kKilled + SIGSYS},
      {"another's socket", [&] { return sendmsg(ends[1], &message, 0) == 1; }, kKilled + SIGSYS},
      {"sockets", [] { return socket(AF_INET, SOCK_STREAM | SOCK_CLOEXEC, 0) >= 0; },
       kKilled + SIGSYS},
      {"forks", [] { return fork() >= 0; }, kKilled + SIGSYS},
      {"executes", [] { return execl("/bin/true", "true", nullptr) == 0; }, kKilled + SIGSYS},
      {"executable memory", MapsExecutable, kKilled + SIGSYS},
      {"signals", [&] { return kill(parent, 0) == 0; }, kKilled + SIGSYS},
  };
  Check(attempts, [&] { return AllowReadingOnly(ends[0], /*may_open=*/false); });
  EXPECT_EQ(ReadText(path), "text");
  close(file);
  close(ends[0]);
  close(ends[1]);
}

TEST(Sandbox, OpensOnlyWhatPathsAllow) {
  const TempFolder folder;
  std::filesystem::create_directory(folder / "open");
  WriteText(folder / "open/file", "");
  WriteText(folder / "file", "");
  if (InChild([] { return ForbidPaths({}) != PathRule::kNotThere; }) != 0) {
    GTEST_SKIP() << "this kernel has no Landlock";
  }
  const std::vector<Attempt> attempts = {
      {"allowed", [&] { return Opens(folder / "open/file"); }, 0},
      {"beside it", [&] { return Opens(folder / "file"); }, EACCES},
      {"round about", [&] { return Opens(folder / "open/../file"); }, EACCES},
      {"to write", [&] { return Opens(folder / "open/file", O_WRONLY); }, EACCES},
      {"executes", [] { return execl("/bin/true", "true", nullptr) == 0; }, EACCES},
  };
  Check(attempts, [&] {
    return ForbidPaths({folder / "open", folder / "missing"}) == PathRule::kInForce;
  });
}

TEST(Sandbox, WritesOnlyWhatItMay) {
  const TempFolder folder;
  for (const char* const name : {"state", "state/below", "share"}) {
    std::filesystem::create_directory(folder / name);
    WriteText(folder / name + "/file", "text");
  }
  if (InChild([] { return ForbidWriting({}) != PathRule::kNotThere; }) != 0) {
    GTEST_SKIP() << "this kernel's Landlock is missing, or too old";
  }
  const auto renames = [&](const std::string& from, const std::string& to) {
    return rename((folder / from).c_str(), (folder / to).c_str()) == 0;
  };
  const std::vector<Attempt> attempts = {
      {"its own", [&] { return Opens(folder / "state/new", O_RDWR | O_CREAT); }, 0},
      {"moves its own", [&] { return renames("state/file", "state/below/moved"); }, 0},
      {"reads", [&] { return Opens(folder / "share/file"); }, 0},
      {"a file that is named", [] { return Opens("/dev/null", O_RDWR); }, 0},
      {"writes", [&] { return Opens(folder / "share/file", O_WRONLY); }, EACCES},
      {"truncates", [&] { return truncate((folder / "share/file").c_str(), 0) == 0; }, EACCES},
      {"makes", [&] { return Opens(folder / "share/new", O_RDWR | O_CREAT); }, EACCES},
      {"removes", [&] { return unlink((folder / "share/file").c_str()) == 0; }, EACCES},
      {"moves away", [&] { return renames("share/file", "state/taken"); }, EACCES},
  };
  Check(attempts, [&] {
    return ForbidWriting({folder / "state", "/dev/null"}) == PathRule::kInForce;
  });
}

TEST(Sandbox, KeepsTheCapabilitiesOfTheList) {
  if (geteuid() != 0) {
    GTEST_SKIP() << "only root has capabilities to give up";
  }
  const TempFolder folder;
  WriteText(folder / "file", "");
  ASSERT_EQ(chmod((folder / "file").c_str(), 0), 0);
  ASSERT_EQ(chown((folder / "file").c_str(), 1, 1), 0);
  const auto chowns = [&] { return chown((folder / "file").c_str(), 1, 1) == 0; };
  const auto reads = [&] { return Opens(folder / "file"); };
  Check({{"none, reads", reads, EACCES},
         {"none, bound", [] { return cap_get_bound(CAP_CHOWN) == 0; }, 0},
         {"none, raises", [] { return prctl(PR_GET_NO_NEW_PRIVS, 0, 0, 0, 0) == 1; }, 0}},
        [] { return KeepCapabilities({}); });
  Check({{"read, reads", reads, 0},
         {"read, writes", [&] { return Opens(folder / "file", O_RDWR); }, EACCES},
         {"read, gives away", chowns, EPERM}},
        [] { return KeepCapabilities({CAP_DAC_READ_SEARCH}); });
}

TEST(Sandbox, RefusesAdministration) {
  if (!kCanBeConfined || geteuid() != 0) {
    GTEST_SKIP() << "a sanitizer's run-time traces processes, and only root may administer";
  }
  const TempFolder folder;
  const std::vector<Attempt> attempts = {
      {"changes the root", [&] { return chroot(folder.Path().c_str()) == 0; }, EPERM},
      {"mounts", [&] { return mount("", folder.Path().c_str(), "tmpfs", 0, "") == 0; }, EPERM},
      {"leaves a namespace", [] { return unshare(CLONE_NEWNET) == 0; }, EPERM},
      {"opens", [&] { return Opens(folder / "new", O_RDWR | O_CREAT); }, 0},
  };
  Check(attempts, ForbidAdministration);
}

TEST(Sandbox, BecomesAnAccountForGood) {
  if (geteuid() != 0) {
    GTEST_SKIP() << "only root can become another user";
  }
  EXPECT_FALSE(FindAccount("no such user").has_value());
  ASSERT_TRUE(FindAccount("daemon").has_value());
  const Account account = *FindAccount("daemon");
  const auto becomes = [&] {
    return BecomeAccount(account) && getuid() == account.uid && getgid() == account.gid &&
           getgroups(0, nullptr) == 0;
  };
  EXPECT_EQ(InChild(becomes), 0);
  EXPECT_EQ(InChild([&] { return becomes() && setuid(0) == 0; }), EPERM);
}

}  // namespace
}  // namespace vexlo::daemon
