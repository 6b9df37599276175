// The index daemon beside the real engine: queue lines go in, and a search tells what came of them.
#include <fcntl.h>
#include <gtest/gtest.h>
#include <poll.h>
#include <sys/inotify.h>
#include <sys/stat.h>
#include <sys/time.h>

#include <algorithm>
#include <chrono>
#include <filesystem>
#include <functional>
#include <map>
#include <memory>
#include <random>
#include <set>

#include "common/error.h"
#include "common/file.h"
#include "common/json.h"
#include "fileindex/comm.h"
#include "fileindex/elastic_control/share_index.h"
#include "fileindex/folder_mgr.h"
#include "fileindex/index_mgr/monitor.h"
#include "fileindex/optree/event.h"
#include "fileindex/paths.h"
#include "fileindex/status_mgr.h"
#include "support/fake_engine.h"
#include "support/private_root.h"
#include "support/program.h"
#include "support/queue_file.h"
#include "support/random_tree.h"

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

const PrivateRoot kRoot;
constexpr int kPatienceMilliseconds = 30000;

// Waits for a name to come to a folder, or to go from it, since the object was made.
class Coming {
 public:
  Coming(const std::string& folder, uint32_t mask) : fd_(inotify_init1(IN_CLOEXEC)) {
    fs::create_directories(folder);
    EXPECT_GE(inotify_add_watch(fd_, folder.c_str(), mask), 0) << folder;
  }
  ~Coming() { close(fd_); }
  Coming(const Coming&) = delete;
  Coming& operator=(const Coming&) = delete;

  // Several that came before the call may count as one.
  bool Await(const std::string& name) const {
    struct pollfd poll_fd = {fd_, POLLIN, 0};
    alignas(inotify_event) char buffer[4096];
    while (!names_.contains(name) && poll(&poll_fd, 1, kPatienceMilliseconds) == 1) {
      const ssize_t length = read(fd_, buffer, sizeof(buffer));
      for (ssize_t at = 0; at < length;) {
        const auto* const event = reinterpret_cast<const inotify_event*>(buffer + at);
        names_.insert(event->len > 0 ? static_cast<const char*>(event->name) : "");
        at += static_cast<ssize_t>(sizeof(inotify_event)) + event->len;
      }
    }
    return !names_.extract(name).empty();
  }

 private:
  int fd_;
  mutable std::multiset<std::string> names_;
};

class Fileindexd : public testing::Test {
 protected:
  Fileindexd() {
    for (const char* const each : {"var", "vol", "tmp", "fileindexd.log"}) {
      fs::remove_all(kRoot / each);
    }
    for (const char* const folder : {"var/run", "var/packages/Vexlo/etc", "vol/docs", "tmp"}) {
      kRoot.MakeFolder(folder);
    }
    SetShare("");
    fs::create_directory(docs_ / "in");
    SetFolders(FolderText("/docs/in"));
    Start(extractor_, KAVOCONTENTEXTRACTD_PROGRAM, "kavocontentextractd");
  }
  // As a command leaves them: listed, and registered.
  static void SetFolders(const std::string& folders) {
    WriteText(kRoot / "var/packages/Vexlo/etc/fileindex.folders", "[" + folders + "]");
    vexlo::fileindex::FolderMgr registered;
    vexlo::fileindex::UpsertEVNotifydCfg("docs", registered);
  }
  ~Fileindexd() override {
    End(extractor_, SIGKILL);
    EndIndexer(SIGKILL);
    EndEngine(SIGKILL);
  }
  Fileindexd(const Fileindexd&) = delete;
  Fileindexd& operator=(const Fileindexd&) = delete;

