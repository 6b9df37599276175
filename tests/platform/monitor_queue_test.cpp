#include "kavo/monitor_queue.h"

#include <fcntl.h>
#include <json/reader.h>
#include <sys/wait.h>

#include <sstream>

#include "kavo/local/monitor_queues.h"
#include "support/private_root.h"
#include "support/syslog_capture.h"

using EVNOTIFYD::MONITOR_QUEUE_TYPE_APPLICATION;
using EVNOTIFYD::MonitorQueue;
using EVNOTIFYD::MonitorQueueType;
using kavo::local::ReadMonitorQueues;
using kavo::local::RegisteredQueue;

const PrivateRoot kRoot;
const std::string kFolder = kRoot / "var/lib/kavo/evnotify";
const std::string kFile = kFolder + "/app.json";
constexpr auto kOther = static_cast<MonitorQueueType>(2);

Json::Value Parsed(const std::string& text) {
  Json::Value value;
  std::istringstream(text) >> value;
  return value;
}
bool Upsert(const std::string& description, const std::string& app = "app",
            MonitorQueueType type = MONITOR_QUEUE_TYPE_APPLICATION) {
  return MonitorQueue::Upsert(MonitorQueue(Parsed(description)), app, type);
}
bool Delete(const std::string& queue, const std::string& app = "app",
            MonitorQueueType type = MONITOR_QUEUE_TYPE_APPLICATION) {
  return MonitorQueue::Delete(queue, app, type);
}
// A description whose one folder has these members.
std::string Watching(const std::string& members) {
  return R"({"queue": "/q", "config": [{)" + members + "}]}";
}

class MonitorQueueTest : public testing::Test {
 protected:
  void SetUp() override { std::filesystem::remove_all(kFolder); }
};

TEST_F(MonitorQueueTest, KeepsOneOfAPathAndType) {
  EXPECT_TRUE(ReadMonitorQueues().queues.empty());
  EXPECT_TRUE(Delete("/q")) << "nothing is registered";
  EXPECT_TRUE(Upsert(Watching(R"("path": "/old", "mask": 1)")));
  EXPECT_TRUE(Upsert(R"({"queue": "/q", "config": []})", "app", kOther));
  EXPECT_TRUE(Upsert(R"({"queue": "/r", "config": [{"path": "/a", "mask": 1},
                                                   {"path": "/a", "mask": 2}], "more": 1})"));
  EXPECT_TRUE(Upsert(R"({"queue": "/q", "config": []})", "a.json"));
  const std::string odd = "/v/caf\xE9 \"\\\n%";
  Json::Value description = Parsed(Watching(R"("mask": 65484, "ignore": ["@eaDir", "x"])"));
  description["config"][0]["path"] = odd;
  EXPECT_TRUE(
      MonitorQueue::Upsert(MonitorQueue(description), "app", MONITOR_QUEUE_TYPE_APPLICATION));
  std::vector<RegisteredQueue> want = {
      {"a.json", "/q", 1, {}},
      {"app", "/q", 1, {{odd, 0xFFCC, {"@eaDir", "x"}}}},
      {"app", "/q", 2, {}},
      {"app", "/r", 1, {{"/a", 1, {}}}},
  };
  EXPECT_EQ(ReadMonitorQueues().queues, want);
  EXPECT_TRUE(Delete("/q"));
  EXPECT_TRUE(Delete("/q"));
  EXPECT_TRUE(Delete("/r", "app", kOther));
  want.erase(want.begin() + 1);
  EXPECT_EQ(ReadMonitorQueues().queues, want);
}

