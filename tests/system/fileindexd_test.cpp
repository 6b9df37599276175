// The index daemon beside the real engine: queue lines go in, and a search tells what came of them.
#include <gtest/gtest.h>
#include <sys/stat.h>

#include <algorithm>
#include <chrono>
#include <filesystem>
#include <functional>
#include <set>

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

  // A text of its own in a file, which is searched for from now on.
  std::string WriteToken(const std::string& name) {
    char token[kTokenBytes + 1];
    snprintf(token, sizeof(token), "q%015zu", tokens_.size());
    Write(name, token);
    return *tokens_.insert(token).first;
  }
  // Where the index is to be what the disk is.
  void ExpectIndexed() const {
    EXPECT_EQ(Differences(ListDisk(In()), ListIndex("docs", tokens_)), "");
  }
  // The paths in the index, less the share's.
  Paths All() const {
    Paths paths;
    for (const auto& [path, facts] : ListIndex("docs", {}).paths) {
      paths.insert(path.substr(path.find(Share()) == 0 ? Share().size() + 1 : 0));
    }
    return paths;
  }

  bool IsDone(const std::string& command) const { return Command(command)["success"].asBool(); }

  const fs::path docs_ = Share();
  const std::string queue_ = vexlo::sdk::SDKShare("docs").GetQueuePath();
  const std::string snapshot_ = queue_ + ".tmp";
  Paths tokens_;
};

// Plain ones are among the random changes of the whole stack.
TEST_F(Fileindexd, CarriesOutOperationsThatAreHardToTell) {
  WriteToken("old/a.txt");
  WriteToken("old/b.txt");
  WriteToken("old/@eaDir/x.txt");
  WriteToken("late.txt");
  const std::string out = docs_ / "out";
  fs::create_directory(out);
  WriteText(out + "/x.txt", WriteToken("x.txt"));
  fs::create_symlink("old", In("link"));
  fs::create_hard_link(In("old/b.txt"), In("hard.txt"));
  StartAll();
  ExpectIndexed();
  const struct {
    const char* name;
    std::function<void()> change;
    std::vector<std::string> lines;
    const char* not_yet = nullptr;  // Known by this path, and to be told of by the next lines.
  } steps[] = {
      {"UpsertOfWhatIsGoneOrNotWanted",
       [&] { fs::remove(In("old/a.txt")); },
       {Line(EV_CLOSE_WRITE, In("old/a.txt")), Line(EV_CLOSE_WRITE, In("link")),
        Line(EV_CLOSE_WRITE, In("old/@eaDir/x.txt")), Line(EV_CLOSE_WRITE, out + "/x.txt")}},
      {"AttributesOfWhatWasNeverIndexedAndThatHideALostChange",
       [&] { WriteToken("new.txt"), WriteToken("late.txt"); },
       {Line(EV_ATTRIB, In("new.txt")), Line(EV_ATTRIB, In("late.txt"))}},
      {"FolderInTheFilesPlace",
       [&] {
         fs::remove(In("late.txt"));
         WriteToken("late.txt/inside.txt");
         fs::rename(out, In("moved"));
       },
       {Line(EV_RENAME, In("moved"), out, true), Line(EV_DELETE, In("late.txt")),
        Line(EV_CREATE, In("late.txt"), "", true)}},
      {"CrashedQueue",
       [&] {
         fs::remove_all(In("old"));
         WriteToken("after.txt");
       },
       {Line(EV_QUEUE_CRASHED, docs_)}},
      {"PoisonBetween",
       [&] { WriteToken("sane.txt"), WriteToken("hidden/.git/config"); },
       {"{", "\xFF", R"({"event":8,"path":""})", R"({"event":8,"path":"x"})",
        "{\"event\":8,\"path\":\"" + In("a\\u0000b") + "\"}",
        Line(EV_DELETE, kRoot / "vol", "", true), Line(EV_RENAME, In("sane.txt"), "/"),
        Line(EV_RENAME, In("sane.txt"), In("sane.txt")),
        Line(EV_RENAME, In("moved/into"), In("moved"), true),
        Line(EV_CLOSE_WRITE, In(std::string(300, 'n'))), Line(EV_REINDEX, In("moved/@eaDir")),
        Line(EV_REINDEX, In("hidden/.git/config")),
        R"({"event":131072,"path":")" + In("") + R"(","data":7})",
        Line(EV_CLOSE_WRITE, In("sane.txt")), Line(EV_CREATE, In("hidden"), "", true)}},
      // By the time of the upsert the file has another path, of which the queue tells later.
      {"WriteInAFolderThatIsRenamedMeanwhile",
       [&] {
         WriteToken("moved/missed.txt");
         fs::rename(In("moved"), In("away"));
       },
       {Line(EV_CREATE, In("moved/missed.txt")), Line(EV_CLOSE_WRITE, In("moved/missed.txt"))},
       "in/moved/x.txt"},
      {"RenameOfAFolderThatWasMissedIn", [] {}, {Line(EV_RENAME, In("away"), In("moved"), true)}},
      // The fold makes the folder's deletion part of its making, which is before the rename.
      {"RenamedIntoAFolderThatIsGone",
       [&] { fs::remove_all(In("away")); },
       {Line(EV_CREATE, In("brief"), "", true), Line(EV_RENAME, In("brief/away"), In("away"), true),
        Line(EV_DELETE, In("brief/away/x.txt")), Line(EV_DELETE, In("brief/away"), "", true),
        Line(EV_DELETE, In("brief"), "", true)}},
      {"FoldersToBeRenamed",
       [&] {
         for (const char* const name : {"a/x.txt", "a/y.txt", "b/x.txt", "b/y.txt"}) {
           WriteToken(name);
         }
       },
       {Line(EV_CREATE, In("a"), "", true), Line(EV_CREATE, In("b"), "", true)}},
      // The making of the new folder cancels the delete, which was before the rename.
      {"DeletedInAFolderThatIsRenamedAndMadeAnew",
       [&] {
         fs::remove(In("a/x.txt"));
         fs::rename(In("a"), In("a1"));
         fs::create_directory(In("a"));
       },
       {Line(EV_DELETE, In("a/x.txt")), Line(EV_RENAME, In("a1"), In("a"), true),
        Line(EV_CREATE, In("a"), "", true)}},
      {"DeletedInAFolderThatIsRenamedAndItsNamesTaken",
       [&] {
         fs::remove(In("b/x.txt"));
         fs::rename(In("b"), In("b1"));
         fs::rename(In("a"), In("b"));
         fs::rename(In("sane.txt"), In("b/x.txt"));
       },
       {Line(EV_DELETE, In("b/x.txt")), Line(EV_RENAME, In("b1"), In("b"), true),
        Line(EV_RENAME, In("b"), In("a"), true), Line(EV_RENAME, In("b/x.txt"), In("sane.txt"))}},
  };
  for (const auto& step : steps) {
    SCOPED_TRACE(step.name);
    step.change();
    Cycle(step.lines);
    if (step.not_yet == nullptr) {
      ExpectIndexed();
    } else {
      EXPECT_TRUE(All().contains(step.not_yet));
    }
  }
}