  static std::string FolderText(const std::string& path, bool document = true) {
    return R"({"path":")" + path + R"(","name":"x","document":)" + (document ? "true" : "false") +
           R"(,"audio":true,"video":true,"photo":true})";
  }
  void SetShare(const std::string& more) const {
    kRoot.SetShares(R"({"name":"docs","path":")" + docs_.string() + "\"" + more + "}");
  }

  void StartEngine() { Start(engine_, KAVOELASTICD_PROGRAM, "kavoelasticd"); }
  void StartIndexer() { Start(indexer_, FILEINDEXD_PROGRAM " --cycle 100", "fileindexd"); }
  int EndEngine(int signal) { return End(engine_, signal); }
  void SignalEngine(int signal) { kill(engine_->pid, signal); }
  int EndIndexer(int signal) { return End(indexer_, signal); }

  // Both, and the first crawl done.
  void StartAll() {
    StartEngine();
    StartIndexer();
    Cycle({});
  }

  // Appends lines and waits until their work is committed and the snapshot is gone.
  void Cycle(const std::vector<std::string>& lines) {
    const Coming gone(queue_.parent_path(), IN_DELETE);
    Append(lines);
    AwaitAllDone(gone);
  }
  // `gone` watches the queue's folder.
  void AwaitAllDone(const Coming& gone) const {
    do {
      ASSERT_TRUE(gone.Await(SnapshotName())) << ReadText(kRoot / "fileindexd.log");
    } while (fs::exists(queue_) || fs::exists(queue_.string() + ".tmp"));
  }
  void Append(const std::vector<std::string>& lines) const {
    fs::create_directories(queue_.parent_path());
    // A line of an event that means nothing, so that there is one.
    vexlo::AppendLines(queue_, Join(lines) + Line(0, In("no such")) + "\n");
  }

  std::string SnapshotName() const { return queue_.filename().string() + ".tmp"; }
  std::string In(const std::string& name) const { return docs_ / "in" / name; }
  void Write(const std::string& name, const std::string& text) const {
    fs::create_directories(fs::path(In(name)).parent_path());
    WriteText(In(name), text);
  }

  // The paths that a committed search finds, less the folder's, and "." for the folder itself.
  std::set<std::string> Search(const std::string& query) const {
    Json::Value request;
    EXPECT_TRUE(vexlo::JsonFromString(request["data"], query)) << query;
    request["command"] = "search";
    request["data"]["ids"].append("fileindex_docs");
    request["data"]["size"] = 10000;
    Json::Value reply;
    vexlo::SendRequestImpl(reply, request);
    std::set<std::string> paths;
    const std::string folder = docs_ / "in";
    for (const Json::Value& hit : reply["data"]) {
      const std::string path = hit["path"].asString();
      paths.insert(path == folder                   ? "."
                   : path.starts_with(folder + "/") ? path.substr(folder.size() + 1)
                                                    : path);
    }
    EXPECT_EQ(paths.size(), reply["data"].size()) << "some path twice";
    return paths;
  }
  std::set<std::string> All() const { return Search("{}"); }
  std::set<std::string> Words(const std::string& words) const {
    return Search(R"({"words":")" + words + "\"}");
  }

  static Json::Value Command(const std::string& text) {
    Json::Value answer;
    const std::string reply = Ask(SocketPath(), text + '\0');
    EXPECT_TRUE(vexlo::JsonFromString(answer, reply)) << reply;
    return answer;
  }
  static std::string SocketPath() { return vexlo::fileindex::kFileIndexDaemonSocketPath.Get(); }
  static Json::Value Stats() { return Command(R"({"type":"stats","data":null})")["shares"][0]; }
  // Asks until it is so.
  static bool AwaitState(const std::string& state) {
    const auto until =
        std::chrono::steady_clock::now() + std::chrono::milliseconds(kPatienceMilliseconds);
    while (Stats()["state"] != state) {
      if (std::chrono::steady_clock::now() > until) {
        return false;
      }
    }
    return true;
  }

  const fs::path docs_ = kRoot / "vol/docs";
  fs::path queue_ = [this] {
    std::string name = docs_;
    for (size_t at = 0; (at = name.find('/', at)) != std::string::npos; at += 3) {
      name.replace(at, 1, "%2F");
    }
    return fs::path(kRoot / "var/lib/kavo/fileindex/queue") / name;
  }();

 private:
  static void Start(std::unique_ptr<Program>& program, const std::string& command,
                    const std::string& name) {
    // The log goes to a file, as a pipe that nobody reads would hold the daemon up.
    const Coming ready(kRoot / "var/run", IN_MOVED_TO);
    const std::string log = kRoot / (name + ".log");
    program = std::make_unique<Program>("exec 2>>" + log, command);
    ASSERT_TRUE(ready.Await(name + ".sock")) << ReadText(log);
  }
  static int End(std::unique_ptr<Program>& program, int signal) {
    const std::unique_ptr<Program> ended = std::move(program);
    return ended == nullptr ? 0 : ended->End(signal);
  }

  std::unique_ptr<Program> extractor_;
  std::unique_ptr<Program> engine_;
  std::unique_ptr<Program> indexer_;
};

// Writes a text of the same length with the same modification date.
void ReplaceWithDates(const std::string& path, const std::string& text) {
  struct stat info {};
  ASSERT_EQ(stat(path.c_str(), &info), 0);
  WriteText(path, text);
  const struct timespec times[] = {info.st_atim, info.st_mtim};
  ASSERT_EQ(utimensat(AT_FDCWD, path.c_str(), times, 0), 0);
}

