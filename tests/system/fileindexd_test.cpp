// The index daemon beside the real engine: queue lines go in, and a search tells what came of them.
#include <gtest/gtest.h>
#include <sys/stat.h>

#include <algorithm>
#include <chrono>
#include <filesystem>
#include <functional>
#include <set>

#include "common/error.h"
#include "common/file.h"
#include "common/json.h"
#include "common/sdk/share.h"
#include "fileindex/elastic_control/share_index.h"
#include "fileindex/optree/event.h"
#include "fileindex/paths.h"
#include "fileindex/status_mgr.h"
#include "support/fake_engine.h"
#include "support/queue_file.h"
#include "support/random_tree.h"
#include "support/stack.h"

namespace {

namespace fs = std::filesystem;
using std::to_string;
using vexlo::fileindex::EV_ATTRIB;
using vexlo::fileindex::EV_CLOSE_WRITE;
using vexlo::fileindex::EV_CREATE;
using vexlo::fileindex::EV_DELETE;
using vexlo::fileindex::EV_QUEUE_CRASHED;
using vexlo::fileindex::EV_REINDEX;
using vexlo::fileindex::EV_RENAME;
using vexlo::fileindex::EV_UPDATE_DIRECTORY;
using vexlo::fileindex::StatusMgr;
using Paths = std::set<std::string>;

const PrivateRoot kRoot;

// Without the watcher.
class Fileindexd : public testing::Test, protected Daemons {
 protected:
  Fileindexd() : Daemons(kRoot, {{"fileindexd", "--cycle 100"}}) {
    SetFolders({"/docs/in"});
    Start("kavocontentextractd");
  }

  // Both, and the first crawl done.
  void StartAll() {
    Start("kavoelasticd");
    Start("fileindexd");
    Cycle({});
  }

  // Appends lines and waits until their work is committed and the snapshot is gone.
  void Cycle(const std::vector<std::string>& lines) {
    Append(lines);
    ASSERT_TRUE(AwaitAllDone()) << Logs();
  }
  bool AwaitAllDone() const {
    // In this order, as the first becomes the second.
    return Await([this] { return !fs::exists(queue_) && !fs::exists(snapshot_); });
  }
  void Append(const std::vector<std::string>& lines) const {
    // A line of an event that means nothing, so that there is one.
    vexlo::AppendLines(queue_, Join(lines) + Line(0, In("no such")) + "\n");
  }
  bool AwaitState(const std::string& state) const {
    return Await([&] { return Indexing()["state"] == state; });
  }

  // The paths that a committed search finds, less the folder's, and "." for the folder itself.
  Paths Search(const std::string& query) const {
    Json::Value data;
    EXPECT_TRUE(vexlo::JsonFromString(data, query)) << query;
    data["ids"].append("fileindex_docs");
    data["size"] = 10000;
    const Json::Value hits = AskIndex("search", data);
    Paths paths;
    for (const Json::Value& hit : hits) {
      const std::string path = hit["path"].asString();
      paths.insert(path == In()                   ? "."
                   : path.starts_with(In() + "/") ? path.substr(In().size() + 1)
                                                  : path);
    }
    EXPECT_EQ(paths.size(), hits.size()) << "some path twice";
    return paths;
  }
  Paths All() const { return Search("{}"); }
  Paths Words(const std::string& words) const { return Search(R"({"words":")" + words + "\"}"); }

  bool IsDone(const std::string& command) const { return Command(command)["success"].asBool(); }

  const fs::path docs_ = Share();
  const std::string queue_ = vexlo::sdk::SDKShare("docs").GetQueuePath();
  const std::string snapshot_ = queue_ + ".tmp";
};

