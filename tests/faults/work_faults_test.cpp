// The work of commands and daemons with each call of the system failing in turn: what is on disk is
// old or new and whole, what was committed is there, and the same work succeeds when the fault is
// gone.
#include <sstream>
#include <thread>

#include "cli/command.h"
#include "common/error.h"
#include "common/sdk/share.h"
#include "daemons/fileindexd/cycle.h"
#include "daemons/fileindexd/documents.h"
#include "daemons/kavoelasticd/engine_fixture.h"
#include "faults/every_fault.h"
#include "fileindex/comm.h"
#include "fileindex/elastic_control/share_index.h"
#include "fileindex/folder_mgr.h"
#include "fileindex/queue_mgr.h"
#include "kavo/local/content.h"
#include "kavo/local/monitor_queues.h"
#include "support/fake_engine.h"
#include "support/index_listing.h"
#include "support/private_root.h"
#include "support/program.h"

namespace {

namespace fs = std::filesystem;
namespace index = vexlo::fileindex;

const PrivateRoot kRoot;
const std::string kEtc = kRoot.MakeFolder("var/packages/Vexlo/etc");
const std::string kQueueFolder = kRoot.MakeFolder("var/lib/kavo/fileindex/queue");
const std::string kWatchFolder = kRoot.MakeFolder("var/lib/kavo/evnotify");
const std::string kStateFolder = kRoot.MakeFolder("var/lib/kavo/fileindexd");
const std::string kDocs = kRoot.MakeFolder("vol/docs");
const std::string kIn = kRoot.MakeFolder("vol/docs/in");

// The exit status of the tool.
int Tool(const std::vector<std::string>& words) {
  std::ostringstream out;
  return vexlo::cli::Run(vexlo::cli::FolderCommands(), words, {out, out, false, false});
}

void SetShares(bool has_docs) {
  kRoot.SetShares(R"({"name":"keep","path":")" + kRoot / "vol" + "/keep\"}" +
                  (has_docs ? R"(,{"name":"docs","path":")" + kDocs + "\"}" : ""));
}

// No folder, nothing in any queue, and no index.
void Clear() {
  SetShares(/*has_docs=*/true);
  for (const std::string& folder : {kEtc, kQueueFolder, kWatchFolder, kStateFolder}) {
    for (const auto& entry : fs::directory_iterator(folder)) {
      fs::remove_all(entry);
    }
  }
  try {
    index::elastic::ShareIndexDelete("docs");
  } catch (const vexlo::Error&) {  // There is none.
  }
}

// The lines of the queues must be whole.
void CheckQueues() {
  for (const auto& entry : fs::directory_iterator(kQueueFolder)) {
    std::istringstream lines(ReadText(entry.path()));
    for (std::string line; std::getline(lines, line);) {
      Json::Value event;
      EXPECT_TRUE(vexlo::JsonFromString(event, line)) << line;
    }
  }
}

struct FolderCase {
  const char* name;
  std::vector<std::string> before;
  std::vector<std::string> words;
  bool is_listed;  // Whether the folder is in the end.
};

FaultyWork FolderCommand(const FolderCase& c) {
  return {c.name,
          [&c] {
            Clear();
            if (!c.before.empty()) {
              EXPECT_EQ(Tool(c.before), 0);
            }
            SetShares(c.words[1] != "prune");
          },
          [&c] {
            const bool is_done = (c.words[1] == "add" || c.words[1] == "delete") &&
                                 index::FolderMgr().HasFolder("/docs/in") == c.is_listed;
            return is_done || Tool(c.words) <= 1;
          },
          [&c](bool done, bool /*lasts*/) {
            const bool is_listed = index::FolderMgr().HasFolder("/docs/in");
            const auto watched = kavo::local::ReadMonitorQueues();
            EXPECT_TRUE(watched.unreadable.empty());
            CheckQueues();
            if (done) {
              EXPECT_EQ(is_listed, c.is_listed);
              EXPECT_EQ(watched.queues.size(), c.is_listed ? 1U : 0U);
            }
          },
          /*bears_lasting_no_memory=*/false};
}

TEST(WorkFaults, FolderCommandsLeaveWholeFilesAndCanBeRepeated) {
  const std::vector<std::string> add = {"folder", "add", kIn};
  const FolderCase cases[] = {
      {"FolderAdd", {}, add, true},
      {"FolderSet", add, {"folder", "set", kIn, "--types", "none"}, true},
      {"FolderDelete", add, {"folder", "delete", kIn}, false},
      {"FolderReindex", add, {"folder", "reindex", kIn}, true},
      {"FolderPrune", add, {"folder", "prune"}, false},
  };
  for (const FolderCase& c : cases) {
    printf("%s: %u faults\n", c.name, RunWithEveryFault(FolderCommand(c), 120));
  }
}