using Paths = std::set<std::string>;

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
      {"Upsert",
       [&] { Write("new.txt", "harbour"); },
       {Line(EV_CREATE, In("new.txt")), Line(EV_CLOSE_WRITE, In("new.txt"))},
       {".", "old", "old/a.txt", "old/b.txt", "hard", "new.txt"},
       "harbour",
       {"new.txt"}},
      {"Modified",
       [&] { Write("new.txt", "museum"); },
       {Line(EV_CLOSE_WRITE, In("new.txt"))},
       {".", "old", "old/a.txt", "old/b.txt", "hard", "new.txt"},
       "harbour",
       {}},
      {"UpsertOfWhatIsGoneOrNotWanted",
       [&] { fs::remove(In("old/a.txt")); },
       {Line(EV_CLOSE_WRITE, In("old/a.txt")), Line(EV_CLOSE_WRITE, In("link")),
        Line(EV_CLOSE_WRITE, In("old/@eaDir/x")), Line(EV_CLOSE_WRITE, docs_ / "out/x")},
       {".", "old", "old/b.txt", "hard", "new.txt"},
       "outside",
       {}},
      {"Attributes",
       [&] { fs::permissions(In("new.txt"), fs::perms(0604)); },
       {Line(EV_ATTRIB, In("new.txt"))},
       {".", "old", "old/b.txt", "hard", "new.txt"},
       "museum",
       {"new.txt"}},
      {"AttributesOfWhatWasNeverIndexed",
       [&] { Write("late", "latecomer"); },
       {Line(EV_ATTRIB, In("late"))},
       {".", "old", "old/b.txt", "hard", "new.txt", "late"},
       "latecomer",
       {"late"}},
      {"AttributesThatHideALostChange",
       [&] { Write("late", "changed"); },
       {Line(EV_ATTRIB, In("late"))},
       {".", "old", "old/b.txt", "hard", "new.txt", "late"},
       "changed",
       {"late"}},
      {"RenameFolder",
       [&] { fs::rename(In("old"), In("moved")); },
       {Line(EV_RENAME, In("moved"), In("old"), true)},
       {".", "moved", "moved/b.txt", "hard", "new.txt", "late"},
       "second",
       {"moved/b.txt", "hard"}},
      {"SaveByRename",
       [&] {
         Write(".new.txt", "saved");
         fs::rename(In(".new.txt"), In("new.txt"));
       },
       {Line(EV_CREATE, In(".new.txt")), Line(EV_CLOSE_WRITE, In(".new.txt")),
        Line(EV_RENAME, In("new.txt"), In(".new.txt"))},
       {".", "moved", "moved/b.txt", "hard", "new.txt", "late"},
       "saved",
       {"new.txt"}},
      {"RenameAndTheOldNameUsedAnew",
       [&] {
         fs::rename(In("late"), In("later"));
         Write("late", "newcomer");
       },
       {Line(EV_RENAME, In("later"), In("late")), Line(EV_CLOSE_WRITE, In("late"))},
       {".", "moved", "moved/b.txt", "hard", "new.txt", "late", "later"},
       "changed",
       {"later"}},
      {"RenameOutOfTheFolders",
       [&] { fs::rename(In("later"), docs_ / "out/later"); },
       {Line(EV_RENAME, docs_ / "out/later", In("later"))},
       {".", "moved", "moved/b.txt", "hard", "new.txt", "late"},
       "changed",
       {}},
      {"RenameIntoTheFolders",
       [&] { fs::rename(docs_ / "out", In("out")); },
       {Line(EV_RENAME, In("out"), docs_ / "out", true)},
       {".", "moved", "moved/b.txt", "hard", "new.txt", "late", "out", "out/x", "out/later"},
       "outside",
       {"out/x"}},
      {"RenamedTwice",
       [&] {
         fs::rename(In("out"), In("out2"));
         fs::rename(In("out2"), In("out3"));
       },
       {Line(EV_RENAME, In("out2"), In("out"), true),
        Line(EV_RENAME, In("out3"), In("out2"), true)},
       {".", "moved", "moved/b.txt", "hard", "new.txt", "late", "out3", "out3/x", "out3/later"},
       "outside",
       {"out3/x"}},
      {"DeleteFolder",
       [&] { fs::remove_all(In("out3")); },
       {Line(EV_DELETE, In("out3"), "", true)},
       {".", "moved", "moved/b.txt", "hard", "new.txt", "late"},
       "outside",
       {}},
      {"FolderInTheFilesPlace",
       [&] {
         fs::remove(In("late"));
         Write("late/inside.txt", "deep");
       },
       {Line(EV_DELETE, In("late")), Line(EV_CREATE, In("late"), "", true)},
       {".", "moved", "moved/b.txt", "hard", "new.txt", "late", "late/inside.txt"},
       "deep",
       {"late/inside.txt"}},
      {"FileInTheFoldersPlace",
       [&] {
         fs::remove_all(In("late"));
         Write("late", "flat");
       },
       {Line(EV_DELETE, In("late"), "", true), Line(EV_CREATE, In("late")),
        Line(EV_CLOSE_WRITE, In("late"))},
       {".", "moved", "moved/b.txt", "hard", "new.txt", "late"},
       "deep",
       {}},
      {"ReindexFindsWhatNobodyTold",
       [&] {
         ReplaceWithDates(In("new.txt"), "other");
         Write("moved/sub/c.txt", "third");
         fs::rename(In("late"), In("moved/late"));
         fs::remove(In("hard"));
       },
       {Line(EV_REINDEX, docs_ / "in")},
       {".", "moved", "moved/b.txt", "moved/sub", "moved/sub/c.txt", "moved/late", "new.txt"},
       "other",
       {"new.txt"}},
      {"CrashedQueue",
       [&] {
         fs::remove_all(In("moved/sub"));
         Write("after", "the crash");
       },
       {Line(EV_QUEUE_CRASHED, docs_)},
       {".", "moved", "moved/b.txt", "moved/late", "new.txt", "after"},
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
       {".", "moved", "moved/b.txt", "moved/late", "new.txt", "after", "sane"},
       "sane",
       {"sane"}},
      // By the time of the upsert the file has another path, of which the queue tells later.
      {"WriteInAFolderThatIsRenamedMeanwhile",
       [&] {
         Write("moved/missed.txt", "elusive");
         fs::rename(In("moved"), In("away"));
       },
       {Line(EV_CREATE, In("moved/missed.txt")), Line(EV_CLOSE_WRITE, In("moved/missed.txt"))},
       {".", "moved", "moved/b.txt", "moved/late", "new.txt", "after", "sane"},
       "elusive",
       {}},
      {"RenameOfAFolderThatWasMissedIn",
       [&] {},
       {Line(EV_RENAME, In("away"), In("moved"), true)},
       {".", "away", "away/b.txt", "away/late", "away/missed.txt", "new.txt", "after", "sane"},
       "elusive",
       {"away/missed.txt"}},
      // The fold makes the folder's deletion part of its making, which is before the rename.
      {"RenamedIntoAFolderThatIsGone",
       [&] { fs::remove_all(In("away")); },
       {Line(EV_CREATE, In("brief"), "", true), Line(EV_RENAME, In("brief/away"), In("away"), true),
        Line(EV_DELETE, In("brief/away/b.txt")), Line(EV_DELETE, In("brief/away"), "", true),
        Line(EV_DELETE, In("brief"), "", true)},
       {".", "new.txt", "after", "sane"},
       "elusive",
       {}},
      {"FoldersToBeRenamed",
       [&] {
         Write("a/x", "ghostly"), Write("a/y", "ghostly");
         Write("b/x", "ghostly"), Write("b/y", "ghostly");
       },
       {Line(EV_CREATE, In("a"), "", true), Line(EV_CREATE, In("b"), "", true)},
       {".", "new.txt", "after", "sane", "a", "a/x", "a/y", "b", "b/x", "b/y"},
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
       {".", "new.txt", "after", "sane", "a", "a1", "a1/y", "b", "b/x", "b/y"},
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
       {".", "new.txt", "after", "a1", "a1/y", "b", "b/x", "b1", "b1/y"},
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
  EXPECT_EQ(EndIndexer(SIGTERM), 0);
}

