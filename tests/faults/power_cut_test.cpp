// What is on the disk after a power cut at any moment, as a model of the disk has it: what was
// answered for is there, and what was under way is there wholly or not at all.
#include "faults/power_cut.h"

#include <gtest/gtest.h>
#include <sys/eventfd.h>
#include <unistd.h>

#include <algorithm>
#include <chrono>
#include <functional>
#include <optional>
#include <thread>

#include "common/file.h"
#include "common/lock.h"
#include "common/sdk/share.h"
#include "daemons/common/frame_server.h"
#include "daemons/fileindexd/share_state.h"
#include "daemons/fileindexd/worker.h"
#include "daemons/kavocontentextractd/quarantine.h"
#include "daemons/kavoelasticd/engine_fixture.h"
#include "daemons/kavoelasticd/registry.h"
#include "daemons/kavoelasticd/server.h"
#include "fileindex/elastic_control/share_index.h"
#include "fileindex/folder_mgr.h"
#include "fileindex/paths.h"
#include "fileindex/queue_mgr.h"
#include "kavo/local/monitor_queues.h"
#include "kavo/monitor_queue.h"
#include "support/private_root.h"
#include "support/syslog_capture.h"

namespace {

namespace index = vexlo::fileindex;
using vexlo::elasticd::Engine;

// Thousands of disks are made.
const PrivateRoot kRoot(access("/dev/shm", W_OK) == 0 ? "/dev/shm" : "/tmp");
const std::string kState = kRoot / "var/lib/kavo";

// An even note says that a step begins, an odd one that it was answered for.
constexpr int Begins(int step) { return 2 * step; }
constexpr int IsDone(int step) { return 2 * step + 1; }

constexpr struct {
  const char* name;
  Survives survives;
  uint32_t seed;
} kCuts[] = {{"All", Survives::kAll, 0},
             {"Synced", Survives::kSynced, 0},
             {"Some1", Survives::kSome, 1},
             {"Some2", Survives::kSome, 2},
             {"Some3", Survives::kSome, 3}};

// Calls `judge` with the disk as each cut leaves it, and with the last note before the cut.
void AfterEveryCut(const char* name, PowerCut& cut,
                   const std::function<void(int note, Survives)>& judge) {
  cut.Stop();
  EXPECT_EQ(cut.After(cut.Count(), Survives::kAll, 0), ReadDisk(kRoot.Path()));
  unsigned states = 0;
  for (size_t i = 0; i <= cut.Count() && !testing::Test::HasFailure(); ++i) {
    std::optional<DiskState> last;
    for (const auto& c : kCuts) {
      SCOPED_TRACE(std::string(name) + ", " + c.name + " after operation " + std::to_string(i) +
                   " on " + cut.PathAt(i));
      DiskState state = cut.After(i, c.survives, c.seed + static_cast<uint32_t>(i) * 8);
      if (state != last) {
        WriteDisk(kRoot.Path(), state);
        judge(cut.NoteAt(i), c.survives);
        last = std::move(state);
        ++states;
      }
    }
  }
  printf("%s: %zu operations, %u disks\n", name, cut.Count(), states);
}

// Work in steps, and how many of them can be seen: -1 where something is neither old nor new.
struct Steps {
  const char* name;
  int count;
  std::function<void(int step)> take;
  std::function<int()> read;
};

void TakeEachAndCut(const Steps& steps) {
  PowerCut cut(kRoot.Path());
  for (int step = 1; step <= steps.count; ++step) {
    cut.Note(Begins(step));
    steps.take(step);
    cut.Note(IsDone(step));
  }
  AfterEveryCut(steps.name, cut, [&](int note, Survives /*survives*/) {
    int seen = -1;
    EXPECT_NO_THROW(seen = steps.read());
    EXPECT_GE(seen, (note - 1) / 2) << "what was answered for is not there";
    EXPECT_LE(seen, note / 2);
  });
}

// As an installation has it.
void Install() {
  WriteDisk(kRoot.Path(), {});
  for (const char* const name :
       {"etc/kavo", "tmp", "var/run", "var/lib/kavo/fileindex/queue", "var/packages/Vexlo/etc"}) {
    kRoot.MakeFolder(name);
  }
  kRoot.SetShares(R"({"name":"docs","path":")" + kRoot.MakeFolder("vol/docs") + "\"}");
}

void AddFolder(const std::string& path) {
  Json::Value record;
  record["path"] = record["name"] = path;
  for (const char* type : {"document", "audio", "video", "photo"}) {
    record[type] = true;
  }
  const vexlo::LockFile lock(index::kFileIndexFoldersLockPath.Get(), /*exclusive=*/true);
  index::FolderMgr folders;
  std::shared_ptr<index::Folder> before;
  folders.Upsert(before, std::make_shared<index::Folder>(record));
  folders.Save();
}

std::string Numbered(const std::string& name, int number) { return name + std::to_string(number); }