// --- The engine's commit

// The fixture's engine without its folder, which must outlive the process that has the fault.
class Store {
 public:
  explicit Store(const std::string& folder) : engine_(folder + "/registry.json") {}

  std::string Do(const std::string& command, const Json::Value& data = Json::objectValue) {
    Json::Value request;
    request["command"] = command;
    request["data"] = data;
    request["data"]["id"] = "i";
    last = engine_.Handle(request);
    return Answer(last);
  }
  std::string Add(const std::string& path, const std::string& word) {
    return Answer(engine_.Handle(
        WriteRequest("document_upsert_by_id", path,
                     MakeDocument(path, R"({"KAVOMDTextContent":")" + word + R"("})"))));
  }
  // The words of the documents, by their paths.
  std::map<std::string, std::string> Words() {
    Json::Value data;
    data["query"]["qsl"]["prefix"]["KAVOMDPath"] = "/v/";
    data["query"]["size"] = 100;
    EXPECT_EQ(Do("document_get_by_query", data), "ok");
    std::map<std::string, std::string> words;
    for (const Json::Value& hit : last["data"]) {
      words[hit["KAVOMDPath"].asString()] = hit["KAVOMDTextContent"].asString();
    }
    return words;
  }

  Json::Value last;

 private:
  vexlo::elasticd::Engine engine_;
};

TEST(WorkFaults, ACommitIsWholeOrToldToHaveFailed) {
  const std::string folder = kRoot.MakeFolder("engine");
  const std::string saved = kRoot / "engine.saved";
  {
    Store store(folder);
    Json::Value data;
    data["path"] = folder + "/i";
    data["mappings"] = Parsed(kMappings);
    ASSERT_EQ(store.Do("index_create", data), "ok");
    for (const char* const path : {"/v/kept", "/v/changed", "/v/deleted"}) {
      ASSERT_EQ(store.Add(path, "old"), "ok");
    }
    ASSERT_EQ(store.Do("commit"), "ok");
  }
  fs::copy(folder, saved, fs::copy_options::recursive);
  std::unique_ptr<Store> store;
  const FaultyWork work = {
      "Commit",
      [&] {
        fs::remove_all(folder);
        fs::copy(saved, folder, fs::copy_options::recursive);
      },
      [&] {
        store = std::make_unique<Store>(folder);
        Json::Value deleted;
        deleted["doc_id"] = "/v/deleted";
        std::vector<std::string> answers = {store->Add("/v/new", "new"),
                                            store->Add("/v/changed", "new"),
                                            store->Do("document_del_by_id", deleted)};
        answers.push_back(store->Do("commit"));
        return std::count(answers.begin(), answers.end(), "ok") == 4;
      },
      [&](bool done, bool /*lasts*/) {
        if (fs::exists(folder + "/i/index.db.damaged-1")) {
          // A page that cannot be read counts as damaged. The file stays, and is restored here.
          EXPECT_FALSE(done);
          store.reset();
          fs::remove_all(folder);
          fs::copy(saved, folder, fs::copy_options::recursive);
        } else if (store != nullptr) {
          store->Do("commit");  // Tells of a loss.
          EXPECT_EQ(store->Add("/v/kept", "old"), "ok");
          EXPECT_EQ(store->Do("commit"), "ok");
        }
        store = std::make_unique<Store>(folder);
        const std::map<std::string, std::string> words = store->Words();
        store.reset();
        const std::map<std::string, std::string> want = {
            {"/v/kept", "old"}, {"/v/changed", "new"}, {"/v/new", "new"}};
        if (done) {
          EXPECT_EQ(words, want);
          return;
        }
        for (const auto& [path, word] : words) {
          const bool is_before = word == "old" && path != "/v/new";
          EXPECT_TRUE(is_before || (want.contains(path) && want.at(path) == word)) << path << word;
        }
        EXPECT_TRUE(words.contains("/v/kept") && words.contains("/v/changed"));
      },
      /*bears_lasting_no_memory=*/false};
  printf("%s: %u faults\n", work.name, RunWithEveryFault(work, 25));
}

// --- The index daemon's cycle

