// The notify daemon as a service manager runs it, on real folders.
#include <gtest/gtest.h>

#include <chrono>
#include <map>
#include <optional>

#include "common/json.h"
#include "common/lock.h"
#include "kavo/monitor_queue.h"
#include "support/private_mounts.h"
#include "support/stack.h"

namespace {

using namespace std::chrono_literals;
using EVNOTIFYD::MONITOR_QUEUE_TYPE_APPLICATION;
using EVNOTIFYD::MonitorQueue;

constexpr uint32_t kMask = 0xFFCC;
const PrivateRoot kRoot;

class EvnotifydTest : public testing::Test {
 protected:
  void SetUp() override {
    for (const auto& entry : std::filesystem::directory_iterator(kRoot.Path())) {
      std::filesystem::remove_all(entry);
    }
    kRoot.MakeFolder("var/lib/kavo/fileindex/queue");
    kRoot.MakeFolder("share");
  }
  void TearDown() override {
    if (program_.has_value()) {
      EXPECT_EQ(program_->End(SIGTERM), 0) << program_->text;
    }
  }

  void Start() {
    program_.emplace("export FILEINDEX_ROOT=" + kRoot.Path(), EVNOTIFYD_PROGRAM " 2>&1");
    ASSERT_TRUE(program_->Await("ready\n")) << program_->text;
  }
  int End(int signal) {
    const int status = program_->End(signal);
    program_.reset();
    return status;
  }
  // Runs the commands in the folder of this name.
  void Do(const std::string& folder, const std::string& commands) const {
    const std::string all = "set -e; cd '" + kRoot / folder + "';" + commands;
    EXPECT_EQ(system(all.c_str()), 0) << commands;
  }

  std::string Queue(const std::string& name = "q") const {
    return kRoot / ("var/lib/kavo/fileindex/queue/" + name);
  }
  // Registers these folders, each with its mask.
  void Register(const std::map<std::string, uint32_t>& folders, const std::string& queue = "q") {
    Json::Value description;
    description["queue"] = Queue(queue);
    for (const auto& [folder, mask] : folders) {
      Json::Value entry;
      entry["path"] = kRoot / folder;
      entry["mask"] = mask;
      entry["ignore"].append("@eaDir");
      description["config"].append(entry);
    }
    ASSERT_TRUE(
        MonitorQueue::Upsert(MonitorQueue(description), "app", MONITOR_QUEUE_TYPE_APPLICATION));
  }

  // The queue as "create f, rename d/ e/", with paths as they are seen from the root, without the
  // first `skip` lines.
  std::string Lines(const std::string& queue = "q", size_t skip = 0) const {
    static const std::map<uint32_t, std::string> kNames = {
        {0x4, "attr"},     {0x8, "write"},     {0x40, "create"},    {0x80, "delete"},
        {0x100, "rename"}, {0x200, "crashed"}, {0x10000, "reindex"}};
    const std::string all = ReadText(Queue(queue));
    // A line that is being written is none yet.
    std::istringstream queued(all.substr(0, all.rfind('\n') + 1));
    std::string text;
    for (std::string line; std::getline(queued, line);) {
      if (skip > 0) {
        --skip;
        continue;
      }
      Json::Value event;
      EXPECT_TRUE(vexlo::JsonFromString(event, line)) << line;
      EXPECT_TRUE(event["data"].isNull());
      text += (text.empty() ? "" : ", ") + kNames.at(event["event"].asUInt());
      for (const std::string& path : {event["path_old"].asString(), event["path"].asString()}) {
        EXPECT_TRUE(path.empty() || path.starts_with(kRoot.Path() + "/")) << line;
        text += path.empty() ? "" : " " + path.substr(kRoot.Path().size() + 1);
        text += event["is_dir"].asBool() && !path.empty() ? "/" : "";
      }
    }
    return text;
  }
  size_t CountLines(const std::string& queue = "q") const {
    const std::string text = ReadText(Queue(queue));
    return static_cast<size_t>(std::count(text.begin(), text.end(), '\n'));
  }

  // Waits until the queue, without its first lines, is this.
  void AwaitLines(const std::string& want, const std::string& queue = "q", size_t skip = 0) const {
    EXPECT_TRUE(Stack::Await([&] { return Lines(queue, skip) == want; }))
        << "the queue holds " << Lines(queue, skip) << "\nand shall hold   " << want;
  }

