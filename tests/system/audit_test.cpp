// The tool's commands that look for trouble, beside the real engine and the real index daemon.
#include <fcntl.h>
#include <gtest/gtest.h>
#include <sys/stat.h>
#include <unistd.h>

#include <algorithm>
#include <filesystem>
#include <functional>
#include <memory>
#include <vector>

#include "fileindex/elastic_control/share_index.h"
#include "fileindex/paths.h"
#include "fileindex/status_mgr.h"
#include "support/fake_engine.h"
#include "support/index_listing.h"
#include "support/stack.h"

namespace {

namespace fs = std::filesystem;
using vexlo::fileindex::StatusMgr;
using vexlo::fileindex::elastic::ShareIndexPause;
using vexlo::fileindex::elastic::ShareIndexResume;

const PrivateRoot kRoot;

class AuditTest : public testing::Test, protected Daemons {
 protected:
  AuditTest() : Daemons(kRoot, {{"fileindexd", "--cycle 20"}}) {
    SetFolders({"/docs/in"});
    Start("kavoelasticd");
  }

  // With the index filled.
  void StartIndexer() {
    Start("fileindexd");
    ASSERT_TRUE(Await([this] { return Run("audit --grace 0").status == 0; }))
        << Run("audit --grace 0").out;
    // A pause that is said while the end of the first cycle is noted would be lost.
    ASSERT_TRUE(Await([this] { return Indexing()["state"] == "idle"; })) << Logs();
  }

  struct Result {
    int status;
    std::string out;
    std::string err;
  };
  // What the tool prints, without the way to the indexed folder.
  Result Run(const std::string& arguments, const std::string& wrapper = "") const {
    const std::string err = kRoot / "err";
    Program program("exec 2>" + err, wrapper + FILEINDEX_PROGRAM " " + arguments);
    const int status = program.End();
    return {status, Short(program.text), Short(ReadText(err))};
  }

  // A document that says nothing but its path, and its date.
  static void Put(const std::string& path, Json::Int64 date = 0) {
    Json::Value data;
    data["id"] = "fileindex_docs";
    data["doc_id"] = data["data"]["KAVOMDPath"] = path;
    data["data"]["KAVOMDFSContentChangeDate"] = date;
    AskIndex("document_upsert_by_id", data);
    AskIndex("commit", data);
  }

  const std::string docs_ = Share();