TEST_F(Fileindexd, CarriesOutEachOperation) {
  Write("old/a.txt", "first");
  Write("old/b.txt", "second");
  Write("old/@eaDir/x", "hidden");
  fs::create_directories(docs_ / "out");
  WriteText(docs_ / "out/x", "outside");
  fs::create_symlink("old", In("link"));
  fs::create_hard_link(In("old/b.txt"), In("hard"));
  StartAll();
  EXPECT_EQ(All(), (Paths{".", "old", "old/a.txt", "old/b.txt", "hard"}));
  const struct {
    const char* name;
    std::function<void()> change;
    std::vector<std::string> lines;
    Paths all;
    std::string words;
    Paths found;
  } steps[] = {
      {"UpsertOfWhatIsGoneOrNotWanted",
       [&] { fs::remove(In("old/a.txt")); },
       {Line(EV_CLOSE_WRITE, In("old/a.txt")), Line(EV_CLOSE_WRITE, In("link")),
        Line(EV_CLOSE_WRITE, In("old/@eaDir/x")), Line(EV_CLOSE_WRITE, docs_ / "out/x")},
       {".", "old", "old/b.txt", "hard"},
       "outside",
       {}},
      {"AttributesOfWhatWasNeverIndexedAndThatHideALostChange",
       [&] { Write("late", "changed"), Write("hard", "changed"); },
       {Line(EV_ATTRIB, In("late")), Line(EV_ATTRIB, In("hard"))},
       {".", "old", "old/b.txt", "hard", "late"},
       "changed",
       {"late", "hard"}},
      {"RenameIntoTheFolders",
       [&] { fs::rename(docs_ / "out", In("moved")); },
       {Line(EV_RENAME, In("moved"), docs_ / "out", true), Line(EV_DELETE, In("old"), "", true)},
       {".", "old", "old/b.txt", "hard", "late", "moved", "moved/x"},
       "outside",
       {"moved/x"}},
      {"CrashedQueue",
       [&] {
         fs::remove_all(In("old"));
         fs::remove(In("hard"));
         Write("after", "the crash");
       },
       {Line(EV_QUEUE_CRASHED, docs_)},
       {".", "late", "moved", "moved/x", "after"},
       "crash",
       {"after"}},
      {"PoisonBetween",
       [&] { Write("sane", "sane"), Write("hidden/.git/config", "sane"); },
       {"{", "\xFF", R"({"event":8,"path":""})", R"({"event":8,"path":"x"})",
        "{\"event\":8,\"path\":\"" + In("a\\u0000b") + "\"}",
        Line(EV_DELETE, kRoot / "vol", "", true), Line(EV_RENAME, In("sane"), "/"),
        Line(EV_RENAME, In("sane"), In("sane")),
        Line(EV_RENAME, In("moved/into"), In("moved"), true),
        Line(EV_CLOSE_WRITE, In(std::string(300, 'n'))), Line(EV_REINDEX, In("moved/@eaDir")),
        Line(EV_REINDEX, In("hidden/.git/config")),
        R"({"event":131072,"path":")" + In("") + R"(","data":7})",
        Line(EV_CLOSE_WRITE, In("sane"))},
       {".", "late", "moved", "moved/x", "after", "sane"},
       "sane",
       {"sane"}},
      // By the time of the upsert the file has another path, of which the queue tells later.
      {"WriteInAFolderThatIsRenamedMeanwhile",
       [&] {
         Write("moved/missed.txt", "elusive");
         fs::rename(In("moved"), In("away"));
       },
       {Line(EV_CREATE, In("moved/missed.txt")), Line(EV_CLOSE_WRITE, In("moved/missed.txt"))},
       {".", "late", "moved", "moved/x", "after", "sane"},
       "elusive",
       {}},
      {"RenameOfAFolderThatWasMissedIn",
       [&] {},
       {Line(EV_RENAME, In("away"), In("moved"), true)},
       {".", "late", "away", "away/x", "away/missed.txt", "after", "sane"},
       "elusive",
       {"away/missed.txt"}},
      // The fold makes the folder's deletion part of its making, which is before the rename.
      {"RenamedIntoAFolderThatIsGone",
       [&] { fs::remove_all(In("away")); },
       {Line(EV_CREATE, In("brief"), "", true), Line(EV_RENAME, In("brief/away"), In("away"), true),
        Line(EV_DELETE, In("brief/away/x")), Line(EV_DELETE, In("brief/away"), "", true),
        Line(EV_DELETE, In("brief"), "", true)},
       {".", "late", "after", "sane"},
       "elusive",
       {}},
      {"FoldersToBeRenamed",
       [&] {
         Write("a/x", "ghostly"), Write("a/y", "ghostly");
         Write("b/x", "ghostly"), Write("b/y", "ghostly");
       },
       {Line(EV_CREATE, In("a"), "", true), Line(EV_CREATE, In("b"), "", true)},
       {".", "late", "after", "sane", "a", "a/x", "a/y", "b", "b/x", "b/y"},
       "ghostly",
       {"a/x", "a/y", "b/x", "b/y"}},
      // The making of the new folder cancels the delete, which was before the rename.
      {"DeletedInAFolderThatIsRenamedAndMadeAnew",
       [&] {
         fs::remove(In("a/x"));
         fs::rename(In("a"), In("a1"));
         fs::create_directory(In("a"));
       },
       {Line(EV_DELETE, In("a/x")), Line(EV_RENAME, In("a1"), In("a"), true),
        Line(EV_CREATE, In("a"), "", true)},
       {".", "late", "after", "sane", "a", "a1", "a1/y", "b", "b/x", "b/y"},
       "ghostly",
       {"a1/y", "b/x", "b/y"}},
      {"DeletedInAFolderThatIsRenamedAndItsNamesTaken",
       [&] {
         fs::remove(In("b/x"));
         fs::rename(In("b"), In("b1"));
         fs::rename(In("a"), In("b"));
         fs::rename(In("sane"), In("b/x"));
       },
       {Line(EV_DELETE, In("b/x")), Line(EV_RENAME, In("b1"), In("b"), true),
        Line(EV_RENAME, In("b"), In("a"), true), Line(EV_RENAME, In("b/x"), In("sane"))},
       {".", "late", "after", "a1", "a1/y", "b", "b/x", "b1", "b1/y"},
       "ghostly",
       {"a1/y", "b1/y"}},
  };
  for (const auto& step : steps) {
    SCOPED_TRACE(step.name);
    step.change();
    Cycle(step.lines);
    EXPECT_EQ(All(), step.all);
    EXPECT_EQ(Words(step.words), step.found);
  }
}