TEST(WorkFaults, ACycleAndItsCrawlAreDoneOrDoneAgain) {
  static vexlo::fileindexd::Stats stats;
  const auto run = [](bool compares) {
    vexlo::fileindexd::ShareState state =
        vexlo::fileindexd::LoadShareState(vexlo::fileindexd::ShareStateFile("docs"));
    index::QueueMgr queue(vexlo::sdk::SDKShare("docs").GetQueuePath());
    vexlo::fileindexd::Cycle cycle("docs", kDocs, "test", state, stats, [] { return false; });
    queue.ProcessOP([&](const std::shared_ptr<index::OP>& op) { cycle.Handle(*op); },
                    /*use_tmp=*/true);
    compares ? cycle.ReconcileShare() : cycle.ReconcileNewFolders();
    cycle.Finish();
    queue.DeleteTmp();
    return true;
  };
  const FaultyWork work = {
      "Cycle",
      [&] {
        Clear();
        fs::remove_all(kIn);
        fs::create_directories(kIn + "/a/b");
        WriteText(kIn + "/a/1.txt", "q000000000000001");
        WriteText(kIn + "/a/b/2.txt", "q000000000000002");
        EXPECT_EQ(Tool({"folder", "add", kIn}), 0);
        EXPECT_TRUE(run(/*compares=*/false));
        fs::rename(kIn + "/a", kIn + "/c");
        WriteText(kIn + "/3.txt", "q000000000000003");
        fs::remove(kIn + "/c/1.txt");
        const auto line = [](int event, const std::string& path, const std::string& old) {
          return "{\"event\":" + std::to_string(event) + ",\"path\":\"" + path +
                 "\",\"path_old\":\"" + old + "\"}\n";
        };
        WriteText(vexlo::sdk::SDKShare("docs").GetQueuePath(),
                  line(256, kIn + "/c", kIn + "/a") + line(8, kIn + "/3.txt", "") +
                      line(128, kIn + "/c/1.txt", "") + line(65536, kIn, ""));
      },
      [&] { return run(/*compares=*/false); },
      [&](bool done, bool /*lasts*/) {
        const std::string queue = vexlo::sdk::SDKShare("docs").GetQueuePath();
        if (!done || fs::exists(queue) || fs::exists(queue + ".tmp")) {
          return;  // The next cycle has it.
        }
        // What failed of one path alone is counted, and made good by the next comparison.
        if (!stats.ToJson()["errors"].empty()) {
          EXPECT_TRUE(run(/*compares=*/true));
        }
        const std::set<std::string> tokens = {"q000000000000001", "q000000000000002",
                                              "q000000000000003"};
        Listing disk = ListDisk(kIn);
        const Listing index = ListIndex("docs", tokens);
        Json::Value unread;
        unread["id"] = "fileindex_docs";
        unread["query"]["qsl"]["prefix"][kavo::local::kContentErrorField] = "un";
        if (!AskIndex("document_get_by_query", unread).empty()) {
          disk.tokens = index.tokens;  // Their documents say that they could not be read.
        }
        EXPECT_EQ(Differences(disk, index), "");
      },
      /*bears_lasting_no_memory=*/false};
  printf("%s: %u faults\n", work.name, RunWithEveryFault(work, 25));
}

class Daemons : public testing::Environment {
 public:
  void StartEngine() {
    engine_ = std::make_unique<Program>("export FILEINDEX_ROOT=" + kRoot.Path(),
                                        KAVOELASTICD_PROGRAM " 2>&1");
    ASSERT_TRUE(engine_->Await("ready")) << engine_->text;
  }
  void KillEngine() { engine_->End(SIGKILL); }
  void SetUp() override {
    kRoot.MakeFolder("tmp");
    kRoot.MakeFolder("vol/keep");
    kRoot.MakeFolder("var/run");
    StartEngine();
    indexer_ = std::make_unique<FakeEngine>(kRoot / "var/run/fileindexd.sock");
  }
  void TearDown() override {
    indexer_.reset();
    EXPECT_EQ(engine_->End(SIGTERM), 0);
  }

 private:
  std::unique_ptr<Program> engine_;
  std::unique_ptr<FakeEngine> indexer_;
};
auto* const kDaemons = static_cast<Daemons*>(testing::AddGlobalTestEnvironment(new Daemons));