TEST_F(Fileindexd, IndexesNoMoreThanNeeded) {
  StartAll();
  const auto files = [this](const std::vector<std::string>& lines) {
    const auto before = Stats()["files"].asInt();
    Cycle(lines);
    return Stats()["files"].asInt() - before;
  };
  for (int i = 0; i < 3000; ++i) {
    Write("big/" + to_string(i % 30) + "/" + to_string(i), "text");
  }
  Write("song.mp3", "x");
  Write("note.txt", "x");
  usleep(100'000);  // What has changed within a tick of the clock is read again.
  EXPECT_EQ(files({Line(EV_REINDEX, docs_ / "in")}), 3034);
  EXPECT_EQ(files({Line(EV_REINDEX, docs_ / "in")}), 0);
  fs::rename(In("big"), In("large"));
  EXPECT_EQ(files({Line(EV_RENAME, In("large"), In("big"), true)}), 0);
  EXPECT_EQ(Search(R"({"below":")" + In("large") + "\"}").size(), 3030U);
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
  EXPECT_EQ(update(R"({"document":true})"), 3001);
  EXPECT_EQ(update(R"({"basic":true})"), 3034);
}

// Of more documents than are listed at a time, with names that stand before and behind "/".
TEST_F(Fileindexd, MovesAFolderOfManyPages) {
  constexpr int kFiles = 4500;
  const std::string folders[] = {"old/", "old/a/", "old/a!/", "old/a.b/c/"};
  for (int i = 0; i < kFiles; ++i) {
    Write(folders[i % 4] + std::to_string(i), "");
  }
  Write("old.txt", "beside");
  StartAll();
  Paths want = All();
  ASSERT_EQ(want.size(), kFiles + 7);
  const Json::Value before = Stats();
  fs::rename(In("old"), In("new"));
  Cycle({Line(EV_RENAME, In("new"), In("old"), true)});
  for (const std::string& path : All()) {
    EXPECT_TRUE(path == "old.txt" || !path.starts_with("old")) << path;
    want.erase(path.starts_with("new") ? "old" + path.substr(3) : path);
  }
  EXPECT_EQ(want, Paths());
  EXPECT_EQ(Stats()["files"], before["files"]) << "documents were made anew";
  EXPECT_EQ(Stats()["errors"], before["errors"]);
  EXPECT_EQ(EndIndexer(SIGTERM), 0);
}

