// The fileindex program as a person or a script runs it.
#include <signal.h>

#include <filesystem>
#include <set>
#include <span>
#include <string>
#include <vector>

#include "support/program.h"
#include "support/temp_folder.h"

namespace {

struct CliCase {
  const char* name;
  const char* line;
  int status;
  std::string out;  // The whole standard output; "*..." stands for one that holds the rest.
  std::string err;  // What standard error holds.
};

const CliCase kCases[] = {
    {"UnknownCommand", "queue sho", 2, "", "there is no command 'queue sho'"},
    {"UnknownOption", "queue show --jsn queue", 2, "", "no option '--jsn'"},
    {"MissingRequiredOption", "queue pending /v", 2, "", "wants the option --queue FILE"},
    {"Show", "queue show queue", 0,
     "[05] /v/s/.plan.new -> /v/s/plan\n[02] /v/s/plan\n[06] /v/s/photo\n",
     "3 lines read, 0 skipped, 4 entries in the tree's list, 3 operations to deliver\n"},
    {"ShowJson", "queue show --json bytes", 0, "*{\"op\":4,\"path\":\"/\xE9 \\\"\\u000a\xE6\",",
     ""},
    {"ShowCrashed", "queue show crashed", 0, "[07] \n", "the whole share must be rebuilt"},
    {"ShowMissing", "queue show none", 3, "", "'none' cannot be read: No such file"},
    {"NotPendingBelow", "queue pending /v/s/plan/x --queue queue", 1, "*not pending: /v/s/pl", ""},
    {"PendingInSnapshot", "queue pending /v/t --queue old", 0, "*pending", ""},
    {"NoReindexAbove", "queue has-reindex /v/s --queue queue", 1, "*no ", ""},
    {"Reindex", "queue has-reindex /v/s/photo/a/ --queue queue", 0, "*pending: /v/s/photo/a", ""},
    {"BadLine", "queue pending /w --queue bad", 3, "", "Malformed event_raw: \\033["},
    {"NoShares", "share list", 1, "", "there are no shares in '"},
    {"AddShare", "share add vol/photo --recycle --ftp-privilege 7", 0, "*added: photo (/", ""},
    {"AddShareByLink", "share add link", 0, "*added: films (/", ""},
    {"AddShareTwice", "share add vol/photo", 3, "", "photo"},
    {"ListShares", "share list", 0, "*vol/photo  recycle\n", ""},
    {"ExplainYes", "explain vol/photo/a.JPG", 0, "*type: photo\nshare: photo (", ""},
    {"ExplainNo", "explain --json vol/photo/.git", 1, "*{\"can_be_indexed\":false,", ""},
    {"AddEvent", "queue add reindex vol/photo/", 0, "*: reindex /", "fileindexd does not run"},
    {"AddCovered", "queue add write vol/photo/a.JPG", 1, "", "a reindex that covers"},
    {"AddRename", "queue add rename films/a --old films/b --data 1", 0, "*films/b -> /", ""},
    {"AddBadData", "queue add write films --data {", 2, "", "no JSON: line 1, column 2"},
    {"AddNoShare", "queue add write vol", 3, "", "no share holds '"},
    {"PauseAlone", "pause", 0, "indexing is paused until 'fileindex resume'\n", "will go by"},
    {"ExtractText", "extract vol/photo/note.txt", 0, "*KAVOMDTextContent: The harbour", ""},
    {"ExtractNoDaemon", "extract --json vol/photo/note.pdf", 1,
     "*\"KAVOMDContentError\":\"unavailable: ", ""},
    {"RemoveShare", "share remove films", 0, "*removed: films", ""},
};

// With faults in the folders file and the status file.
const CliCase kBadConfigCases[] = {
    {"Check", "config check", 1, "*folders: .[3]: 'photo' is no share path", "7 findings"},
    {"CheckPlace", "config check", 1, "*.share.\"my photo\"", ""},
    {"CheckJson", "config check --json", 1, "*.status\",\"place\":\".share.photo\"", ""},
    {"Pending", "queue pending /v --queue queue", 3, "", "'fileindex config check' says"},
};

const CliCase kBadSharesCases[] = {
    {"CheckTorn", "config check", 1, "*folders: line 2, column 2: Missing", "0 folders"},
    {"BadShares", "share list", 3, "", "shares.json:2: "},
};

// With the engine running.
const CliCase kEngineCases[] = {
    {"AddShare", "share add vol/docs", 0, "*added: docs", ""},
    {"NoIndexYet", "doc put docs vol/docs/a.txt", 3, "", "there is no index fileindex_docs (error"},
    {"Create", "index create docs", 0, "created: the index of docs\n", ""},
    {"List", "index list", 0, "*fileindex_docs  active  /", ""},
    {"Put", "doc put docs vol/docs/a.txt", 0, "*indexed: /", ""},
    {"PutBySharePath", "doc put docs '/docs/Caf\xC3\xA9 \xE9.md'", 0, "*indexed: /", ""},
    {"PutByLink", "doc put docs link/a.txt", 0, "*vol/docs/a.txt\n", ""},
    {"PutOutside", "doc put docs vol/other.txt", 3, "", "does not lie in the share 'docs'"},
    {"PutFolder", "doc put docs vol/docs", 0, "*indexed: /", ""},
    {"Get", "doc get docs /docs/a.txt", 0, "*\"KAVOMDExtension\" : \"txt\"", ""},
    {"GetMissing", "doc get docs /docs/none", 1, "", "not in the index"},
    {"SearchWords", "search harbours museum", 0, "*vol/docs/a.txt\n", ""},
    {"SearchName", "search --name CAFE --share docs -0", 0, "*Caf\xC3\xA9 \xE9.md", ""},
    {"SearchJson", "search museum --json", 0, "*\"snippet\":\"", ""},
    {"SearchFilesOnly", "search --type document --below vol --newer 1d --larger 5 --sort -size", 0,
     "*a.txt\n", ""},
    {"SearchBelowLink", "search museum --below link", 0, "*vol/docs/a.txt\n", ""},
    {"SearchNothing", "search", 2, "", "wants words"},
    {"SearchTwice", "search x --share docs --share no", 2, "", "--share was given more than once"},
    {"SearchBadDate", "search x --newer 2026-02-31", 2, "", "'2026-02-31' is no date"},
    {"SearchBadSize", "search x --larger 5q", 2, "", "'5q' is no size"},
    {"Pause", "index pause docs", 0, "paused: the index of docs\n", ""},
    {"SearchPaused", "search museum", 1, "", "not searched: fileindex_docs"},
    {"SearchPausedShare", "search museum --share docs", 3, "", "the index is paused"},
    {"Resume", "index resume docs", 0, "*resumed", ""},
    {"Migrate", "index migrate docs root/elsewhere", 0, "*moved", ""},
    {"SearchMoved", "search museum", 0, "*vol/docs/a.txt\n", ""},
    {"Remove", "doc rm docs /docs", 0, "*and all below it\n", ""},
    {"SearchRemoved", "search museum", 1, "", "0 files found"},
    {"Delete", "index delete docs", 0, "*deleted", ""},
};

// With the engine running, and a socket of the index daemon's that nobody listens on.
const CliCase kFolderCases[] = {
    {"Add", "folder add vol/docs --name 'My docs' --group work --types document", 0,
     "added: /docs (document)\n", "made the share 'docs'"},
    {"AddAgain", "folder add vol/docs", 3, "", "indexed already; 'fileindex folder set'"},
    {"AddBelow", "folder add vol/docs/in", 0, "added: /docs/in (document,audio,video,photo)\n",
     "fileindexd does not run"},
    {"AddRefused", "folder add vol/docs/.git", 3, "", "/docs/.git cannot be indexed"},
    {"AddNoType", "folder add vol/@eaDir --types fotos", 2, "", "'fotos' is no type"},
    {"AddRefusedShare", "folder add vol/@eaDir", 3, "", "'@eaDir' was taken out again"},
    {"NoShareIsLeft", "share remove @eaDir", 3, "", "@eaDir"},
    {"List", "folder list --sort -path", 0,
     "PATH      NAME     GROUP  TYPES                       STATUS\n"
     "/docs/in  in              document,audio,video,photo  finished\n"
     "/docs     My docs  work   document                    processing\n",
     "2 folders of 2"},
    {"ListJson", "folder list --json --find MY --limit 1", 0, "*\"offset\":0,\"total\":1}", ""},
    {"Get", "folder get vol/docs/", 0, "*types  document\n", ""},
    {"GetByLink", "folder get link/in", 0, "*/docs/in", ""},
    {"GetOutside", "folder get vol", 3, "", "'vol' lies in no share"},
    {"Groups", "folder groups", 0, "work\n", ""},
    {"Set", "folder set /docs --types none --group ''", 0, "changed: /docs (none)\n", ""},
    {"SetNothing", "folder set /docs --types none", 1, "", "nothing to change"},
    {"Reindex", "folder reindex vol/docs", 0, "to be indexed again: /docs\n", "waits for it"},
    {"Status", "status --json", 0, "\"processing\"\n", "fileindexd does not run"},
    {"Summary", "summary", 0, "in       finished\nMy docs  processing\nin all   processing\n", ""},
    {"Delete", "folder delete vol/docs/in", 0, "deleted: /docs/in\n", ""},
    {"LoseTheIndex", "index delete docs", 0, "*deleted", ""},
    {"DeleteNothing", "folder delete", 2, "", "wants FOLDER"},
    {"DeleteLast", "folder delete --share docs", 0, "deleted: /docs\n", ""},
    {"NoIndex", "index list", 1, "", ""},
    {"AddBack", "folder add vol/docs", 0, "*added", ""},
    {"LoseTheShare", "share remove docs", 0, "*removed", ""},
    {"ListOfGoneShare", "folder list", 3, "", "is gone; 'fileindex folder prune'"},
    {"Prune", "folder prune", 0, "pruned: /docs\n", ""},
    {"IndexPruned", "index list", 1, "", ""},
};

// With everything running, and the shares docs and two.
const CliCase kRunningCases[] = {
    {"Ready", "health --ready", 0, "healthy\n", ""},
    {"PauseIndex", "index pause two", 0, "*paused", ""},
    {"PausedIndex", "health --ready", 1, "the index of the share two is paused\n", ""},
    {"ResumeIndex", "index resume two", 0, "*resumed", ""},
    {"DeleteIndex", "index delete two", 0, "*deleted", ""},
    {"MissingIndex", "health --ready", 1, "the share two has no index\n", ""},
};

class Cli : public testing::Test {
 protected:
  // In the folder, and ended by timeout(1) if it would never end.
  Program Start(const std::string& command) const {
    return Program("cd " + files_.Path() + "; export FILEINDEX_ROOT=$PWD/root; exec 2>err",
                   "timeout 60 " + command);
  }
  Program StartDaemon(const std::string& path) const {
    Program daemon = Start(path + " 2>&1");
    EXPECT_TRUE(daemon.Await("ready")) << daemon.text;
    return daemon;
  }