TEST(PowerCut, ListsAndStateAreOldOrNew) {
  const std::string registry = kState + "/elastic/indexes.json";
  const std::string state = vexlo::fileindexd::ShareStateFile("docs");
  const std::string quarantine = kState + "/extract/quarantine.json";
  const auto open = [](const std::string& file) { return vexlo::elasticd::Registry(file); };
  const Steps works[] = {
      {"Folders", 3, [](int step) { AddFolder(Numbered("/docs/", step)); },
       [] { return static_cast<int>(index::FolderMgr().GetFolders().size()); }},
      {"Registrations", 3,
       [](int step) {
         Json::Value queue;
         queue["queue"] = Numbered("/queue", step);
         queue["config"] = Json::arrayValue;
         EXPECT_TRUE(EVNOTIFYD::MonitorQueue::Upsert(EVNOTIFYD::MonitorQueue(queue), "app",
                                                     EVNOTIFYD::MONITOR_QUEUE_TYPE_APPLICATION));
       },
       [] {
         const auto read = kavo::local::ReadMonitorQueues();
         return read.unreadable.empty() ? static_cast<int>(read.queues.size()) : -1;
       }},
      {"Registry", 3,
       [&](int step) {
         vexlo::elasticd::RegistryEntry entry;
         entry.path = Numbered("/db/", step);
         open(registry).Put(Numbered("index", step), entry);
       },
       [&] { return static_cast<int>(open(registry).Entries().size()); }},
      {"ShareState", 3,
       [&](int step) {
         auto now = vexlo::fileindexd::LoadShareState(state);
         now.crawled.insert(Numbered("/docs/", step));
         SaveShareState(state, now);
       },
       [&] { return static_cast<int>(vexlo::fileindexd::LoadShareState(state).crawled.size()); }},
      {"Quarantine", 3,
       [&](int step) {
         vexlo::extractd::Quarantine(quarantine)
             .Add({1, static_cast<uint64_t>(step), 3, 4, 5}, {"crash", "it died"}, "/v/file");
       },
       [&] { return static_cast<int>(vexlo::extractd::Quarantine(quarantine).Size()); }},
  };
  for (const Steps& work : works) {
    Install();
    TakeEachAndCut(work);
  }
}

// --- The engine

Json::Value Send(Engine& engine, const std::string& command, Json::Value data) {
  Json::Value request;
  request["command"] = command;
  request["data"] = std::move(data);
  request["data"]["id"] = "i";
  return engine.Handle(request);
}

void MustDo(Engine& engine, const std::string& command, const std::string& data = "{}") {
  EXPECT_EQ(Answer(Send(engine, command, Parsed(data))), "ok") << command;
}

// The paths of all documents; nothing when the index does not answer.
std::optional<std::set<std::string>> Documents(Engine& engine, const std::string& id = "i") {
  Json::Value request = Parsed(
      R"({"command":"document_get_by_query","data":{"query":{"qsl":{"prefix":{"KAVOMDPath":"/"}},
          "load_field":["KAVOMDPath"],"size":1000}}})");
  request["data"]["id"] = id;
  const Json::Value reply = engine.Handle(request);
  if (!reply["success"].asBool()) {
    return std::nullopt;
  }
  std::set<std::string> paths;
  for (const Json::Value& document : reply["data"]) {
    paths.insert(document["KAVOMDPath"].asString());
  }
  return paths;
}

// The first step makes the index; each other one adds four documents, moves one of those before
// and removes one.
constexpr int kDocumentSteps = 6;

std::string Document(int step, int number) {
  return "/v/" + std::to_string(step) + "-" + std::to_string(number);
}

std::set<std::string> ExpectedDocuments(int steps) {
  std::set<std::string> paths;
  for (int step = 2; step <= steps; ++step) {
    const bool is_last = step == steps;
    paths.insert({Document(step, 2), Document(step, 3)});
    paths.insert(is_last ? Document(step, 0) : "/moved" + Document(step, 0));
    if (is_last) {
      paths.insert(Document(step, 1));
    }
  }
  return paths;
}

void TakeDocumentStep(Engine& engine, int step) {
  if (step == 1) {
    Json::Value data;
    data["path"] = kRoot / "db/old";
    data["settings"] = Json::objectValue;
    data["mappings"] = Parsed(kMappings);
    EXPECT_EQ(Answer(Send(engine, "index_create", data)), "ok");
    return;
  }
  for (int number = 0; number < 4; ++number) {
    std::string text;
    for (int i = 0; i < 200; ++i) {
      text += Numbered("word", step) + Numbered(" of", i * number + step);
    }
    Json::Value more;
    more["KAVOMDTextContent"] = text;
    const std::string path = Document(step, number);
    engine.Handle(
        WriteRequest("document_upsert_by_id", path, MakeDocument(path, vexlo::JsonToString(more))));
  }
  if (step > 2) {
    engine.Handle(RenameRequest(Document(step - 1, 0), "/moved" + Document(step - 1, 0)));
    engine.Handle(WriteRequest("document_del_by_id", Document(step - 1, 1), Json::Value()));
  }
  MustDo(engine, "commit");
  if (step == 3) {
    // Merges and empties the log.
    while (engine.CommitIdle(std::chrono::seconds(0))) {
    }
  } else if (step == 4) {
    MustDo(engine, "index_config_set", R"({"data":{"path":")" + kRoot / "db/new" + "\"}}");
  } else if (step == 5) {
    MustDo(engine, "index_pause");
    MustDo(engine, "index_resume");
  }
}