TEST_F(Fileindexd, FollowsTheSettings) {
  Write("a.txt", "alpha");
  fs::create_directories(docs_ / "new");
  WriteText(docs_ / "new/b.txt", "beta");
  StartAll();
  const auto change = [&](const std::string& text) {
    SetFolders(text);
    EXPECT_TRUE(Command(R"({"type":"notify_setting_changed",
                            "data":{"share_name":"docs","is_upsert":true}})")["success"]
                    .asBool());
    Cycle({});
  };
  change(FolderText("/docs/in") + "," + FolderText("/docs/new", /*document=*/false));
  const std::string b = docs_ / "new/b.txt";
  EXPECT_EQ(All(), (Paths{".", "a.txt", docs_ / "new", b}));
  EXPECT_EQ(Words("beta"), Paths());
  change(FolderText("/docs/in") + "," + FolderText("/docs/new"));
  Cycle({Line(EV_REINDEX, docs_ / "new")});
  EXPECT_EQ(Words("beta"), Paths{b});
  change(FolderText("/docs/new"));
  EXPECT_EQ(All(), (Paths{docs_ / "new", b}));
  // A worker that is deleted and made again.
  EXPECT_TRUE(
      Command(R"({"type":"worker_delete","data":{"share_name":"docs"}})")["success"].asBool());
  while (!Command(R"({"type":"stats"})")["shares"].empty()) {
  }
  fs::remove(b);
  Append({Line(EV_DELETE, b)});
  const Coming gone(queue_.parent_path(), IN_DELETE);
  EXPECT_TRUE(
      Command(R"({"type":"worker_create","data":{"share_name":"docs"}})")["success"].asBool());
  EXPECT_TRUE(gone.Await(SnapshotName()));
  EXPECT_EQ(All(), Paths{docs_ / "new"});
}