TEST_F(Fileindexd, FollowsMovesToWhereOtherRulesHold) {
  const std::string inner = In("inner");
  kRoot.SetShares(R"({"name":"docs","path":")" + Share() + R"("},{"name":"inner","path":")" +
                  inner + "\"}");
  fs::create_directories(inner);
  SetFolders({"/docs/in"}, {"/docs/in/b/sub"});
  for (const char* const name : {"n.txt", "dd/k.txt", "d/sub/s.txt", "d/t.txt"}) {
    WriteToken(name);
  }
  const std::string script = WriteToken("y.txt");
  WriteText(In("y.txt"), "<html><script>" + script + "</script><p>text</p></html>");
  StartAll();
  EXPECT_EQ(ListIndex("docs", tokens_).tokens.size(), 5U);
  const Json::Value errors = Indexing()["errors"];
  for (const char* const name : {"/n.txt", "/dd"}) {
    fs::rename(In() + name, inner + name);
    Cycle({Line(EV_RENAME, inner + name, In() + name, /*is_dir=*/name[1] == 'd')});
  }
  fs::rename(In("d"), In("b"));
  Cycle({Line(EV_RENAME, In("b"), In("d"), true)});
  fs::rename(In("y.txt"), In("y.html"));
  Cycle({Line(EV_RENAME, In("y.html"), In("y.txt"))});
  EXPECT_EQ(All(), (Paths{"in", "in/b", "in/b/sub", "in/b/sub/s.txt", "in/b/t.txt", "in/y.html"}));
  EXPECT_EQ(ListIndex("docs", tokens_).tokens.size(), 1U) << "of b/t.txt";
  EXPECT_EQ(Indexing()["errors"], errors);
}

