#include "fileindex/queue_mgr.h"

#include <fcntl.h>
#include <gtest/gtest.h>
#include <sys/file.h>
#include <sys/stat.h>
#include <unistd.h>

#include <cstdio>
#include <filesystem>
#include <functional>
#include <memory>
#include <random>
#include <sstream>
#include <string>

#include "fileindex/caught.h"
#include "support/syslog_capture.h"
#include "support/temp_folder.h"

namespace {

// Run in place of every pause, and ahead of every rename.
std::function<void()> on_sleep;
std::function<void()> on_rename;
int sleeps = 0;

}  // namespace

extern "C" int usleep(useconds_t) {
  ++sleeps;
  on_sleep();
  return 0;
}
extern "C" int rename(const char* from, const char* to) noexcept {
  on_rename();
  return renameat(AT_FDCWD, from, AT_FDCWD, to);
}

namespace vexlo::fileindex {
namespace {

const std::string kNone = "<missing>";  // As ReadText() has it.
const std::string kCreateA = "{\"event\":64,\"path\":\"/v/s/a\"}\n";
const std::string kReindexB = "{\"event\":65536,\"path\":\"/v/s/b\"}\n";

struct Queue : testing::Test {
  Queue() {
    on_sleep = on_rename = [] {};
    sleeps = 0;
  }

  void Put(const std::string& live_text, const std::string& snapshot_text) {
    for (const auto& [path, text] :
         {std::pair(live, live_text), std::pair(snapshot, snapshot_text)}) {
      unlink(path.c_str());
      if (text != kNone) {
        WriteText(path, text);
      }
    }
  }

  // "true", "false", or the code and the reason of what was thrown.
  template <typename Question>
  static std::string Ask(Question question, const std::string& path, const std::string& queue) {
    bool answer = false;
    const std::string error = Caught([&] { answer = (QueueMgr(queue).*question)(path); });
    return !error.empty() ? error : answer ? "true" : "false";
  }
  std::string HasReindex(const std::string& path) const {
    return Ask(&QueueMgr::IsFullPathHasReindex, path, live);
  }