TEST_F(Fileindexd, RestsWhilePausedAndWhileTheShareIsAway) {
  Write("a", "alpha");
  StartAll();
  StatusMgr().Pause(0);
  ASSERT_TRUE(AwaitState("paused"));
  Write("b", "beta");
  Append({Line(EV_CLOSE_WRITE, In("b"))});
  EXPECT_EQ(EndIndexer(SIGTERM), 0);
  StartIndexer();
  ASSERT_TRUE(AwaitState("paused"));  // The status file says so.
  EXPECT_TRUE(fs::exists(queue_));
  EXPECT_EQ(All(), (Paths{".", "a"}));
  const Coming gone(queue_.parent_path(), IN_DELETE);
  StatusMgr().Resume();
  EXPECT_TRUE(gone.Await(SnapshotName()));
  EXPECT_EQ(All(), (Paths{".", "a", "b"}));
  // A pause ends by itself.
  const auto in_two_seconds = to_string(time(nullptr) + 2);
  Command(R"({"type":"pause","data":{"resume_time":)" + in_two_seconds + "}}");
  ASSERT_TRUE(AwaitState("paused"));
  fs::remove(In("b"));
  Cycle({Line(EV_DELETE, In("b"))});
  EXPECT_EQ(All(), (Paths{".", "a"}));

  SetShare(R"(,"read_only":true)");
  Append({Line(EV_DELETE, In("a")), Line(EV_QUEUE_CRASHED, docs_)});
  ASSERT_TRUE(AwaitState("unavailable"));
  EXPECT_EQ(All(), (Paths{".", "a"}));
  SetShare("");
  const Coming back(queue_.parent_path(), IN_DELETE);
  Command(R"({"type":"worker_create","data":{"share_name":"docs"}})");
  EXPECT_TRUE(back.Await(SnapshotName()));
  EXPECT_EQ(All(), (Paths{".", "a"}));
  // The folder is gone with its volume: that is no reason to forget what was in it.
  fs::rename(docs_, kRoot / "away");
  Append({Line(EV_QUEUE_CRASHED, docs_)});
  ASSERT_TRUE(AwaitState("unavailable"));
  EXPECT_EQ(All(), (Paths{".", "a"}));
}

TEST_F(Fileindexd, TakesWhatWaitsBehindASnapshotThatWasLeft) {
  StartAll();
  EndIndexer(SIGKILL);
  Write("a", "alpha");
  Write("b", "beta");
  vexlo::AppendLines(queue_.string() + ".tmp", Line(EV_CLOSE_WRITE, In("a")) + "\n");
  Append({Line(EV_CLOSE_WRITE, In("b"))});
  StartIndexer();
  const auto until =
      std::chrono::steady_clock::now() + std::chrono::milliseconds(kPatienceMilliseconds);
  while (!All().contains("b") && std::chrono::steady_clock::now() < until) {
  }
  EXPECT_EQ(All(), (Paths{".", "a", "b"}));
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
  Json::Value request;
  ASSERT_TRUE(vexlo::JsonFromString(request, R"({"command":"document_upsert_by_id","data":{
      "id":"fileindex_docs","doc_id":"/ghost","data":{"KAVOMDPath":"/ghost"}}})"));
  Json::Value reply;
  vexlo::SendRequestImpl(reply, request);
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
}

TEST_F(Fileindexd, WaitsForTheEngineAndForSpace) {
  Write("a", "alpha");
  WriteText(kRoot.MakeFolder("usr/kavo/bin") + "/kavoqpxnotify",
            "#!/bin/sh\necho told >> " + (kRoot / "tmp/told") + "\n");
  chmod((kRoot / "usr/kavo/bin/kavoqpxnotify").c_str(), 0755);
  {
    FakeEngine full(kRoot / "var/run/kavoelasticd.sock");
    const std::string refusal = R"({"success":false,"error":{"code":2010,"msg":"full"}})";
    full.Script(std::deque<std::string>(100, refusal));
    StartIndexer();
    for (int i = 0; i < 2; ++i) {
      while (Stats()["errors"]["2010"].asInt() <= i) {
      }
      ASSERT_TRUE(AwaitState("failing"));
      Command(R"({"type":"worker_create","data":{"share_name":"docs"}})");
    }
    EXPECT_EQ(ReadText(kRoot / "tmp/told"), "told\n");
  }
  StartEngine();
  Command(R"({"type":"worker_create","data":{"share_name":"docs"}})");
  Cycle({});
  EXPECT_EQ(All(), (Paths{".", "a"}));
  EndEngine(SIGKILL);
  Write("b", "beta");
  const Coming gone(queue_.parent_path(), IN_DELETE);
  Append({Line(EV_CLOSE_WRITE, In("b"))});
  ASSERT_TRUE(AwaitState("failing"));
  EXPECT_TRUE(fs::exists(queue_.string() + ".tmp"));
  StartEngine();
  EXPECT_TRUE(gone.Await(SnapshotName()));
  EXPECT_EQ(All(), (Paths{".", "a", "b"}));
}

