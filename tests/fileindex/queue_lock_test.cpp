// Writers that are killed at any moment, against cycles over their queue: nothing that was appended
// gets lost, and a line that a killed writer left torn takes no other line with it.
#include <gtest/gtest.h>
#include <signal.h>
#include <sys/mman.h>
#include <sys/prctl.h>
#include <sys/time.h>
#include <sys/wait.h>
#include <unistd.h>

#include <algorithm>
#include <cstdio>
#include <ctime>
#include <memory>
#include <random>
#include <set>
#include <string>
#include <utility>

#include "common/error.h"
#include "common/file.h"
#include "fileindex/queue_mgr.h"
#include "support/syslog_capture.h"
#include "support/temp_folder.h"

// The lock's pauses, a thousandth as long.
extern "C" int usleep(useconds_t microseconds) {
  const timespec pause{0, static_cast<long>(microseconds)};
  return nanosleep(&pause, nullptr);
}

namespace vexlo::fileindex {
namespace {

constexpr int kWriters = 4;
constexpr int kLines = 3000;
constexpr int kMaxKills = 200;

// Some are so long that a kill finds time to tear them.
std::string PathOf(int writer, int number) {
  const int length = number % 25 == 0 ? 300000 : 1 + number % 200;
  return "/v/" + std::to_string(writer) + "/" + std::to_string(number) + "/" +
         std::string(static_cast<size_t>(length), 'x');
}

// Goes on where the process before was killed. An alarm is what kills this one.
[[noreturn]] void Write(const std::string& queue, int writer, int& next) {
  while (next < kLines) {
    try {
      AppendLines(queue, "{\"event\":64,\"path\":\"" + PathOf(writer, next) + "\"}\n");
      ++next;
    } catch (const Error& error) {
      if (error.GetErrorCode() != ERR_LOCK) {  // Out of tries: the lock is in demand.
        _exit(1);
      }
    }
  }
  _exit(0);
}

TEST(QueueLock, LosesNothingWhenWritersAreKilled) {
  const unsigned seed = std::random_device{}();
  SCOPED_TRACE(seed);
  std::mt19937 random(seed);
  const TempFolder folder;
  const std::string queue = folder / "queue";
  SyslogCapture log;
  std::set<std::string> torn;
  std::set<std::pair<int, int>> delivered;
  const auto cycle = [&](bool stop_before_delete) {
    QueueMgr manager(queue);
    const auto note = [&](std::shared_ptr<OP> op) {
      const std::string path = op->node.lock()->GetPath();
      int writer = -1, number = -1;
      sscanf(path.c_str(), "/v/%d/%d/", &writer, &number);
      EXPECT_TRUE(path == PathOf(writer, number)) << path.substr(0, 100);
      delivered.emplace(writer, number);
    };
    try {
      manager.ProcessOP(note, /*use_tmp=*/true);
    } catch (const Error& error) {
      ASSERT_EQ(error.GetErrorCode(), ERR_LOCK) << error.what();
      return;
    }
    if (!stop_before_delete) {
      manager.DeleteTmp();
    }
    for (const std::string& line : log.Take()) {
      torn.insert(line.starts_with("<3>optree:198 ") ? line : "");
    }
  };

  const size_t size = kWriters * sizeof(int);  // How far each has come, in memory they share.
  auto* const next = static_cast<int*>(
      mmap(nullptr, size, PROT_READ | PROT_WRITE, MAP_SHARED | MAP_ANONYMOUS, -1, 0));
  pid_t pids[kWriters] = {};
  size_t kills = 0;
  do {
    for (int i = 0; i < kWriters; ++i) {
      int status = 0;
      if (pids[i] != 0 && waitpid(pids[i], &status, WNOHANG) == pids[i]) {
        ASSERT_TRUE(WIFSIGNALED(status) || WEXITSTATUS(status) == 0);
        kills += WIFSIGNALED(status) ? 1 : 0;
        pids[i] = 0;
      }
      const itimerval life{{}, {0, kills < kMaxKills ? 1 + static_cast<int>(random() % 10000) : 0}};
      if (pids[i] == 0 && next[i] < kLines && (pids[i] = fork()) == 0) {
        prctl(PR_SET_PDEATHSIG, SIGKILL);
        setitimer(ITIMER_REAL, &life, nullptr);
        Write(queue, i, next[i]);
      }
    }
    cycle(/*stop_before_delete=*/random() % 4 == 0);
  } while (std::count(pids, pids + kWriters, 0) < kWriters && !HasFailure());
  cycle(false);  // What a stopped cycle left, and then what came behind it.
  cycle(false);
  EXPECT_FALSE(IsFileExist(queue) || IsFileExist(queue + ".tmp"));
  EXPECT_GT(kills, 0U);
  EXPECT_LE(torn.size(), kills + 1);  // One stands for all else that is logged.
  EXPECT_EQ(delivered.size(), static_cast<size_t>(kWriters * kLines));
  munmap(next, size);
}

}  // namespace
}  // namespace vexlo::fileindex