TEST_F(Fileindexd, IndexesNoMoreThanNeeded) {
  StartAll();
  const auto files = [this](const std::vector<std::string>& lines) {
    const auto before = Indexing()["files"].asInt();
    Cycle(lines);
    return Indexing()["files"].asInt() - before;
  };
  // More documents than are listed at a time, with names that stand before and behind "/".
  constexpr int kFiles = 4500;
  const std::string folders[] = {"big/", "big/a/", "big/a!/", "big/a.b/c/"};
  for (int i = 0; i < kFiles; ++i) {
    Write(folders[i % 4] + to_string(i), "text");
  }
  Write("big.mp3", "x");
  Write("note.txt", "x");
  usleep(100'000);  // What has changed within a tick of the clock is read again.
  EXPECT_EQ(files({Line(EV_REINDEX, docs_ / "in")}), kFiles + 8);
  EXPECT_EQ(files({Line(EV_REINDEX, docs_ / "in")}), 0);
  Paths want = All();
  ASSERT_EQ(want.size(), kFiles + 8U);
  const Json::Value errors = Indexing()["errors"];
  fs::rename(In("big"), In("large"));
  EXPECT_EQ(files({Line(EV_RENAME, In("large"), In("big"), true)}), 0);
  for (const std::string& path : All()) {
    EXPECT_TRUE(path == "big.mp3" || !path.starts_with("big")) << path;
    want.erase(path.starts_with("large") ? "big" + path.substr(5) : path);
  }
  EXPECT_EQ(want, Paths());
  EXPECT_EQ(Indexing()["errors"], errors);
  // The folder above has another date, and the renamed one is known with its new one.
  EXPECT_EQ(files({Line(EV_REINDEX, docs_ / "in")}), 1);
  Write(".note.txt", "saved");
  fs::rename(In(".note.txt"), In("note.txt"));
  EXPECT_EQ(files({Line(EV_CREATE, In(".note.txt")), Line(EV_CLOSE_WRITE, In(".note.txt")),
                   Line(EV_RENAME, In("note.txt"), In(".note.txt"))}),
            1);
  EXPECT_EQ(files({Line(EV_ATTRIB, In("note.txt"))}), 0);
  const auto update = [&](const std::string& types) {
    return files({Line(EV_UPDATE_DIRECTORY, docs_ / "in", "", true, types)});
  };
  EXPECT_EQ(update(R"({"audio":true})"), 2);  // The song, and the folder with its new date.
  EXPECT_EQ(update(R"({"photo":true})"), 0);
  EXPECT_EQ(update(R"({"document":true})"), kFiles + 1);
  EXPECT_EQ(update(R"({"basic":true})"), kFiles + 8);
}

TEST_F(Fileindexd, FollowsTheSettings) {
  Write("a.txt", "alpha");
  const std::string b = docs_ / "new/b.txt";
  fs::create_directories(docs_ / "new");
  WriteText(b, "beta");
  StartAll();
  const auto change = [&](const std::vector<std::string>& lines) {
    EXPECT_TRUE(IsDone(
        R"({"type":"notify_setting_changed","data":{"share_name":"docs","is_upsert":true}})"));
    Cycle(lines);
  };
  SetFolders({"/docs/in"}, {"/docs/new"});
  change({});
  EXPECT_EQ(All(), (Paths{".", "a.txt", docs_ / "new", b}));
  EXPECT_EQ(Words("beta"), Paths());
  SetFolders({"/docs/in", "/docs/new"});
  change({Line(EV_REINDEX, docs_ / "new")});
  EXPECT_EQ(Words("beta"), Paths{b});
  SetFolders({"/docs/new"});
  change({});
  EXPECT_EQ(All(), (Paths{docs_ / "new", b}));
  // A worker that is deleted and made again.
  EXPECT_TRUE(IsDone(R"({"type":"worker_delete","data":{"share_name":"docs"}})"));
  EXPECT_TRUE(Await([this] { return Command(R"({"type":"stats"})")["shares"].empty(); }));
  fs::remove(b);
  Append({Line(EV_DELETE, b)});
  EXPECT_TRUE(IsDone(R"({"type":"worker_create","data":{"share_name":"docs"}})"));
  EXPECT_TRUE(AwaitAllDone());
  EXPECT_EQ(All(), Paths{docs_ / "new"});
}

TEST_F(Fileindexd, TakesCareOfTheStatusBits) {
  Write("a", "alpha");
  StartAll();
  Write("b", "untold");
  StatusMgr().SetShareStatus("docs", 1);
  Cycle({});
  EXPECT_EQ(All(), (Paths{".", "a", "b"}));
  EXPECT_EQ(StatusMgr().GetShareStatus("docs"), 0U);
  // Something of which a new index knows nothing.
  Json::Value ghost;
  ghost["id"] = "fileindex_docs";
  ghost["doc_id"] = ghost["data"]["KAVOMDPath"] = "/ghost";
  AskIndex("document_upsert_by_id", ghost);
  Cycle({Line(EV_CLOSE_WRITE, In("a"))});
  EXPECT_TRUE(All().contains("/ghost"));
  StatusMgr().SetShareStatus("docs", 2);
  Cycle({});
  EXPECT_EQ(All(), (Paths{".", "a", "b"}));
  EXPECT_EQ(StatusMgr().GetShareStatus("docs"), 0U);
  // And an index that somebody took away is made when it is missed.
  vexlo::fileindex::elastic::ShareIndexDelete("docs");
  Cycle({Line(EV_CLOSE_WRITE, In("a"))});
  EXPECT_EQ(All(), (Paths{".", "a", "b"}));
  // A pause ends by itself.
  Command(R"({"type":"pause","data":{"resume_time":)" + to_string(time(nullptr) + 2) + "}}");
  ASSERT_TRUE(AwaitState("paused"));
  fs::remove(In("b"));
  Cycle({Line(EV_DELETE, In("b"))});
  EXPECT_EQ(All(), (Paths{".", "a"}));
}

TEST_F(Fileindexd, TellsOnceThatThereIsNoSpace) {
  Write("a", "alpha");
  const std::string notifier = kRoot.MakeFolder("usr/kavo/bin") + "/kavoqpxnotify";
  WriteText(notifier, "#!/bin/sh\necho told >> " + kRoot / "tmp/told" + "\n");
  chmod(notifier.c_str(), 0755);
  const std::string again = R"({"type":"worker_create","data":{"share_name":"docs"}})";
  {
    FakeEngine full(kRoot / "var/run/kavoelasticd.sock");
    const std::string refusal = R"({"success":false,"error":{"code":2010,"msg":"full"}})";
    full.Script(std::deque<std::string>(100, refusal));
    Start("fileindexd");
    for (int i = 0; i < 2; ++i) {
      EXPECT_TRUE(Await([&] { return Indexing()["errors"]["2010"].asInt() > i; }));
      ASSERT_TRUE(AwaitState("failing"));
      Command(again);
    }
    EXPECT_EQ(ReadText(kRoot / "tmp/told"), "told\n");
  }
  Start("kavoelasticd");
  Command(again);
  Cycle({});
  EXPECT_EQ(All(), (Paths{".", "a"}));
}

TEST_F(Fileindexd, AnswersEveryCommandAtOnce) {
  StartAll();
  const std::pair<std::string, bool> cases[] = {
      {R"({"type":"resume","data":null})", true},
      {R"({"type":"dance","data":null})", false},
      {R"({"type":"pause","data":{"resume_time":"soon"}})", false},
      {R"({"type":"worker_create","data":{}})", false},
      {R"({"type":"worker_create","data":{"share_name":"no such share"}})", true},
      {R"({"data":null})", false},
      {"[]", false},
      {"", false},
      {std::string("\0\0", 2), false}};
  for (const auto& [text, want] : cases) {
    EXPECT_EQ(IsDone(text), want) << text;
  }
  const std::string socket = vexlo::fileindex::kFileIndexDaemonSocketPath.Get();
  for (const uint64_t length : {UINT64_MAX, uint64_t{100} << 20}) {
    const RawClient client(socket, LengthBytes(length) + "{");
    EXPECT_NE(client.Receive(100).find("the request is too long"), std::string::npos) << length;
  }
  ASSERT_TRUE(AwaitState("idle"));
  Program tool("exec 2>&1", FILEINDEX_PROGRAM " status --all");
  EXPECT_EQ(tool.End(), 0);
  // How wide the columns are depends on whether the share that there is not is listed yet.
  EXPECT_NE(tool.text.find("\ndocs "), std::string::npos) << tool.text;
  EXPECT_NE(tool.text.find("0 lines  0 changes, 1 file "), std::string::npos) << tool.text;
  // It is the next one's, whoever left it.
  End("fileindexd", SIGKILL);
  EXPECT_TRUE(fs::exists(socket));
  Start("fileindexd");
  EXPECT_TRUE(IsDone(R"({"type":"stats"})"));
}

// By digests, with changes of which nobody was told: of the disk, and of the index by others.
TEST_F(Fileindexd, AComparisonFindsWhatOneEntryByEntryDoes) {
  SetFolders({"/docs/in"}, {"/docs/in/a"});
  fs::create_directories(docs_ / "out");
  StartAll();
  RandomTree tree(docs_ / "in", docs_ / "out", 7);
  for (int round = 0; round < 20 && !HasFailure(); ++round) {
    SCOPED_TRACE(round);
    const Listing before = ListIndex("docs", {});
    for (const auto& [path, facts] : before.paths) {
      Json::Value document;
      document["id"] = "fileindex_docs";
      document["doc_id"] = path;
      document["data"]["KAVOMDPath"] = path + "x";
      if (const unsigned lot = tree.Below(40); lot < 2) {
        AskIndex(lot == 0 ? "document_del_by_id" : "document_set_by_id", document);
      }
    }
    for (unsigned left = tree.Below(30); left > 0; --left) {
      tree.Change();
    }
    Cycle({Line(EV_REINDEX, docs_ / "in")});
    EXPECT_EQ(ListDisk(docs_ / "in").paths, ListIndex("docs", {}).paths) << tree.Text();
    const auto files = Indexing()["files"].asInt();
    Cycle({Line(EV_UPDATE_DIRECTORY, docs_ / "in", "", true, R"({"basic":false})")});
    EXPECT_EQ(Indexing()["files"].asInt(), files) << tree.Text();
  }
}

TEST_F(Fileindexd, ACrawlGoesOnWhereItWasKilledAndStopsInTime) {
  constexpr int kFiles = 12000;
  std::vector<std::string> all = {In("tree")};
  for (int i = 0; i < kFiles; ++i) {
    const std::string name = "tree/" + to_string(i % 100) + "/" + to_string(i);
    Write(name, "x");
    all.push_back(In(name));
    if (i < 100) {
      all.push_back(fs::path(In(name)).parent_path());
    }
  }
  usleep(100'000);  // What has changed within a tick of the clock is read again.
  Start("kavoelasticd");
  const auto after = [] {
    Json::Value state;
    const bool is_there = vexlo::JsonFromFile(state, kRoot / "var/lib/kavo/fileindexd/docs.json");
    return is_there ? state["crawl"]["after"].asString() : "";
  };
  Start("fileindexd");
  ASSERT_TRUE(AwaitState("crawling"));
  // The engine is asked for what it has, first.
  ASSERT_TRUE(Await([this] { return Indexing()["files"].asInt() > 0; }));
  Signal("kavoelasticd", SIGSTOP);
  sleep(2);  // As long as a crawl goes on without saving where it stands.
  Signal("kavoelasticd", SIGCONT);
  ASSERT_TRUE(Await([&] { return !after().empty(); }));
  End("fileindexd", SIGKILL);
  const std::string reached = after();
  ASSERT_FALSE(reached.empty());
  Start("fileindexd");
  ASSERT_TRUE(AwaitState("crawling"));
  const auto before = std::chrono::steady_clock::now();
  EXPECT_EQ(End("fileindexd", SIGTERM), 0);
  EXPECT_LT(std::chrono::steady_clock::now() - before, std::chrono::seconds(2));
  Start("fileindexd");
  Cycle({});
  const auto left = std::count_if(all.begin(), all.end(),
                                  [&](const std::string& path) { return path > reached; });
  EXPECT_LT(left, static_cast<ptrdiff_t>(all.size()));
  EXPECT_LE(Indexing()["progress"]["found"].asInt(), left);
  EXPECT_EQ(Search(R"({"below":")" + In("tree/7") + "\"}").size(), kFiles / 100U);
  EXPECT_EQ(Search(R"({"below":")" + In("tree") + "\"}").size(), 10000U);  // As many as are asked.
  // Nothing of it was missed.
  const auto files = Indexing()["files"].asInt();
  Cycle({Line(EV_REINDEX, docs_ / "in")});
  EXPECT_EQ(Indexing()["files"].asInt(), files);
}