// A run that was killed had sent it, and a later one finds nothing that is missing.
TEST(WorkFaults, AComparisonCommitsWhatItFound) {
  Clear();
  fs::remove_all(kIn);
  WriteText(kRoot.MakeFolder("vol/docs/in") + "/a.txt", "q000000000000001");
  ASSERT_EQ(Tool({"folder", "add", kIn}), 0);
  usleep(100'000);  // Nothing is so young that it is read again.
  vexlo::fileindexd::Stats stats;
  vexlo::fileindexd::ShareState state;
  const auto compare = [&] {
    vexlo::fileindexd::Cycle cycle("docs", kDocs, "test", state, stats, [] { return false; });
    cycle.ReconcileShare();
    cycle.Finish();
  };
  compare();
  WriteText(kIn + "/b.txt", "q000000000000002");
  usleep(100'000);
  for (const std::string& path : {kIn, kIn + "/b.txt"}) {
    Json::Value reply;
    vexlo::SendRequestImpl(reply,
                           vexlo::fileindexd::MakePut("fileindex_docs", path, /*content=*/true));
  }
  compare();
  kDaemons->KillEngine();
  kDaemons->StartEngine();
  const Listing index = ListIndex("docs", {"q000000000000001", "q000000000000002"});
  EXPECT_EQ(Differences(ListDisk(kIn), index), "");
}

// Meanwhile others may have been told that it was under way, and not asked for one of their own.
TEST(WorkFaults, AComparisonThatGoesOnLooksOnceMoreAtWhatItHadPassed) {
  Clear();
  fs::remove_all(kIn);
  kRoot.MakeFolder("vol/docs/in");
  for (const char* const name : {"/a.txt", "/m.txt", "/z.txt"}) {
    WriteText(kIn + name, "q000000000000001");
  }
  ASSERT_EQ(Tool({"folder", "add", kIn}), 0);
  vexlo::fileindexd::Stats stats;
  vexlo::fileindexd::ShareState state;
  state.crawl = {kDocs, "settings", kIn + "/m.txt"};
  vexlo::fileindexd::Cycle cycle("docs", kDocs, "test", state, stats, [] { return false; });
  cycle.ReconcileShare();
  cycle.Finish();
  EXPECT_EQ(Differences(ListDisk(kIn), ListIndex("docs", {"q000000000000001"})), "");
}

// Neither what it has passed already nor what it will not find.
TEST(WorkFaults, AComparisonLooksAtWhatIsQueuedMeanwhile) {
  Clear();
  fs::remove_all(kIn);
  kRoot.MakeFolder("vol/docs/in");
  for (int i = 0; i < 30; ++i) {
    WriteText(kIn + "/" + std::to_string(i) + ".txt", "q000000000000001");
  }
  ASSERT_EQ(Tool({"folder", "add", kIn}), 0);
  const std::string queue = vexlo::sdk::SDKShare("docs").GetQueuePath();
  WriteText(queue, "{\"event\":8,\"path\":\"" + kIn + "/no such\"}\n");
  const auto change = [&] {
    std::string lines;
    const auto note = [&](int event, const char* path, const std::string& more = "") {
      lines +=
          "{\"event\":" + std::to_string(event) + ",\"path\":\"" + kIn + path + "\"" + more + "}\n";
    };
    WriteText(kIn + "/+new.txt", "q000000000000002");
    note(8, "/+new.txt");
    fs::rename(kIn + "/0.txt", kIn + "/+renamed.txt");
    note(256, "/+renamed.txt", ",\"path_old\":\"" + kIn + "/0.txt\"");
    fs::remove(kIn + "/1.txt");
    note(128, "/1.txt");
    lines += "{\"event\":8,\"path\":\"" + kIn + "/9.txt";  // Is being written.
    WriteText(queue, ReadText(queue) + lines);
  };
  const auto self = std::this_thread::get_id();
  int asked = 0;
  vexlo::fileindexd::Stats stats;
  vexlo::fileindexd::ShareState state;
  vexlo::fileindexd::Cycle cycle("docs", kDocs, "test", state, stats, [&] {
    // Behind the first files, and the folder's names were all read.
    if (std::this_thread::get_id() == self && ++asked == 15) {
      change();
    }
    return false;
  });
  cycle.LookAheadIn(queue, std::chrono::milliseconds(0));
  cycle.ReconcileShare();
  cycle.Finish();
  EXPECT_GT(asked, 15);
  const Listing index = ListIndex("docs", {"q000000000000001", "q000000000000002"});
  Listing disk = ListDisk(kIn);
  // The folder itself has another date, of which its own event would tell.
  EXPECT_EQ(index.tokens, disk.tokens);
}

}  // namespace