TEST_F(Fileindexd, AnswersEveryCommandAtOnce) {
  StartAll();
  const std::pair<std::string, bool> cases[] = {
      {R"({"type":"resume","data":null})", true},
      {R"({"type":"stats"})", true},
      {R"({"type":"dance","data":null})", false},
      {R"({"type":"pause","data":null})", false},
      {R"({"type":"pause","data":{"resume_time":"soon"}})", false},
      {R"({"type":"worker_create","data":{}})", false},
      {R"({"type":"worker_create","data":{"share_name":"no such share"}})", true},
      {R"({"data":null})", false},
      {R"({"type":7,"data":null})", false},
      {"[]", false},
      {"", false},
      {std::string("\0\0", 2), false}};
  for (const auto& [text, want] : cases) {
    EXPECT_EQ(Command(text)["success"].asBool(), want) << text;
  }
  for (const uint64_t length : {uint64_t{1} << 62, UINT64_MAX, uint64_t{100} << 20}) {
    const RawClient client(SocketPath(), LengthBytes(length) + "{");
    EXPECT_NE(client.Receive(100).find("the request is too long"), std::string::npos) << length;
  }
  ASSERT_TRUE(AwaitState("idle"));
  Program tool("exec 2>&1", FILEINDEX_PROGRAM " status --all");
  EXPECT_EQ(tool.End(), 0);
  // How wide the columns are depends on whether the share that there is not is listed yet.
  EXPECT_NE(tool.text.find("\ndocs "), std::string::npos) << tool.text;
  EXPECT_NE(tool.text.find("0 lines  0 changes, 1 file "), std::string::npos) << tool.text;
  // It is the next one's, whoever left it.
  EndIndexer(SIGKILL);
  EXPECT_TRUE(fs::exists(SocketPath()));
  StartIndexer();
  EXPECT_TRUE(Command(R"({"type":"stats"})")["success"].asBool());
}

// By digests, with changes of which nobody was told: of the disk, and of the index by others.
TEST_F(Fileindexd, AComparisonFindsWhatOneEntryByEntryDoes) {
  SetFolders(FolderText("/docs/in") + "," + FolderText("/docs/in/a", /*document=*/false));
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
    const auto files = Stats()["files"].asInt();
    Cycle({Line(EV_UPDATE_DIRECTORY, docs_ / "in", "", true, R"({"basic":false})")});
    EXPECT_EQ(Stats()["files"].asInt(), files) << tree.Text();
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
  StartEngine();
  const std::string states = kRoot / "var/lib/kavo/fileindexd";
  const auto after = [&states] {
    Json::Value state;
    return vexlo::JsonFromFile(state, states + "/docs.json") ? state["crawl"]["after"].asString()
                                                             : "";
  };
  {
    const Coming saved(states, IN_MOVED_TO);
    StartIndexer();
    ASSERT_TRUE(AwaitState("crawling"));
    while (Stats()["files"].asInt() == 0) {
      usleep(1000);  // The engine is asked for what it has, first.
    }
    SignalEngine(SIGSTOP);
    sleep(2);  // As long as a crawl goes on without saving where it stands.
    SignalEngine(SIGCONT);
    while (after().empty()) {
      ASSERT_TRUE(saved.Await("docs.json"));
    }
    EndIndexer(SIGKILL);
  }
  const std::string reached = after();
  ASSERT_FALSE(reached.empty());
  StartIndexer();
  ASSERT_TRUE(AwaitState("crawling"));
  const auto before = std::chrono::steady_clock::now();
  EXPECT_EQ(EndIndexer(SIGTERM), 0);
  EXPECT_LT(std::chrono::steady_clock::now() - before, std::chrono::seconds(2));
  StartIndexer();
  Cycle({});
  const auto left = std::count_if(all.begin(), all.end(),
                                  [&](const std::string& path) { return path > reached; });
  EXPECT_LT(left, static_cast<ptrdiff_t>(all.size()));
  EXPECT_LE(Stats()["progress"]["found"].asInt(), left);
  EXPECT_EQ(Search(R"({"below":")" + In("tree/7") + "\"}").size(), kFiles / 100U);
  EXPECT_EQ(Search(R"({"below":")" + In("tree") + "\"}").size(), 10000U);  // As many as are asked.
  // Nothing of it was missed.
  const auto files = Stats()["files"].asInt();
  Cycle({Line(EV_REINDEX, docs_ / "in")});
  EXPECT_EQ(Stats()["files"].asInt(), files);
}

TEST_F(Fileindexd, StopsInTimeWhenTheEngineDoesNotAnswer) {
  StartAll();
  SignalEngine(SIGSTOP);
  Write("a", "alpha");
  const Coming snapshot(queue_.parent_path(), IN_MOVED_TO);
  Append({Line(EV_CLOSE_WRITE, In("a"))});
  ASSERT_TRUE(snapshot.Await(SnapshotName()));
  const auto before = std::chrono::steady_clock::now();
  EXPECT_EQ(EndIndexer(SIGTERM), 0);
  EXPECT_LT(std::chrono::steady_clock::now() - before, std::chrono::seconds(2));
  EXPECT_TRUE(fs::exists(queue_.string() + ".tmp"));
  SignalEngine(SIGCONT);
  // What was queued behind the snapshot is taken without another line.
  Write("b", "beta");
  const Coming gone(queue_.parent_path(), IN_DELETE);
  Append({Line(EV_CLOSE_WRITE, In("b"))});
  StartIndexer();
  AwaitAllDone(gone);
  EXPECT_EQ(All(), (Paths{".", "a", "b"}));
}