  const TempFolder folder;
  const std::string live = folder / "queue";
  const std::string snapshot = live + ".tmp";
};

TEST_F(Queue, ProcessesTheSnapshotOrTheLiveQueue) {
  const std::string crash = "{\"event\":512,\"path\":\"/a\"}";
  struct {
    std::string live, snapshot;
    bool use_tmp;
    int count;
    std::string delivered, live_after, snapshot_after;
  } const rows[] = {
      {kNone, kNone, true, 0, "", kNone, kNone},
      {kNone, kCreateA, false, 0, "", kNone, kCreateA},
      {kCreateA, kNone, true, 1, "[02] /v/s/a", kNone, kCreateA},
      {kCreateA, kReindexB, true, 1, "[06] /v/s/b", kCreateA, kReindexB},
      {kCreateA, kReindexB, false, 1, "[02] /v/s/a", kCreateA, kReindexB},
      {crash, kNone, false, 1, "[07] ", crash, kNone},
  };
  for (const auto& row : rows) {
    SCOPED_TRACE(row.live + row.snapshot);
    Put(row.live, row.snapshot);
    std::ostringstream delivered;
    QueueMgr manager(live);
    const auto print = [&](std::shared_ptr<OP> op) { delivered << op; };
    EXPECT_EQ(manager.ProcessOP(print, row.use_tmp), row.count);
    EXPECT_EQ(delivered.str(), row.delivered);
    EXPECT_EQ(ReadText(live), row.live_after);
    EXPECT_EQ(ReadText(snapshot), row.snapshot_after);
    EXPECT_EQ(manager.DeleteTmp(), row.snapshot_after == kNone ? -1 : 0);
    EXPECT_EQ(ReadText(snapshot), kNone);
  }
}

TEST_F(Queue, RenamesUnderTheLockAndUnlocks) {
  Put(kCreateA, kNone);
  const int fd = open(live.c_str(), O_RDONLY | O_CLOEXEC);
  ASSERT_EQ(flock(fd, LOCK_SH), 0);  // Even a reader's lock keeps an exclusive one out.
  on_sleep = [&] {
    EXPECT_EQ(ReadText(live), kCreateA);
    flock(fd, sleeps == 3 ? LOCK_UN : LOCK_SH);
  };
  int locked = 0;
  on_rename = [&] { locked += flock(fd, LOCK_SH | LOCK_NB) == 0 ? 0 : 1; };
  QueueMgr manager(live);
  manager.PrepareTmpQueue();
  EXPECT_EQ(sleeps, 3);
  EXPECT_EQ(ReadText(snapshot), kCreateA);
  EXPECT_EQ(flock(fd, LOCK_EX | LOCK_NB), 0) << "still locked";

  ASSERT_EQ(rename(snapshot.c_str(), live.c_str()), 0);
  ASSERT_EQ(flock(fd, LOCK_UN), 0);
  ASSERT_EQ(mkdir(snapshot.c_str(), 0755), 0);
  const SyslogCapture quiet;
  EXPECT_EQ(Caught([&] { manager.PrepareTmpQueue(); }), "502 rename failed, reason=Is a directory");
  EXPECT_EQ(locked, 2);
  EXPECT_EQ(flock(fd, LOCK_EX | LOCK_NB), 0) << "still locked";
  close(fd);
}

// The two questions look in opposite directions: at or below the path, at or above it.
TEST_F(Queue, AnswersForPaths) {
  const std::string bad = "906 Malformed event_raw: nonsense";
  struct {
    std::string text, path, processing, reindex;
  } const rows[] = {
      {R"({"event":65536,"path":"/v/s/a"})", "/v/s/a", "true", "true"},
      {R"({"event":65536,"path":"/v/s"})", "/v/s/a", "false", "true"},
      {R"({"event":65536,"path":"/v/s/a/b"})", "/v/s/a", "true", "false"},
      {R"({"event":65536,"path":"/v/s/a"})", "/v/s/ab", "false", "false"},
      {R"({"event":65536,"path":"/v/s/ab"})", "/v/s/a", "false", "false"},
      {R"({"event":65538,"path":"/v/s/a"})", "/v/s/a", "true", "false"},
      {R"({"event":256,"path":"/x","path_old":"/v/a/b"})", "/v/a", "true", "false"},
      {R"({"event":65536,"path":""})", "/v", "false", "true"},
      {"nonsense\n" + kReindexB, "/v/s/b", bad, bad},
      {kReindexB + "nonsense\n", "/v/s/b", "true", "true"},
      {kNone, "/v", "false", "false"},
  };
  for (const auto& row : rows) {
    for (const bool in_snapshot : {false, true}) {
      SCOPED_TRACE(row.text + " asked for " + row.path);
      Put(in_snapshot ? "" : row.text, in_snapshot ? row.text : kNone);
      EXPECT_EQ(Ask(&QueueMgr::IsFullPathProcessing, row.path, live), row.processing);
      EXPECT_EQ(HasReindex(row.path), row.reindex);
    }
  }
  Put(kReindexB, "nonsense\n");
  EXPECT_EQ(HasReindex("/v/s/b"), "true");  // The live queue comes first.
}

TEST_F(Queue, WaitsForATornLastLine) {
  const std::string torn = kCreateA + kReindexB.substr(0, 20);
  struct {
    std::function<void()> meanwhile;
    std::string answer;
  } const rows[] = {
      {[&] { WriteText(live, torn + kReindexB.substr(20)); }, "true"},
      {[&] { WriteText(live, kCreateA + kReindexB), rename(live.c_str(), snapshot.c_str()); },
       "true"},
      {[] {}, "906 Malformed event_raw: " + kReindexB.substr(0, 20)},
  };
  for (const auto& row : rows) {
    Put(torn, kNone);
    sleeps = 0;
    on_sleep = row.meanwhile;
    EXPECT_EQ(HasReindex("/v/s/b"), row.answer);
    EXPECT_GE(sleeps, 1);
    EXPECT_LE(sleeps, 10);
  }
}

// What was read before is not read again, and no answer tells.
TEST_F(Queue, AnswersAgainAsOneWhoReadsAllOfIt) {
  std::mt19937 random(3);
  const auto path = [&random] {
    std::string text;
    for (size_t left = random() % 4; left > 0; --left) {
      text += std::string("/") + "abc"[random() % 3];
    }
    return text;
  };
  const auto line = [&] {
    return random() % 200 == 0 ? std::string("nonsense\n")
                               : R"({"event":)" + std::string(random() % 3 == 0 ? "65536" : "8") +
                                     R"(,"path":")" + path() + "\"}\n";
  };
  const std::string copy = live + ".copy";
  for (int step = 0; step < 3000; ++step) {
    const size_t size = std::filesystem::exists(live) ? std::filesystem::file_size(live) : 0;
    switch (random() % 20) {
      case 0:  // A cycle of the index daemon.
        rename(live.c_str(), snapshot.c_str());
        break;
      case 1:
        unlink(snapshot.c_str());
        break;
      case 2:  // A failed append is cut back, and others write there.
        truncate(live.c_str(), static_cast<off_t>(random() % (size + 1)));
        std::ofstream(live, std::ios::app) << "\n" << line();
        break;
      default:
        std::ofstream(live, std::ios::app) << line();
    }
    const std::string asked = path() + "/a";
    const std::string got = HasReindex(asked);
    // A copy is a file that was never read.
    for (const std::string end : {"", ".tmp"}) {
      std::error_code none;
      std::filesystem::remove(copy + end, none);
      std::filesystem::copy_file(live + end, copy + end, none);
    }
    ASSERT_EQ(got, Ask(&QueueMgr::IsFullPathHasReindex, asked, copy)) << step;
  }
}

}  // namespace
}  // namespace vexlo::fileindex
