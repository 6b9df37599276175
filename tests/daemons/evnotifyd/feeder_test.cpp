#include "daemons/evnotifyd/feeder.h"

#include <gtest/gtest.h>
#include <sys/file.h>
#include <sys/inotify.h>

#include <map>
#include <optional>
#include <sstream>
#include <thread>

#include "common/json.h"
#include "common/lock.h"
#include "daemons/evnotifyd/queue_watch.h"
#include "support/faults.h"
#include "support/syslog_capture.h"
#include "support/temp_folder.h"

FAULTABLE(int, flock, (int fd, int operation) noexcept, (fd, operation))
FAULTABLE(int, inotify_init1, (int flags) noexcept, (flags))
FAULTABLE(ssize_t, write, (int fd, const void* data, size_t size), (fd, data, size))

namespace vexlo::evnotifyd {
namespace {

using kavo::local::MonitoredFolder;
using std::chrono::milliseconds;
using std::chrono::seconds;

constexpr uint32_t kAll = 0xFFCC;

// A feeder and a clock that it goes by. The folders are "a", "a/b" and "c".
class FeederTest : public testing::Test {
 protected:
  void SetUp() override {
    std::filesystem::create_directories(base_ / "a/b");
    std::filesystem::create_directory(base_ / "c");
  }

  void Start(const std::vector<MonitoredFolder>& folders, const FeederOptions& options = {}) {
    feeder_.emplace(queue_, options, std::stop_token());
    Watch(folders);
  }
  void Watch(std::vector<MonitoredFolder> folders) {
    for (MonitoredFolder& folder : folders) {
      folder.path = base_ / folder.path;
    }
    feeder_->SetFolders(folders, now_);
  }
  void Do(const std::string& commands) const {
    EXPECT_EQ(system(("set -e; cd " + base_.Path() + ";" + commands).c_str()), 0) << commands;
  }
  void Poll(milliseconds later = milliseconds(0)) {
    now_ += later;
    feeder_->Poll(now_);
    feeder_->Poll(now_ += milliseconds(60));
  }
  // What the queue holds, which goes with the call, as "40 a/f, 100 a/f a/g".
  std::string Take() const {
    std::istringstream lines(ReadText(queue_));
    std::string text;
    for (std::string line; std::getline(lines, line) && line != "<missing>";) {
      Json::Value event;
      EXPECT_TRUE(JsonFromString(event, line)) << line;
      std::ostringstream out;
      out << std::hex << event["event"].asUInt();
      for (const std::string& path : {event["path_old"].asString(), event["path"].asString()}) {
        out << (path.empty() ? "" : " " + path.substr(base_.Path().size() + 1));
      }
      text += (text.empty() ? "" : ", ") + out.str();
    }
    unlink(queue_.c_str());
    return text;
  }