 private:
  std::string Short(std::string text) const {
    for (size_t at = 0; (at = text.find(In(""))) != std::string::npos;) {
      text.erase(at, In("").size());
    }
    return text;
  }
};

// What a script sees of root without the right to read everything.
std::string WithoutRights() {
  return geteuid() == 0 ? "setpriv --bounding-set=-dac_override,-dac_read_search " : "";
}

TEST_F(AuditTest, FindsWhatDiffersAndPutsItRight) {
  Write("a.txt");
  Write("old/1");
  Write("old/2");
  Write("dates");
  Write("in/in/deep");
  StartIndexer();
  const struct {
    const char* name;
    std::function<void()> change;
    std::string differences;
    std::string queued;  // What standard error says of the repair.
  } steps[] = {
      {"NotWanted",
       [&] {
         Write(".git/config");
         Write("@eaDir/x");
         Write("Thumbs.db");
         fs::create_symlink("old", In("link"));
         WriteText(docs_ + "/outside", "x");
       },
       "", ""},
      {"FolderGetsNewDates",
       [&] {
         Write("old/3");
         fs::remove(In("old/3"));
       },
       "", ""},
      {"MissingInTheOrderOfBytes",
       [&] {
         Write("m/x");
         Write("m!");
         Write("m.txt");
         Write("m0");
         Write("n\n\x01");
         Write("\xE9\xFF");
       },
       "missing m\nmissing m!\nmissing m.txt\nmissing m/x\nmissing m0\nmissing n\\012\\001\n"
       "missing \xE9\xFF\n",
       "queued: 7 lines for 1 share"},
      {"Ghosts", [&] { fs::remove_all(In("old")); }, "ghost old\nghost old/1\nghost old/2\n",
       "queued: 1 line for"},
      {"GhostOfAFolderThatIsAFileNow",
       [&] {
         fs::remove_all(In("m"));
         Write("m");
       },
       "stale m\nghost m/x\n", "queued: 2 lines"},
      {"StaleWithItsSizeAndDate",
       [&] {
         struct stat info {};
         stat(In("dates").c_str(), &info);
         Write("dates", "TEXT");
         const timespec times[] = {info.st_atim, info.st_mtim};
         utimensat(AT_FDCWD, In("dates").c_str(), times, 0);
       },
       "stale dates\n", ""},
      {"StaleFolder", [&] { chmod(In("in").c_str(), 0700); }, "stale in\n", ""},
      {"StaleWithoutAStamp", [&] { Put(In("m0")); }, "stale m0\n", ""},
      {"DocumentOfWhatLeadsToAFolder", [&] { Put(docs_); }, "ghost " + docs_ + "\n",
       "queued: 1 line"},
      {"FolderIsIndexedNoMore",
       [&] {
         SetFolders({"/docs/in/in", "/docs/in/in/in"});
       },
       "ghost " + docs_ +
           "/in\nghost a.txt\nghost dates\nghost m\nghost m!\nghost m.txt\n"
           "ghost m0\nghost n\\012\\001\nghost \xE9\xFF\n",
       "queued: 9 lines"},
  };
  for (const auto& step : steps) {
    SCOPED_TRACE(step.name);
    step.change();
    const Result found = Run("audit --repair --grace 0");
    EXPECT_EQ(found.out, step.differences) << found.err;
    EXPECT_NE(found.err.find(step.queued), std::string::npos) << found.err;
    EXPECT_EQ(found.status, 0) << found.err;
    EXPECT_EQ(Run("audit --grace 0").status, 0);
  }
}

TEST_F(AuditTest, ManyDifferencesAreOneLine) {
  for (int i = 0; i < 600; ++i) {
    Write("deep/" + std::to_string(i % 100) + "/" + std::to_string(i));
  }
  Write("one");
  StartIndexer();
  for (int i = 0; i < 600; ++i) {
    Write("deep/" + std::to_string(i % 100) + "/" + std::to_string(i), "other");
  }
  fs::remove(In("one"));
  const Result found = Run("audit --repair --json --grace 0");
  EXPECT_EQ(found.status, 0) << found.err;
  EXPECT_NE(found.err.find("0 missing, 1 ghost, 600 stale; 702 paths on the disk, "
                           "703 documents in 1 index\nqueued: 1 line for 1 share\n"),
            std::string::npos)
      << found.err;
  EXPECT_EQ(std::count(found.out.begin(), found.out.end(), '\n'), 601);
  EXPECT_NE(found.out.find(R"({"difference":"stale","path":"deep/99/599","share":"docs"})"),
            std::string::npos);
}

TEST_F(AuditTest, ComparesTheFoldersThatAreNamed) {
  Write("a/x");
  Write("a.b");
  Write("b/x");
  StartIndexer();
  for (const char* const name : {"a/new", "a.new", "b/new"}) {
    Write(name);
  }
  const struct {
    std::string arguments;
    int status;
    std::string out;
  } cases[] = {
      {"", 1, "missing a.new\nmissing a/new\nmissing b/new\n"},
      {In("a"), 1, "missing a/new\n"},
      {"/docs/in/a/", 1, "missing a/new\n"},
      {In("b") + " " + In("b/x") + " " + In("a"), 1, "missing a/new\nmissing b/new\n"},
      {In("gone"), 0, ""},
      {kRoot / "etc", 3, ""},
      {"--grace -1", 2, ""},
  };
  for (const auto& [arguments, status, out] : cases) {
    SCOPED_TRACE(arguments);
    const Result found = Run("audit " + arguments);
    EXPECT_EQ(found.out, out) << found.err;
    EXPECT_EQ(found.status, status) << found.err;
  }
  Write("a/x", "just now");
  EXPECT_EQ(Run("audit --grace 3600 " + In("a/x")).status, 0);
  EXPECT_EQ(Run("audit --grace 0 " + In("a/x")).out, "stale a/x\n");
}

TEST_F(AuditTest, SaysWhatKeepsItFromComparing) {
  Write("shut/x");
  Write("shut.y");
  Write("z");
  StartIndexer();
  const struct {
    const char* name;
    std::function<void()> change;
    std::string arguments;
    int status;
    std::string out;
    std::string err;
    std::function<void()> back;
  } cases[] = {
      {"UnreadableFolder",
       [&] {
         fs::remove_all(In("shut/x"));
         fs::remove(In("z"));
         chmod(In("shut").c_str(), 0);
       },
       "--grace 0", 1, "ghost z\n",
       "not looked at: shut: Permission denied\n0 missing, 1 ghost, 0 stale; 3 paths on the disk, "
       "5 documents in 1 index\n1 folder or file could not be looked at",
       [&] { chmod(In("shut").c_str(), 0755); }},
      {"ChangesWait", [&] { StatusMgr().Pause(0); }, "--repair", 1, "*ghost z\n",
       "indexing of 'docs' is paused; 'fileindex resume' goes on",
       [&] {
         End("fileindexd", SIGKILL);
         StatusMgr().SetShareStatus("docs", 0);
       }},
      {"NoIndexDaemon", [&] { fs::remove(vexlo::fileindex::kFileIndexDaemonSocketPath.Get()); },
       "--repair", 1, "*ghost z\n", "fileindexd does not run", [] {}},
      {"PausedIndex", [] { ShareIndexPause("docs"); }, "", 3, "", "its index is paused; 'fileindex",
       [] { ShareIndexResume("docs"); }},
      {"FolderOfTheShareIsGone", [&] { fs::rename(docs_, kRoot / "away"); }, "", 3, "",
       "is not there", [&] { fs::rename(kRoot / "away", docs_); }},
      {"AnotherShareIsGone",
       [&] {
         SetFolders({"/docs/in", "/films"});
       },
       "", 3, "*ghost z\n", "not compared: the share 'films': the share is gone",
       [] { SetFolders({"/docs/in"}); }},
      {"NoEngine", [&] { End("kavoelasticd", SIGTERM); }, "", 3, "", "kavoelasticd does not run",
       [] {}},
  };
  for (const auto& step : cases) {
    SCOPED_TRACE(step.name);
    step.change();
    const Result found = Run("audit " + step.arguments, WithoutRights());
    EXPECT_EQ(found.status, step.status) << found.err;
    if (step.out.starts_with('*')) {
      EXPECT_TRUE(found.out.ends_with(step.out.substr(1))) << found.out;
    } else {
      EXPECT_EQ(found.out, step.out);
    }
    EXPECT_NE(found.err.find(step.err), std::string::npos) << found.err;
    step.back();
  }
}

TEST_F(AuditTest, ListsFilesWithoutText) {
  StartIndexer();
  EXPECT_EQ(Run("failed").status, 1);
  // Nobody runs who would read them.
  for (const char* const name : {"a.pdf", "b\n.pdf", "crash.pdf", "mended.pdf", "plain.txt"}) {
    Write(name);
  }
  const auto entry = [&](const std::string& name, int64_t changed_by) {
    struct stat info {};
    stat(In(name).c_str(), &info);
    const auto nanoseconds = [](const timespec& time) {
      return std::to_string(time.tv_sec * 1'000'000'000 + time.tv_nsec);
    };
    return R"({"device":)" + std::to_string(info.st_dev) +
           ",\"inode\":" + std::to_string(info.st_ino) +
           ",\"size\":" + std::to_string(info.st_size + changed_by) +
           ",\"modified\":" + nanoseconds(info.st_mtim) +
           ",\"changed\":" + nanoseconds(info.st_ctim) +
           R"(,"reason":"crash","msg":"it died","time":1,"path":")" + In(name) + "\"}";
  };
  const std::string list = kRoot.MakeFolder("var/lib/kavo/extract") + "/quarantine.json";
  WriteText(list, "{\"files\":[" + entry("crash.pdf", 0) + "," + entry("mended.pdf", 1) + "]}");
  EXPECT_EQ(Run("failed").out, "crash.pdf: crash: it died (quarantined)\n");
  fs::remove(In("mended.pdf"));
  EXPECT_EQ(Run("audit --repair").status, 0);
  const std::string unavailable =
      ": unavailable: kavocontentextractd does not run (nobody answers on " +
      (kRoot / "var/run/kavocontentextractd.sock") + ")";
  const Result found = Run("failed");
  EXPECT_EQ(found.status, 0);
  EXPECT_EQ(found.out, "a.pdf" + unavailable + "\nb\\012.pdf" + unavailable + "\ncrash.pdf" +
                           unavailable + " (quarantined)\n");
  EXPECT_EQ(found.err, "3 files unavailable\n");
  EXPECT_TRUE(Run("failed --json")
                  .out.ends_with(R"("path":"crash.pdf","quarantined":true,"reason":"unavailable"})"
                                 "\n"));
  WriteText(list, "{");
  EXPECT_NE(Run("failed").err.find("without the quarantine: "), std::string::npos);
  ShareIndexPause("docs");
  EXPECT_EQ(Run("failed").status, 3);
}

TEST_F(AuditTest, TheDoctorFindsWhatIsWrongAndSaysWhatHelps) {
  Write("a");
  StartIndexer();
  const auto expect = [this](const std::vector<std::string>& lines) {
    const Result found = Run("doctor", WithoutRights());
    EXPECT_EQ(found.status, 1);
    for (const std::string& line : lines) {
      EXPECT_NE(found.out.find(line), std::string::npos) << line << "is not in\n" << found.out;
    }
  };
  const std::string remedy = "\n         $ ";
  expect({"error    evnotifyd: does not run, so changes of files go unseen",
          "warning  kavocontentextractd: does not run, ",
          "ok       kavoelasticd: listens and answers; 1 index is active\n",
          "ok       fileindexd: listens and answers; 1 worker\n", "ok       clock: no file",
          "ok       shares: indexing is not paused\n"});

  StatusMgr().Pause(0);
  ShareIndexPause("docs");
  End("fileindexd", SIGTERM);
  StatusMgr().SetShareStatus("docs", 1);
  SetFolders({"/docs/in", "/films/x"});
  FakeEngine fake(kRoot / "var/run/evnotifyd.sock");
  fake.Script({R"({"queues":[{"lines":1,"overflows":2,"queue":"/q","roots":["/elsewhere"],
      "reason":"4 watches are needed, 3 allowed by fs.inotify.max_user_watches",
      "state":"degraded","watches":100000000}]})"});
  expect({"warning  shares: indexing is paused without an end" + remedy + "fileindex resume\n",
          "warning  kavoelasticd: the index of 'docs' is paused, so it is not searched" + remedy +
              "fileindex index resume docs\n",
          "warning  shares: 'docs' is marked for a reindex", "$ fileindex folder reindex /docs\n",
          "error    fileindexd: does not run, so changes wait in the queues",
          "folders: .[1]: there is no share 'films' for '/films/x'" + remedy +
              "fileindex folder prune\n",
          "warning  evnotifyd: not all changes are seen at once for /q: 4 watches are needed",
          "error    evnotifyd: nobody watches the indexed folder '" + In() + "'" + remedy +
              "fileindex folder set /",
          "warning  inotify: 100,000,000 folders are watched of ",
          remedy + "sudo sysctl fs.inotify.max_user_watches=200016384\n",
          "warning  inotify: events were lost 2 times"});

  ShareIndexResume("docs");
  Put(In("it's"), 4000000000);
  const std::string locks = kRoot / "tmp";
  chmod(locks.c_str(), 0500);
  const std::string lock = vexlo::fileindex::kFileIndexStatusLockPath.Get();
  chmod(lock.c_str(), 0);
  expect({"warning  clock: 1 file is dated in the future", remedy + "touch -c 'it'\\''s'\n",
          "error    state: '" + locks + "' cannot be written: Permission denied" + remedy +
              "chmod u+rwx " + locks + "\n",
          "error    state: the lock file '", remedy + "sudo chmod a+r /"});
  chmod(locks.c_str(), 0700);
  chmod(lock.c_str(), 0600);

  End("kavoelasticd", SIGTERM);
  expect({"error    kavoelasticd: does not run, so nothing is searched or indexed",
          remedy + KAVOELASTICD_PROGRAM " &\n"});
}

}  // namespace
