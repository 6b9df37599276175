#include "common/lock.h"

#include <fcntl.h>
#include <gtest/gtest.h>
#include <signal.h>
#include <sys/file.h>
#include <sys/stat.h>
#include <sys/wait.h>

#include <algorithm>
#include <functional>
#include <memory>
#include <optional>
#include <vector>

#include "common/error.h"
#include "support/faults.h"
#include "support/syslog_capture.h"
#include "support/temp_folder.h"

// Pauses are noted and not made.
std::vector<useconds_t> pauses;
std::function<void()> before_pause = [] {};
std::function<void()> before_flock = [] {};

INTERPOSED int usleep(useconds_t microseconds) {
  pauses.push_back(microseconds);
  std::exchange(before_pause, [] {})();
  return 0;
}

INTERPOSED int flock(int fd, int operation) noexcept {
  static const auto real = REAL_FUNCTION(int, flock, (int, int));
  std::exchange(before_flock, [] {})();
  return ScopedFault::Fires("flock") ? -1 : real(fd, operation);
}

namespace vexlo {

const TempFolder kFolder;
const std::string kPath = kFolder / "lock";

// What the lock throws, or "".
std::string Failure(const std::string& file, bool exclusive) {
  try {
    const LockFile lock(file, exclusive);
    return "";
  } catch (const Error& error) {
    EXPECT_EQ(error.GetErrorCode(), ERR_LOCK);
    return error.what();
  }
}

TEST(Lock, AMutexIsHeldByOne) {
  Mutex mutex;
  {
    const LockMutex lock(mutex);
    EXPECT_FALSE(mutex.TryLock());
  }
  EXPECT_TRUE(mutex.TryLock() && mutex.Unlock());
}

TEST(Lock, SharedOnesCoexistAndAnExclusiveOneWaitsForAll) {
  pauses.clear();
  auto first = std::make_unique<LockFile>(kPath, /*exclusive=*/false);
  auto second = std::make_unique<LockFile>(kPath, /*exclusive=*/false);
  EXPECT_TRUE(pauses.empty());
  const int next_fd = dup(0);
  close(next_fd);
  EXPECT_EQ(Failure(kPath, /*exclusive=*/true), "Exceed max retry, path=" + kPath);
  EXPECT_EQ(pauses.size(), 64U);
  EXPECT_LE(*std::max_element(pauses.begin(), pauses.end()), 900000U);
  EXPECT_GT(std::set(pauses.begin(), pauses.end()).size(), 4U) << "the pauses do not vary";
  EXPECT_EQ(dup(0), next_fd) << "descriptors are left open";
  close(next_fd);
  before_pause = [&] {
    first.reset();
    before_pause = [&second] { second.reset(); };
  };
  const LockFile exclusive(kPath, /*exclusive=*/true);
  EXPECT_EQ(pauses.size(), 66U);
  EXPECT_FALSE(LockFile(kPath, /*exclusive=*/false, std::try_to_lock).IsHeld());
  EXPECT_EQ(errno, EWOULDBLOCK);
  EXPECT_EQ(pauses.size(), 66U) << "trying does not wait";
}

TEST(Lock, WhatCannotBeOpenedOrLockedFailsAtOnce) {
  pauses.clear();
  ASSERT_EQ(symlink((kFolder / "victim").c_str(), (kFolder / "link").c_str()), 0);
  ASSERT_EQ(mkfifo((kFolder / "fifo").c_str(), 0644), 0);
  EXPECT_EQ(Failure(kFolder / "no/lock", true),
            "open failed, path=" + (kFolder / "no/lock") + ", reason=No such file or directory");
  EXPECT_NE(Failure(kFolder / "link", true), "");
  EXPECT_NE(Failure(kFolder.Path(), true), "");
  errno = 0;
  EXPECT_EQ(Failure(kFolder / "made", true), "");
  EXPECT_EQ(errno, 0) << "or log lines would tell of it";
  EXPECT_EQ(Failure(kFolder / "fifo", true), "") << "or waited for a writer";
  const ScopedFault fault("flock", ENOLCK);
  EXPECT_EQ(Failure(kPath, true), "No locks available");
  EXPECT_TRUE(pauses.empty());
  EXPECT_FALSE(kFolder.Names().contains("victim"));
}

// A folder like /tmp, in which somebody else comes first.
TEST(Lock, NobodyKeepsRootFromALockInASharedFolder) {
  if (geteuid() != 0) {
    GTEST_SKIP() << "only root can be somebody else as well";
  }
  constexpr uid_t kSomebody = 4711;
  const TempFolder shared;
  ASSERT_EQ(chmod(shared.Path().c_str(), 01777), 0);
  const std::string lock = shared / "lock";
  const std::string victim = kFolder / "victim";
  const auto links = [&] { return symlink(victim.c_str(), lock.c_str()) == 0; };
  const auto names = [&] { return link(victim.c_str(), lock.c_str()) == 0; };
  const auto pipes = [&] { return mkfifo(lock.c_str(), 0666) == 0; };
  const auto writes = [&] { return WriteText(lock, "theirs"), true; };
  const struct {
    const char* name;
    std::function<bool()> plants;
    std::string for_all;  // Why anybody else fails; "" when they do not.
    uid_t owner;
    std::optional<uid_t> holder;  // A process of the user's, for ever.
    bool fails;                   // Even root.
  } rows[] = {
      {"a link", links, "Too many levels of symbolic links", kSomebody, {}, false},
      {"a name of another file", names, "Too many links", 0, {}, false},
      {"a pipe", pipes, "", kSomebody, {}, false},
      {"their file, held", writes, "Exceed max retry", kSomebody, kSomebody, false},
      {"their file, held by root", writes, "Exceed max retry", kSomebody, 0, true},
      {"our file, held", writes, "Exceed max retry", 0, kSomebody, true},
  };
  for (const auto& row : rows) {
    SCOPED_TRACE(row.name);
    WriteText(victim, "precious");
    ASSERT_TRUE(row.plants() && lchown(lock.c_str(), row.owner, row.owner) == 0);
    int ready[2];
    ASSERT_EQ(pipe(ready), 0);
    const pid_t holder = row.holder ? fork() : -1;
    if (holder == 0) {
      const bool holds = setresuid(*row.holder, *row.holder, *row.holder) == 0 &&
                         flock(open(lock.c_str(), O_RDONLY), LOCK_EX) == 0;
      (void)!write(ready[1], holds ? "y" : "n", 1);
      pause();
    }
    char holds = 'y';
    ASSERT_TRUE(!row.holder || (read(ready[0], &holds, 1) == 1 && holds == 'y'));
    ASSERT_EQ(seteuid(kSomebody + 1), 0);
    const std::string reason = Failure(lock, /*exclusive=*/true);
    ASSERT_EQ(seteuid(0), 0);
    EXPECT_TRUE(row.for_all.empty() ? reason.empty()
                                    : reason.find(row.for_all) != std::string::npos)
        << reason;
    EXPECT_EQ(!Failure(lock, /*exclusive=*/true).empty(), row.fails);
    EXPECT_EQ(ReadText(victim), "precious");
    if (row.holder) {
      kill(holder, SIGKILL);
      waitpid(holder, nullptr, 0);
    }
    close(ready[0]);
    close(ready[1]);
    unlink(lock.c_str());
  }
}

TEST(Lock, LocksTheFileThatThePathNamesNow) {
  pauses.clear();
  const std::function<void()> moves[] = {
      [] { rename(kPath.c_str(), (kFolder / "snapshot").c_str()); },
      [] { rename((kFolder / "new").c_str(), kPath.c_str()); },
      [] { unlink(kPath.c_str()); },
  };
  for (const auto& move : moves) {
    for (const bool tries : {false, true}) {
      WriteText(kPath, "");
      WriteText(kFolder / "new", "");
      before_flock = move;
      const auto lock = tries ? LockFile(kPath, /*exclusive=*/true, std::try_to_lock)
                              : LockFile(kPath, /*exclusive=*/true);
      EXPECT_TRUE(lock.IsHeld());
      EXPECT_TRUE(pauses.empty()) << "nobody to wait for";
      EXPECT_FALSE(LockFile(kPath, /*exclusive=*/true, std::try_to_lock).IsHeld());
    }
  }
  EXPECT_EQ(Failure(kFolder / "snapshot", true), "");
}

}  // namespace vexlo