  const TempFolder base_;
  const std::string queue_ = base_ / "queue";
  TimePoint now_{std::chrono::hours(1)};
  std::optional<Feeder> feeder_;
  SyslogCapture log_;
};

TEST_F(FeederTest, TellsWhatTheInnermostFolderWants) {
  const struct {
    const char* name;
    std::vector<MonitoredFolder> folders;
    const char* deeds;
    const char* want;
  } cases[] = {
      {"All", {{"a", kAll, {}}}, "> a/f; mv a/f a/g; rm a/g", "40 a/f, 8 a/f, 100 a/f a/g, 80 a/g"},
      {"NoRenames",
       {{"a", kAll & ~0x100U, {}}},
       "> a/f; mv a/f a/g",
       "40 a/f, 8 a/f, 80 a/f, 40 a/g"},
      {"Inner",
       {{"a", kAll, {}}, {"a/b", 0x80, {}}},
       "> a/f; mv a/f a/b; rm a/b/f",
       "40 a/f, 8 a/f, 80 a/f, 80 a/b/f"},
      {"IgnoredApart",
       {{"a", kAll, {"x"}}, {"a/b", kAll, {"y"}}},
       "> a/x; > a/y; > a/b/x; > a/b/y; mv a/y a/b/z",
       "40 a/y, 8 a/y, 80 a/y, 40 a/b/x, 8 a/b/x, 40 a/b/z"},
  };
  for (const auto& row : cases) {
    SCOPED_TRACE(row.name);
    Do("rm -rf a; mkdir -p a/b");
    Start(row.folders);
    Take();
    Do(row.deeds);
    Poll();
    EXPECT_EQ(Take(), row.want);
  }
}

TEST_F(FeederTest, AChangeReindexesWhatItTouches) {
  Start({{"a/b", kAll, {}}, {"c", kAll, {}}, {"none", kAll, {}}});
  EXPECT_EQ(Take(), "10000 a/b, 10000 c");
  Do("> a/b/f; > c/f");
  Watch({{"a/b", kAll, {}}, {"c", 0x40, {}}});
  Do("> a/b/g; > c/g");
  Poll();
  EXPECT_EQ(Take(), "40 a/b/f, 8 a/b/f, 40 c/f, 8 c/f, 40 a/b/g, 8 a/b/g, 40 c/g");
  Watch({{"a/b", kAll, {"x"}}, {"c", 0x40, {}}});
  EXPECT_EQ(Take(), "10000 a/b");
  Watch({{"a/b", kAll, {}}, {"a", kAll, {}}, {"c", kAll, {}}});
  EXPECT_EQ(Take(), "10000 a, 10000 a/b");
  Watch({{"a/b", kAll, {}}, {"c", kAll, {}}});
  EXPECT_EQ(Take(), "10000 a/b, 10000 c") << "when the one above goes, all start anew";
  Watch({});
  Do("> a/h; > c/h");
  Poll();
  EXPECT_EQ(Take(), "");
  EXPECT_TRUE(feeder_->Stats().live);
  EXPECT_EQ(feeder_->NextDeadline(), TimePoint::max());
}

TEST_F(FeederTest, LinesWaitInOrderUntilTheyCanBeWritten) {
  Start({{"a", kAll, {}}});
  Take();
  {
    const ScopedFault fault("write", EIO, 1, /*lasting=*/true);
    Do("> a/f");
    for (int i = 0; i < 20; ++i) {
      Poll(milliseconds(100));
    }
    EXPECT_TRUE(fault.Fired());
    EXPECT_FALSE(feeder_->Stats().live);
    EXPECT_TRUE(feeder_->Stats().reason.ends_with("reason=Input/output error"));
    EXPECT_LE(feeder_->NextDeadline() - now_, seconds(1));
    EXPECT_EQ(log_.Take().size(), 1U) << "one line, not one each try";
  }
  Do("rm a/f");
  Poll(seconds(1));
  EXPECT_EQ(Take(), "40 a/f, 8 a/f, 80 a/f");
  EXPECT_TRUE(feeder_->Stats().live);
  EXPECT_EQ(feeder_->Stats().overflows, 0U);
}

TEST_F(FeederTest, WhatIsTooMuchToWaitIsTold) {
  FeederOptions options;
  options.backlog_bytes = 400;
  Start({{"a", 0x40, {}}, {"c", 0x40, {}}}, options);
  Take();
  {
    const LockFile lock(queue_, /*exclusive=*/true);
    Do("for i in 1 2 3 4 5 6 7 8 9; do > a/$i; done; > c/f");
    Poll();
    EXPECT_EQ(ReadText(queue_), "");
  }
  Poll(seconds(1));
  EXPECT_TRUE(Take().starts_with("200 a, 200 c"));
  Do("> c/g");
  Poll();
  EXPECT_EQ(Take(), "40 c/g");
  EXPECT_EQ(feeder_->Stats().overflows, 2U);
}

TEST_F(FeederTest, ALockThatIsHeldForAMomentLosesNothingOfABurst) {
  FeederOptions options;
  options.backlog_bytes = size_t{3} << 20;
  std::string deep = "a";
  for (int i = 0; i < 10; ++i) {
    deep += "/" + std::string(250, 'x');
  }
  std::filesystem::create_directories(base_ / deep);
  Start({{"a", kAll, {}}}, options);
  Do("cd " + deep + "; i=0; while [ $i -lt 1500 ]; do > $i; i=$((i+1)); done");
  const ScopedFault fault("flock", EWOULDBLOCK);
  Poll();
  EXPECT_TRUE(fault.Fired());
  Poll(seconds(1));
  EXPECT_EQ(feeder_->Stats().lines, 3001U);
  EXPECT_EQ(feeder_->Stats().overflows, 0U);
}

TEST_F(FeederTest, WithoutInotifyItAsksForReindexesTimeAfterTime) {
  FeederOptions options;
  options.rescan = seconds(300);
  {
    const ScopedFault fault("inotify_init1", EMFILE, 1, /*lasting=*/true);
    Start({{"a", kAll, {}}}, options);
    EXPECT_EQ(Take(), "10000 a");
    EXPECT_TRUE(feeder_->Stats().reason.find("reindexed every 300 s") != std::string::npos);
    Poll(seconds(299));
    EXPECT_EQ(Take(), "");
    Poll(seconds(1));
    EXPECT_EQ(Take(), "10000 a");
    EXPECT_FALSE(feeder_->Stats().live);
  }
  Poll(seconds(300));
  EXPECT_EQ(Take(), "10000 a");
  EXPECT_TRUE(feeder_->Stats().live);
  Do("> a/f");
  Poll();
  EXPECT_EQ(Take(), "40 a/f, 8 a/f");
}

TEST_F(FeederTest, ManyThreadsMayChangeAQueue) {
  kavo::local::RegisteredQueue registered;
  registered.queue = queue_;
  registered.folders = {{base_ / "c", kAll, {}}};
  QueueWatch watch(registered, {});
  {
    std::vector<std::jthread> threads;
    threads.reserve(4);
    for (int thread = 0; thread < 4; ++thread) {
      threads.emplace_back([&] {
        for (int i = 0; i < 20; ++i) {
          watch.SetFolders({{base_ / "a", kAll, {}}, {base_ / "c", kAll, {}}});
          watch.CheckRoots();
          watch.Stats();
          watch.SetFolders({{base_ / "c", kAll, {}}});
        }
      });
    }
  }
  while (watch.Stats().roots.size() != 1 || !watch.Stats().live) {
    std::this_thread::yield();
  }
  Do("> c/f");
  while (!ReadText(queue_).ends_with("\"path\":\"" + (base_ / "c/f") +
                                     "\",\"path_old\":\"\",\"data\":null}\n")) {
    std::this_thread::yield();
  }
  const std::string queued = Take();
  EXPECT_EQ(queued.find("10000 c"), queued.rfind("10000 c")) << "watched without a break";
}

}  // namespace
}  // namespace vexlo::evnotifyd