TEST_F(Fileindexd, EndsWhileAWorkerWaitsForAnEngineThatHangs) {
  StartAll();
  Signal("kavoelasticd", SIGSTOP);
  Write("a", "alpha");
  Append({Line(EV_CLOSE_WRITE, In("a"))});
  ASSERT_TRUE(Await([this] { return fs::exists(snapshot_); }));
  sleep(1);  // Until it has asked the engine.
  EXPECT_TRUE(IsDone(R"({"type":"worker_delete","data":{"share_name":"docs"}})"));
  usleep(300'000);  // It is told to end.
  const auto begin = std::chrono::steady_clock::now();
  End("fileindexd", SIGTERM);
  EXPECT_LT(std::chrono::steady_clock::now() - begin, std::chrono::seconds(10));
  Signal("kavoelasticd", SIGCONT);
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
  const Json::Value errors = Indexing()["errors"];
  fs::rename(In("big"), In("large"));
  EXPECT_EQ(files({Line(EV_RENAME, In("large"), In("big"), true)}), 0);
  ExpectIndexed();
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
  WriteToken("../new/b.txt");
  StartAll();
  const auto change = [&](const std::vector<std::string>& lines) {
    EXPECT_TRUE(IsDone(
        R"({"type":"notify_setting_changed","data":{"share_name":"docs","is_upsert":true}})"));
    Cycle(lines);
  };
  SetFolders({"/docs/in"}, {"/docs/new"});
  change({});
  EXPECT_EQ(All(), (Paths{"in", "new", "new/b.txt"}));
  EXPECT_TRUE(ListIndex("docs", tokens_).tokens.empty());
  SetFolders({"/docs/in", "/docs/new"});
  change({Line(EV_REINDEX, docs_ / "new")});
  EXPECT_EQ(ListIndex("docs", tokens_).tokens.size(), 1U);
  SetFolders({"/docs/new"});
  change({});
  EXPECT_EQ(All(), (Paths{"new", "new/b.txt"}));
  // A worker that is deleted and made again.
  EXPECT_TRUE(IsDone(R"({"type":"worker_delete","data":{"share_name":"docs"}})"));
  EXPECT_TRUE(Await([this] { return Command(R"({"type":"stats"})")["shares"].empty(); }));
  fs::remove(docs_ / "new/b.txt");
  Append({Line(EV_DELETE, docs_ / "new/b.txt")});
  EXPECT_TRUE(IsDone(R"({"type":"worker_create","data":{"share_name":"docs"}})"));
  EXPECT_TRUE(AwaitAllDone());
  EXPECT_EQ(All(), Paths{"new"});
}

TEST_F(Fileindexd, TakesCareOfTheStatusBitsAndEndsAPause) {
  Write("a", "alpha");
  StartAll();
  Write("b", "untold");
  StatusMgr().SetShareStatus("docs", 1);
  Cycle({});
  ExpectIndexed();
  EXPECT_EQ(StatusMgr().GetShareStatus("docs"), 0U);
  // Marked again for what the comparison is past.
  Write("a.jpg", "waits for who reads it");
  Signal("kavocontentextractd", SIGSTOP);
  StatusMgr().SetShareStatus("docs", 1);
  Append({});
  ASSERT_TRUE(AwaitState("crawling"));
  usleep(300'000);  // It looks at the folder, and then waits for the file to be read.
  Write("z", "untold");
  StatusMgr().SetShareStatus("docs", 1);
  Signal("kavocontentextractd", SIGCONT);
  EXPECT_TRUE(Await([] { return StatusMgr().GetShareStatus("docs") == 0; }));
  ASSERT_TRUE(AwaitAllDone());
  ExpectIndexed();
  // Something of which a new index knows nothing.
  Json::Value ghost;
  ghost["id"] = "fileindex_docs";
  ghost["doc_id"] = ghost["data"]["KAVOMDPath"] = "/ghost";
  AskIndex("document_upsert_by_id", ghost);
  Cycle({Line(EV_CLOSE_WRITE, In("a"))});
  EXPECT_TRUE(All().contains("/ghost"));
  StatusMgr().SetShareStatus("docs", 2);
  Cycle({});
  ExpectIndexed();
  EXPECT_EQ(StatusMgr().GetShareStatus("docs"), 0U);
  // And an index that somebody took away is made when it is missed.
  vexlo::fileindex::elastic::ShareIndexDelete("docs");
  Cycle({Line(EV_CLOSE_WRITE, In("a"))});
  ExpectIndexed();
  // A pause ends by itself.
  Command(R"({"type":"pause","data":{"resume_time":)" + to_string(time(nullptr) + 2) + "}}");
  ASSERT_TRUE(AwaitState("paused"));
  fs::remove(In("b"));
  Cycle({Line(EV_DELETE, In("b"))});
  ExpectIndexed();
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
  ExpectIndexed();
}

TEST_F(Fileindexd, AnswersEveryCommandAtOnce) {
  StartAll();
  const std::pair<std::string, bool> cases[] = {
      {R"({"type":"resume","data":null})", true},
      {R"({"type":"dance","data":null})", false},
      {R"({"type":"pause","data":{"resume_time":"soon"}})", false},
      {R"({"type":"worker_create","data":{}})", false},
      {R"({"type":"worker_create","data":{"share_name":"no such share"}})", true},
      {"[]", false},
      {"", false}};
  for (const auto& [text, want] : cases) {
    EXPECT_EQ(IsDone(text), want) << text;
  }
  const RawClient client(vexlo::fileindex::kFileIndexDaemonSocketPath.Get(),
                         LengthBytes(UINT64_MAX) + "{");
  EXPECT_NE(client.Receive(100).find("the request is too long"), std::string::npos);
  ASSERT_TRUE(AwaitState("idle"));
  Program tool("exec 2>&1", FILEINDEX_PROGRAM " status --all");
  EXPECT_EQ(tool.End(), 0);
  // How wide the columns are depends on whether the share that there is not is listed yet.
  EXPECT_NE(tool.text.find("\ndocs "), std::string::npos) << tool.text;
  EXPECT_NE(tool.text.find("0 lines  0 changes, 1 file "), std::string::npos) << tool.text;
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
  const auto files = Indexing()["files"].asInt();
  EXPECT_LE(files, left);
  ExpectIndexed();
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
  ExpectIndexed();
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
  ExpectIndexed();
}

}  // namespace