  void Check(std::span<const CliCase> rows) const {
    for (const CliCase& row : rows) {
      SCOPED_TRACE(row.name);
      Program tool = Start(FILEINDEX_PROGRAM " " + std::string(row.line));
      EXPECT_EQ(tool.End(), row.status);
      const std::string& out = tool.text;
      EXPECT_TRUE(out == row.out || (row.out[0] == '*' && out.find(&row.out[1]) < out.size()))
          << out;
      const std::string err = ReadText(files_ / "err");
      EXPECT_NE(err.find(row.err), std::string::npos) << err;
    }
  }

  void CheckWithEngine(std::span<const CliCase> rows) const {
    Program engine = StartDaemon(KAVOELASTICD_PROGRAM);
    Check(rows);
    EXPECT_EQ(engine.End(SIGTERM), 0);
    EXPECT_FALSE(std::filesystem::exists(files_ / "root/var/run/kavoelasticd.sock"));
  }

  void MakeFolders(const std::vector<std::string>& names) const {
    for (const std::string& name : names) {
      std::filesystem::create_directories(files_ / name);
    }
  }

  const TempFolder files_;
};

TEST_F(Cli, AnswersEveryCommandLine) {
  WriteText(files_ / "queue", R"({"event":64,"path":"/v/s/.plan.new"}
{"event":256,"path":"/v/s/plan","path_old":"/v/s/.plan.new"}
{"event":65536,"path":"/v/s/photo"})");
  WriteText(files_ / "bytes", "{\"event\":131072,\"path\":\"/\xE9 \\\"\\n\xE6\"}");
  WriteText(files_ / "crashed", R"({"event":512,"path":"/v/s"})");
  WriteText(files_ / "bad", "\033[1m\n");
  WriteText(files_ / "old.tmp", R"({"event":8,"path":"/v/t/x"})");
  const std::string etc = files_ / "root/var/packages/Vexlo/etc";
  MakeFolders({"vol/photo/.git", "films", "root/tmp", "root/var/packages/Vexlo/etc",
               "root/var/lib/kavo/fileindex/queue"});
  std::filesystem::create_symlink("films", files_ / "link");
  WriteText(files_ / "vol/photo/a.JPG", "");
  WriteText(files_ / "vol/photo/note.txt", "The harbour\nis closed");
  WriteText(files_ / "vol/photo/note.pdf", "%PDF");
  Check(kCases);
  Program astray = Start("env FILEINDEX_ROOT=root " FILEINDEX_PROGRAM " share list");
  EXPECT_EQ(astray.End(), 3) << "a root that is not absolute: " << astray.text;
  for (const char* const words : {"--help", "--version", "search --help"}) {
    Program full = Start("sh -c '" FILEINDEX_PROGRAM " " + std::string(words) + " >/dev/full'");
    EXPECT_EQ(full.End(), 3) << words;
  }
  const std::string rest = R"(,"name":"","document":true,"audio":true,"video":true,"photo":true)";
  WriteText(etc + "/fileindex.folders",
            R"([{"path":"/photo")" + rest + R"(,"owner":{}},{"path":"/photo")" + rest +
                R"(},{"path":"/gone")" + rest + R"(},{"path":"photo")" + rest + "},{}]");
  WriteText(etc + "/fileindex.status", R"({"share": {"photo": "1", "my photo": 1}})");
  Check(kBadConfigCases);
  WriteText(etc + "/fileindex.folders", "[\n{");
  WriteText(files_ / "root/etc/kavo/shares.json", "{\"shares\": [\n{\"name\": \"a\"}]}");
  Check(kBadSharesCases);
}

TEST_F(Cli, SearchesWhatItHasIndexed) {
  MakeFolders({"vol/docs"});
  std::filesystem::create_symlink("vol/docs", files_ / "link");
  WriteText(files_ / "vol/other.txt", "");
  WriteText(files_ / "vol/docs/a.txt", "The harbour museum.");
  WriteText(files_ / "vol/docs/Caf\xC3\xA9 \xE9.md", "apples");
  const CliCase without[] = {{"NoEngine", "search museum", 3, "", "kavoelasticd does not run"}};
  Check(without);
  Program extractor = StartDaemon(KAVOCONTENTEXTRACTD_PROGRAM);
  CheckWithEngine(kEngineCases);
  EXPECT_EQ(extractor.End(SIGTERM), 0);
}

TEST_F(Cli, AdministersFolders) {
  MakeFolders({"vol/docs/in", "vol/docs/.git", "vol/@eaDir", "root/var/packages/Vexlo/etc",
               "root/tmp", "root/var/lib/kavo/fileindex/queue", "root/var/run"});
  WriteText(files_ / "root/var/run/fileindexd.sock", "");
  std::filesystem::create_symlink("vol/docs", files_ / "link");
  CheckWithEngine(kFolderCases);
  EXPECT_EQ(ReadText(files_ / "root/var/lib/kavo/evnotify/fileindex.json"), "{\"queues\": [\n]}\n");
}

TEST_F(Cli, UpTakesOverTheDaemonsOfAnotherThatEnds) {
  MakeFolders({"vol/docs", "vol/two"});
  Program first = Start(FILEINDEX_PROGRAM " up vol/docs");
  EXPECT_TRUE(first.Await("following")) << first.text;
  Program second = Start(FILEINDEX_PROGRAM " up vol/two");
  EXPECT_TRUE(second.Await("following")) << second.text;
  EXPECT_EQ(first.End(SIGINT), 0) << first.text;
  EXPECT_TRUE(second.Await("evnotifyd runs no longer, and is started")) << second.text;
  WriteText(files_ / "vol/docs/a.txt", "harbour");
  Program search = Start("sh -c 'until " FILEINDEX_PROGRAM " search harbour; do sleep .1; done'");
  EXPECT_TRUE(search.Await("vol/docs/a.txt\n")) << second.text;
  EXPECT_EQ(search.End(), 0);
  Check(kRunningCases);
  Program unwatched = Start("sh -c 'rm root/var/lib/kavo/evnotify/*.json; until " FILEINDEX_PROGRAM
                            " health --ready | grep watches; do sleep .1; done'");
  EXPECT_TRUE(unwatched.Await("nobody watches the share docs\n"));
  EXPECT_EQ(unwatched.End(), 0);
  EXPECT_EQ(second.End(SIGINT), 0) << second.text;
  const CliCase pause[] = {{"Pause", "pause", 0, "*is paused", "will go by the status file"}};
  Check(pause);
  Program paused = Start(FILEINDEX_PROGRAM " up");
  EXPECT_TRUE(paused.Await("docs: indexing is paused; 'fileindex resume' goes on\n"));
  EXPECT_TRUE(paused.Await("following"));
  EXPECT_EQ(paused.text.find("everything can be found"), std::string::npos) << paused.text;
  EXPECT_EQ(paused.End(SIGINT), 0);
}

TEST_F(Cli, WatchDeliversWhatAnEarlierRunLeftAndThenWhatHappens) {
  const std::string root = files_ / "tree";
  std::filesystem::create_directory(root);
  WriteText(files_ / "queue.tmp", R"({"event":8,"path":"/v/s/first"})");
  WriteText(files_ / "queue", "{\"event\":8,\"path\":\"/v/s/second\"}\n");
  Program tool = Start(FILEINDEX_PROGRAM " watch tree --interval 0.1 --queue queue");
  EXPECT_TRUE(tool.Await("[02] /v/s/first\n[02] /v/s/second\n"));
  WriteText(root + "/note", "one");
  EXPECT_TRUE(tool.Await("[02] " + root + "/note\n"));
  WriteText(root + "/.note.new", "two");
  std::filesystem::rename(root + "/.note.new", root + "/note");
  EXPECT_TRUE(tool.Await("[05] " + root + "/.note.new -> " + root + "/note\n"));
  std::filesystem::create_directories(root + "/made/below");
  EXPECT_TRUE(tool.Await("[06] " + root + "/made\n"));
  std::filesystem::remove(root + "/note");
  EXPECT_TRUE(tool.Await("[01] " + root + "/note\n"));
  // What is still on its way when Ctrl-C comes is delivered too.
  WriteText(root + "/last", "x");
  EXPECT_EQ(tool.End(SIGINT), 0) << ReadText(files_ / "err");
  EXPECT_TRUE(tool.text.ends_with("[02] " + root + "/last\n")) << tool.text;
  EXPECT_NE(ReadText(files_ / "err").find(" operations delivered: a factor of "),
            std::string::npos);
  EXPECT_EQ(files_.Names(), (std::set<std::string>{"err", "tree"}));
}

}  // namespace