  // The daemon's answer about one queue.
  Json::Value Stats(const std::string& queue = "q") const {
    Json::Value answer;
    EXPECT_TRUE(vexlo::JsonFromString(
        answer, Ask(kRoot / "var/run/evnotifyd.sock", R"({"command":"stats"})")));
    for (const Json::Value& stats : answer["queues"]) {
      if (stats["queue"] == Queue(queue)) {
        return stats;
      }
    }
    return {};
  }
  void AwaitState(const std::string& state, const std::string& reason) const {
    EXPECT_TRUE(Stack::Await([&] {
      const Json::Value stats = Stats();
      return stats["state"] == state &&
             stats["reason"].asString().find(reason) != std::string::npos;
    })) << vexlo::JsonToString(Stats());
  }

  std::optional<Program> program_;
};

TEST_F(EvnotifydTest, DeedsAndTheirLines) {
  kRoot.MakeFolder("out");
  Do("share", "> f; > g");
  Register({{"share", kMask}});
  Start();
  AwaitLines("reindex share/");
  // What is done, and what the queue holds of it. The kernel makes one of two events that are alike
  // and follow each other.
  const char* const cases[][2] = {
      {"chmod 600 f; echo >> f; ln f l", "attr share/f, write share/f, create share/l"},
      {"mkdir d", "create share/d/"},
      {"mv f d; mv d e", "rename share/f share/d/f, rename share/d/ share/e/"},
      {"mv e ../out; > ../out/h; mv ../out/h .", "delete share/e/, create share/h"},
      {"mv g '\n\"'; ln '\n\"' $(printf '\\351'); rm $(printf '\\351')",
       "rename share/g share/\n\", create share/\xE9, delete share/\xE9"},
      {"mkdir @eaDir; > @eaDir/f; mv l @eaDir", "delete share/l"},
  };
  for (const auto& [deeds, want] : cases) {
    const size_t count = CountLines();
    Do("share", deeds);
    AwaitLines(want, "q", count);
  }
  const std::string all = Lines();
  ASSERT_TRUE(MonitorQueue::Delete(Queue(), "app", MONITOR_QUEUE_TYPE_APPLICATION));
  EXPECT_TRUE(Stack::Await([&] { return Stats().isNull(); }));
  Do("share", "> late");
  EXPECT_EQ(Lines(), all) << "nobody wants to know any more";
}

TEST_F(EvnotifydTest, ARegistrationThatGrowsLeavesTheRestAlone) {
  kRoot.MakeFolder("other");
  Register({{"share", kMask}});
  Start();
  AwaitLines("reindex share/");
  Register({{"share", kMask}, {"other", kMask}, {"later", kMask}});
  AwaitLines("reindex share/, reindex other/");
  AwaitState("degraded", kRoot / "later is gone");
  kRoot.MakeFolder("later");
  AwaitLines("reindex later/", "q", 2);
  AwaitState("live", "");
  // A file that is broken by hand costs nothing.
  const std::string file = kRoot / "var/lib/kavo/evnotify/app.json";
  const std::string good = ReadText(file);
  WriteText(file, good.substr(0, good.size() / 2));
  ASSERT_TRUE(program_->Await("its queues stay as they were\n"));
  Do("share", "> f");
  AwaitLines("create share/f, write share/f", "q", 3);
  WriteText(file, good);
  Register({{"share", kMask}});
  EXPECT_TRUE(Stack::Await([&] { return Stats()["roots"].size() == 1; }));
  Do("share", "> g; > ../other/g");
  AwaitLines("create share/g, write share/g", "q", 5);
  EXPECT_EQ(Stats()["lines"], 7);
  // So does the folder of the registrations when it is moved away.
  Do("var/lib/kavo", "mv evnotify old; mkdir -p evnotify");
  EXPECT_TRUE(Stack::Await([&] { return Stats().isNull(); }));
  Register({{"other", kMask}});
  AwaitLines("reindex other/", "q", 7);
}

TEST_F(EvnotifydTest, TheWayToAFolderMayLeadOverLinks) {
  kRoot.MakeFolder("disk/volume/photo");
  kRoot.MakeFolder("disk2/photo");
  Do("", "ln -s disk/volume link");
  Register({{"link/photo", kMask}});
  Start();
  AwaitLines("reindex link/photo/");
  size_t count = 1;
  bool stood = true;
  for (const char* const deeds : {"mv disk/volume disk/v", "ln -sfn disk2 link", "rm link",
                                  "mv disk disk3", "mkdir disk; mv disk3/v disk/volume"}) {
    // Another folder for what stood there before, or none, or one again.
    Do("", deeds);
    const bool stands = std::filesystem::exists(kRoot / "link/photo");
    const std::string want = std::string(stood ? "delete link/photo/" : "") +
                             (stood && stands ? ", " : "") + (stands ? "reindex link/photo/" : "");
    AwaitLines(want, "q", count);
    count = CountLines();
    stood = stands;
    if (deeds == std::string("rm link")) {
      Do("", "ln -s disk/volume link");
    }
  }
  Do("link/photo", "> f");
  AwaitLines("create link/photo/f, write link/photo/f", "q", count);
}

TEST_F(EvnotifydTest, AFolderThatSomebodyStandsInMayGoWithTheOneInIt) {
  kRoot.MakeFolder("way/root");
  Register({{"way/root", kMask}});
  Start();
  AwaitLines("reindex way/root/");
  const int stands = open((kRoot / "way").c_str(), O_PATH | O_CLOEXEC);
  ASSERT_GE(stands, 0);
  Do("", "rmdir way/root");
  AwaitLines("delete way/root/", "q", 1);
  // By the second registration the daemon has looked at the way again.
  for (const char* const other : {"one", "two"}) {
    const size_t count = CountLines();
    kRoot.MakeFolder(other);
    Register({{"way/root", kMask}, {other, kMask}});
    AwaitLines(std::string("reindex ") + other + "/", "q", count);
  }
  const size_t count = CountLines();
  Do("", "rmdir way");
  Do("", "mkdir -p way/root");
  AwaitLines("reindex way/root/", "q", count);
  close(stands);
}

TEST_F(EvnotifydTest, WhatIsMountedInAShareIsReadAnew) {
  Do("share", "mkdir -p d/e; > d/e/hidden");
  Register({{"share", kMask}});
  Start();
  AwaitLines("reindex share/");
  const size_t count = CountLines();
  {
    const ScopedMount mount = ScopedMount::Tmpfs(kRoot / "share/d/e");
    SKIP_IF_REFUSED(mount);
    AwaitLines("reindex share/d/", "q", count);
    Do("share", "> d/e/f");
    AwaitLines("create share/d/e/f, write share/d/e/f", "q", count + 1);
  }
  // Both the folder that is gone and the mounts that are left may tell of it, the latter at any
  // time.
  EXPECT_TRUE(Stack::Await([&] { return Lines("q", count + 3).starts_with("reindex share/d/"); }));
  Do("share", "> d/e/g");
  EXPECT_TRUE(Stack::Await([&] {
    std::string text = Lines();
    const std::string also = ", reindex share/d/e/";
    for (size_t at = 0; (at = text.find(also, at)) != std::string::npos;) {
      text.erase(at, also.size());
    }
    return text.ends_with(", create share/d/e/g, write share/d/e/g");
  })) << Lines();
}

TEST_F(EvnotifydTest, ItEndsSoonAndWithEverythingAppended) {
  constexpr size_t kFiles = 3000;
  Register({{"share", kMask}});
  Register({{"share", kMask}}, "locked");
  Start();
  AwaitLines("reindex share/");
  AwaitLines("reindex share/", "locked");
  const vexlo::LockFile lock(Queue("locked"), /*exclusive=*/true);
  Do("share", "i=0; while [ $i -lt " + std::to_string(kFiles) +
                  " ]; do > f$i; i=$((i+1)); done; > ../out; mv f0 ../out");
  const auto start = std::chrono::steady_clock::now();
  EXPECT_EQ(End(SIGTERM), 0);
  EXPECT_LT(std::chrono::steady_clock::now() - start, 1s);
  EXPECT_EQ(CountLines(), 2 * kFiles + 2);
  EXPECT_TRUE(Lines().ends_with(", delete share/f0"));
}

TEST_F(EvnotifydTest, SaysWhatItDoesNotTake) {
  for (const char* const arguments : {"--rescan", "--rescan 86401", "--max-watches 0", "more"}) {
    Program program("export FILEINDEX_ROOT=" + kRoot.Path(),
                    EVNOTIFYD_PROGRAM " " + std::string(arguments) + " 2>&1");
    EXPECT_EQ(program.End(), 2) << arguments;
    EXPECT_TRUE(program.text.starts_with("usage: evnotifyd [--rescan SECONDS]")) << arguments;
  }
  Start();
  const std::string socket = kRoot / "var/run/evnotifyd.sock";
  EXPECT_EQ(Ask(socket, R"({"command":"stats"})"), R"({"queues":[]})");
  EXPECT_TRUE(Ask(socket, "stats").starts_with(R"({"error":{"code":120,)"));
}

}  // namespace