int ReadDocumentSteps() {
  Engine engine(kState + "/elastic/indexes.json");
  Send(engine, "index_resume", Json::Value(Json::objectValue));  // It may be paused.
  const auto paths = Documents(engine);
  if (!paths) {
    return engine.Handle(Parsed(R"({"command":"index_list"})"))["data"].empty() ? 0 : -1;
  }
  int steps = 1;
  while (steps <= kDocumentSteps && ExpectedDocuments(steps) != *paths) {
    ++steps;
  }
  for (int step = 2; step <= steps; ++step) {
    Json::Value words;
    words["words"] = Numbered("word", step);
    const unsigned found = Send(engine, "search", words)["total"].asUInt();
    EXPECT_EQ(found, step == steps ? 4U : 3U) << words["words"];
  }
  return steps > kDocumentSteps ? -1 : steps;
}

TEST(PowerCut, TheEngineKeepsWhatItHasCommitted) {
  Install();
  // Where the index moves to, another one was removed in part.
  WriteText(kRoot.MakeFolder("db/new") + "/index.db", std::string(4096, 'x'));
  std::optional<Engine> engine(kState + "/elastic/indexes.json");
  TakeEachAndCut({"Engine", kDocumentSteps,
                  [&](int step) {
                    TakeDocumentStep(*engine, step);
                    if (step == kDocumentSteps) {
                      engine.reset();
                    }
                  },
                  ReadDocumentSteps});
}

// --- From the queue to the index

class EngineServer {
 public:
  EngineServer() : engine_(kState + "/elastic/indexes.json"), server_(Options()) {
    thread_ = std::thread([this] { server_.Run(stop_); });
  }
  ~EngineServer() {
    eventfd_write(stop_, 1);
    thread_.join();
    close(stop_);
  }
  EngineServer(const EngineServer&) = delete;
  EngineServer& operator=(const EngineServer&) = delete;

 private:
  vexlo::daemon::FrameServerOptions Options() {
    vexlo::daemon::FrameServerOptions options;
    options.socket_path = index::kElasticdSocketPath.Get();
    options.workers = 2;
    options.handler = [this](const std::string& request) {
      return vexlo::elasticd::AnswerText(
          [this](const Json::Value& asked) { return engine_.Handle(asked); }, request);
    };
    return options;
  }

  Engine engine_;
  const int stop_ = eventfd(0, EFD_CLOEXEC);
  vexlo::daemon::FrameServer server_;
  std::thread thread_;
};

// Whatever a queue's line tells of.
void AddPending(const std::string& queue, std::set<std::string>& paths) {
  for (const bool use_tmp : {true, false}) {
    index::QueueMgr pending(queue);
    pending.ProcessOP(
        [&](const std::shared_ptr<index::OP>& op) { paths.insert(op->node.lock()->GetPath()); },
        use_tmp);
  }
}

TEST(PowerCut, AnEventIsInTheQueueUntilItIsInTheIndex) {
  Install();
  const std::string docs = kRoot / "vol/docs";
  AddFolder("/docs");
  vexlo::fileindexd::ShareState state;
  state.crawled.insert(docs);
  SaveShareState(vexlo::fileindexd::ShareStateFile("docs"), state);
  const std::string queue = vexlo::sdk::SDKShare("docs").GetQueuePath();
  const auto tell = [&](const std::string& path) {
    vexlo::AppendLines(queue, R"({"event":8,"path":")" + path + "\"}\n");
  };
  const std::set<std::string> first = {docs + "/a.txt", docs + "/b.txt"};
  const std::string later = docs + "/later.txt";
  for (const std::string& path : first) {
    WriteText(path, "text");
    tell(path);
  }
  WriteText(later, "text");
  std::optional<EngineServer> server(std::in_place);
  index::elastic::ShareIndexCreate("docs");

  PowerCut cut(kRoot.Path());
  vexlo::fileindexd::Pause pause;
  std::optional<vexlo::fileindexd::Worker> worker(std::in_place, "docs", pause,
                                                  std::chrono::milliseconds(5));
  const auto await = [&] {
    while (vexlo::IsFileExist(queue) || vexlo::IsFileExist(queue + ".tmp")) {
      std::this_thread::sleep_for(std::chrono::milliseconds(2));
    }
  };
  await();
  tell(later);
  cut.Note(1);
  await();
  worker.reset();
  server.reset();
  AfterEveryCut("Worker", cut, [&](int note, Survives survives) {
    std::set<std::string> known;
    {
      Engine engine(kState + "/elastic/indexes.json");
      known = Documents(engine, "fileindex_docs").value_or(std::set<std::string>());
    }
    AddPending(queue, known);
    EXPECT_TRUE(std::includes(known.begin(), known.end(), first.begin(), first.end()));
    EXPECT_TRUE(known.contains(later) || note == 0 || survives != Survives::kAll);
  });
}

}  // namespace