TEST_F(Fileindexd, StopsInTimeWhenTheEngineDoesNotAnswer) {
  StartAll();
  Signal("kavoelasticd", SIGSTOP);
  Write("a", "alpha");
  Append({Line(EV_CLOSE_WRITE, In("a"))});
  ASSERT_TRUE(Await([this] { return fs::exists(snapshot_); }));
  const auto before = Clock::now();
  EXPECT_EQ(End("fileindexd", SIGTERM), 0);
  EXPECT_LT(Clock::now() - before, std::chrono::seconds(2));
  EXPECT_TRUE(fs::exists(snapshot_));
  Signal("kavoelasticd", SIGCONT);
  // What was queued behind the snapshot is taken without another line.
  Write("b", "beta");
  Append({Line(EV_CLOSE_WRITE, In("b"))});
  Start("fileindexd");
  EXPECT_TRUE(AwaitAllDone());
  EXPECT_EQ(All(), (Paths{".", "a", "b"}));
}

TEST_F(Fileindexd, WaitsForAListOfFoldersThatCanBeRead) {
  WriteText(vexlo::fileindex::kFileIndexFoldersCfgPath.Get(), "{");
  Start("kavoelasticd");
  Start("fileindexd");
  Append({});
  EXPECT_TRUE(
      Await([this] { return Logs().find("the folders are not known") != std::string::npos; }));
  SetFolders({"/docs/in"});
  EXPECT_TRUE(AwaitAllDone());
  EXPECT_EQ(All(), Paths{"."});
}

}  // namespace