TEST_F(Fileindexd, WaitsForAListOfFoldersThatCanBeRead) {
  const std::string folders = kRoot / "var/packages/Vexlo/etc/fileindex.folders";
  const std::string text = ReadText(folders);
  WriteText(folders, "{");
  StartEngine();
  StartIndexer();
  Append({});
  while (ReadText(kRoot / "fileindexd.log").find("the folders are not known") ==
         std::string::npos) {
  }
  const Coming gone(queue_.parent_path(), IN_DELETE);
  WriteText(folders, text);
  EXPECT_TRUE(gone.Await(SnapshotName()));
  EXPECT_EQ(All(), Paths{"."});
}

// What a watcher would report of a random change, and its like in memory.
class RandomDisk {
 public:
  RandomDisk(std::string root, unsigned seed) : root_(std::move(root)), random_(seed) {}

  std::string Change() {
    const std::string path = root_ + "/" + Name() + "/" + Name();
    const std::string other = root_ + "/" + Name() + "/" + Name();
    fs::create_directories(fs::path(path).parent_path());
    fs::create_directories(fs::path(other).parent_path());
    switch (random_() % 5) {
      case 0:
        if (fs::remove(path)) {
          return Line(EV_DELETE, path);
        }
        [[fallthrough]];
      case 1:
      case 2: {
        const bool is_new = !fs::exists(path);
        WriteText(path, "word" + to_string(++count_));
        return (is_new ? Line(EV_CREATE, path) + "\n" : "") + Line(EV_CLOSE_WRITE, path);
      }
      case 3:
        if (fs::exists(path) && path != other) {
          fs::rename(path, other);
          return Line(EV_RENAME, other, path);
        }
        return Line(EV_REINDEX, fs::path(other).parent_path());
      default: {
        const std::string from = fs::path(path).parent_path();
        const std::string to = fs::path(other).parent_path();
        if (from == to) {
          return Line(EV_REINDEX, from);
        }
        fs::remove_all(to);
        fs::rename(from, to);
        return Line(EV_DELETE, to, "", true) + "\n" + Line(EV_RENAME, to, from, true);
      }
    }
  }

 private:
  std::string Name() { return std::string(1, static_cast<char>('a' + random_() % 5)); }

  const std::string root_;
  std::mt19937 random_;
  int count_ = 0;
};

TEST_F(Fileindexd, NothingIsLostToKillsAtAnyMoment) {
  StartAll();
  for (unsigned seed = 1; seed <= 25; ++seed) {
    SCOPED_TRACE(seed);
    RandomDisk disk(docs_ / "in", seed);
    std::mt19937 random(seed);
    for (int round = 0; round < 4; ++round) {
      std::vector<std::string> lines;
      lines.reserve(40);
      for (int i = 0; i < 40; ++i) {
        lines.push_back(disk.Change());
      }
      Append(lines);
      // At any moment of the cycle that begins 100 ms from now.
      usleep(random() % 200000);
      if (random() % 8 == 0) {
        EndEngine(SIGKILL);
        StartEngine();
      } else {
        EndIndexer(SIGKILL);
        StartIndexer();
      }
    }
    Cycle({});
    std::map<std::string, std::string> want;
    std::map<std::string, std::string> got;
    for (const auto& entry : fs::recursive_directory_iterator(docs_ / "in")) {
      if (entry.is_regular_file()) {
        want[entry.path()] = ReadText(entry.path());
      }
    }
    Json::Value request;
    request["command"] = "document_get_by_query";
    request["data"]["id"] = "fileindex_docs";
    request["data"]["query"]["qsl"]["prefix"]["KAVOMDPath"] = In("");
    request["data"]["query"]["size"] = 10000;
    Json::Value reply;
    vexlo::SendRequestImpl(reply, request);
    for (const Json::Value& hit : reply["data"]) {
      if (!hit["KAVOMDIsDir"].asBool()) {
        got[hit["KAVOMDPath"].asString()] = hit["KAVOMDTextContent"].asString();
      }
    }
    ASSERT_EQ(got, want);
  }
}

}  // namespace