TEST_F(MonitorQueueTest, RefusesWhatIsMalformed) {
  const std::string bad_name = "an application's name has";
  const std::string good = R"({"queue": "/q", "config": []})";
  const std::string path = R"("path": "/a", )";
  const struct {
    const char* name;
    std::string description;
    std::string app;
    std::string says;
  } cases[] = {
      {"AppWithSlash", good, "a/b", bad_name},
      {"AppUp", good, "..", bad_name},
      {"AppNul", good, std::string("a\0b", 3), bad_name},
      {"AppLong", good, std::string(201, 'a'), bad_name},
      {"NoObject", "[]", "app", "must be an object"},
      {"NoQueue", R"({"config": []})", "app", "\"queue\" is missing"},
      {"QueueRelative", R"({"queue": "q", "config": []})", "app", "\"queue\" must be absolute"},
      {"QueueNul", R"({"queue": "/q\u0000", "config": []})", "app", "\"queue\" must be absolute"},
      {"ConfigIsAnObject", R"({"queue": "/q", "config": {}})", "app", "\"config\" must be a list"},
      {"FolderIsAText", R"({"queue": "/q", "config": ["/a"]})", "app", "must be an object"},
      {"PathEndsInSlash", Watching(R"("path": "/a/", "mask": 1)"), "app", "\"path\" must be abs"},
      {"PathIsQueue", Watching(R"("path": "/q", "mask": 1)"), "app", "\"path\" must be another"},
      {"MaskOver", Watching(path + R"("mask": 4294967296)"), "app", "\"mask\" must be a whole"},
      {"IgnoreAPath", Watching(path + R"("mask": 1, "ignore": ["x/y"])"), "app", "list names"},
  };
  for (const auto& row : cases) {
    SyslogCapture log;
    EXPECT_FALSE(Upsert(row.description, row.app)) << row.name;
    const std::vector<std::string> lines = log.Take();
    EXPECT_TRUE(lines.size() == 1 && lines[0].find(row.says) != std::string::npos)
        << row.name << ": " << testing::PrintToString(lines);
  }
  EXPECT_FALSE(Delete("/q", "a/b"));
  EXPECT_TRUE(ReadMonitorQueues().queues.empty());
}

TEST_F(MonitorQueueTest, NeverOverwritesWhatItCannotRead) {
  const std::string queue = R"({"queue": "/q", "config": [], "type": 1})";
  const struct {
    const char* name;
    std::string text;
    std::string says;
  } cases[] = {
      {"Empty", "", "not JSON"},
      {"BadQueue", R"({"queues": [{"queue": "q", "config": [], "type": 1}]})", "must be absolute"},
      {"Twice", "{\"queues\": [" + queue + "," + queue + "]}", "same path and type"},
  };
  ASSERT_TRUE(Upsert(R"({"queue": "/good", "config": []})", "good"));
  for (const auto& row : cases) {
    WriteText(kFile, row.text);
    EXPECT_FALSE(Upsert(R"({"queue": "/r", "config": []})")) << row.name;
    EXPECT_FALSE(Delete("/q")) << row.name;
    EXPECT_EQ(ReadText(kFile), row.text) << row.name;
    const kavo::local::MonitorQueues read = ReadMonitorQueues();
    EXPECT_EQ(read.queues, (std::vector<RegisteredQueue>{{"good", "/good", 1, {}}})) << row.name;
    ASSERT_EQ(read.unreadable.count("app"), 1U) << row.name;
    EXPECT_TRUE(read.unreadable.at("app").starts_with(kFile + ": ") &&
                read.unreadable.at("app").find(row.says) != std::string::npos)
        << row.name << ": " << read.unreadable.at("app");
  }
}

TEST_F(MonitorQueueTest, EditorsAtOnceLoseNothing) {
  constexpr int kEditors = 4;
  constexpr int kQueues = 12;
  for (int editor = 0; editor < kEditors; ++editor) {
    if (fork() == 0) {
      bool done = true;
      for (int i = 0; i < kQueues; ++i) {
        const std::string path = "/" + std::to_string(editor) + "." + std::to_string(i);
        done = Upsert(R"({"queue": ")" + path + R"(", "config": []})") && done;
      }
      _exit(done ? 0 : 1);
    }
  }
  for (int status = 0; wait(&status) > 0;) {
    EXPECT_EQ(status, 0);
  }
  EXPECT_EQ(ReadMonitorQueues().queues.size(), size_t{kEditors * kQueues});
}
