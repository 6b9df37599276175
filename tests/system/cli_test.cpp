// The fileindex program as a person or a script runs it.
#include <signal.h>
#include <sys/wait.h>

#include <cstdio>
#include <filesystem>
#include <fstream>
#include <span>

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
    {"MissingOptionValue", "queue pending /v --queue", 2, "", "wants a value, FILE"},
    {"MissingRequiredOption", "queue pending /v", 2, "", "wants the option --queue FILE"},
    {"BadInterval", "watch /tmp --interval 0", 2, "", "'0' is no interval"},
    {"Show", "queue show queue", 0,
     "[05] /v/s/.plan.new -> /v/s/plan\n[02] /v/s/plan\n[06] /v/s/photo\n",
     "3 lines read, 0 skipped, 4 entries in the tree's list, 3 operations to deliver\n"},
    {"ShowJson", "queue show --json bytes", 0, "*{\"op\":4,\"path\":\"/\xE9 \\\"\\u000a\xE6\",",
     ""},
    {"ShowEmpty", "queue show empty", 1, "", "0 lines read"},
    {"ShowCrashed", "queue show crashed", 0, "[07] \n", "the whole share must be rebuilt"},
    {"ShowMissing", "queue show none", 3, "", "'none' cannot be read: No such file"},
    {"PendingAbove", "queue pending /v/s --queue=queue", 0, "pending: /v/s\n", ""},
    {"NotPendingBelow", "queue pending /v/s/plan/x --queue queue", 1, "*not pending: /v/s/pl", ""},
    {"PendingInSnapshot", "queue pending /v/t --queue old", 0, "*pending", ""},
    {"PendingNoQueue", "queue pending /v --queue none", 3, "", "there is no queue"},
    {"NoReindexAbove", "queue has-reindex /v/s --queue queue", 1, "*no ", ""},
    {"Reindex", "queue has-reindex /v/s/photo/a/ --queue queue", 0, "*pending: /v/s/photo/a", ""},
    {"BadLine", "queue pending /w --queue bad", 3, "", "Malformed event_raw: \\033["},
    {"WatchFile", "watch queue", 3, "", "is no folder"},
    {"NoShares", "share list", 1, "", "there are no shares in '"},
    {"AddShare", "share add vol/photo --recycle --ftp-privilege 7", 0, "*added: photo (/", ""},
    {"AddShareByLink", "share add link", 0, "*added: films (/", ""},
    {"AddShareTwice", "share add vol/photo", 3, "", "photo"},
    {"AddShareNoFolder", "share add queue", 3, "", "'queue' is no folder"},
    {"AddShareBadPrivilege", "share add vol --ftp-privilege -1", 2, "", "'-1' is no FTP"},
    {"ListShares", "share list", 0, "*vol/photo  recycle\n", ""},
    {"ListSharesJson", "share list --json", 0, "*\"ftp_privilege\":7,", ""},
    {"ExplainYes", "explain vol/photo/a.JPG", 0, "*type: photo\nshare: photo (", ""},
    {"ExplainNo", "explain --json vol/photo/.git", 1, "*{\"can_be_indexed\":false,", ""},
    {"ExplainNoShare", "explain vol", 1, "*share: none holds the path\n", ""},
    {"AddEvent", "queue add reindex vol/photo/", 0, "*: reindex /", "fileindexd does not run"},
    {"AddCovered", "queue add write vol/photo/a.JPG", 1, "", "a reindex that covers"},
    {"AddRename", "queue add rename films/a --old films/b --data 1", 0, "*films/b -> /", ""},
    {"AddWithoutOld", "queue add rename vol/photo", 2, "", "wants the option --old"},
    {"AddUnknown", "queue add modify vol/photo", 2, "", "no event 'modify'"},
    {"AddBadData", "queue add write films --data {", 2, "", "no JSON: line 1, column 2"},
    {"AddNoShare", "queue add write vol", 3, "", "no share holds '"},
    {"PauseAlone", "pause", 0, "indexing is paused until 'fileindex resume'\n", "will go by"},
    {"PauseBadHours", "pause 0", 2, "", "'0' is no number of hours"},
    {"ExtractText", "extract vol/photo/note.txt", 0, "*KAVOMDTextContent: The harbour", ""},
    {"ExtractNoDaemon", "extract --json vol/photo/note.pdf", 1,
     "*\"KAVOMDContentError\":\"unavailable: ", ""},
    {"ExtractMissing", "extract none vol/photo/note.txt", 3, "*The harbour", "none: No such file"},
    {"RemoveShare", "share remove films", 0, "*removed: films", ""},
    {"RemoveShareTwice", "share remove films", 3, "", "films"},
};

// With faults in the folders file and the status file.
const CliCase kBadConfigCases[] = {
    {"Check", "config check", 1, "*folders: .[3]: 'photo' is no share path", "6 findings"},
    {"CheckJson", "config check --json", 1, "*.status\",\"place\":\".share.photo\"", ""},
    {"Pending", "queue pending /v --queue queue", 3, "", "'fileindex config check' says"},
};

const CliCase kBadSharesCases[] = {
    {"CheckTorn", "config check", 1, "*folders: line 2, column 2: Missing", "0 folders"},
    {"BadShares", "share list", 3, "", "shares.json:2: "},
    {"ExplainBadShares", "explain vol/photo", 3, "", "shares.json:2: "},
};

// With the engine running.
const CliCase kEngineCases[] = {
    {"AddShare", "share add vol/docs", 0, "*added: docs", ""},
    {"NoIndexYet", "doc put docs vol/docs/a.txt", 3, "", "there is no index fileindex_docs (error"},
    {"CreateForNoShare", "index create films", 3, "", "there is no share 'films'"},
    {"Create", "index create docs", 0, "created: the index of docs\n", ""},
    {"List", "index list", 0, "*fileindex_docs  active  /", ""},
    {"Put", "doc put docs vol/docs/a.txt", 0, "*indexed: /", ""},
    {"PutBySharePath", "doc put docs '/docs/Caf\xC3\xA9 \xE9.md'", 0, "*indexed: /", ""},
    {"PutFolder", "doc put docs vol/docs", 0, "*indexed: /", ""},
    {"PutMissing", "doc put docs vol/docs/none", 3, "", "Parse failed, path=/"},
    {"Get", "doc get docs /docs/a.txt", 0, "*\"KAVOMDExtension\" : \"txt\"", ""},
    {"GetMissing", "doc get docs /docs/none", 1, "", "not in the index"},
    {"SearchWords", "search harbours museum", 0, "*vol/docs/a.txt\n", ""},
    {"SearchNoneOfIt", "search museum apples", 1, "", "0 files found"},
    {"SearchName", "search --name CAFE --share docs -0", 0, "*Caf\xC3\xA9 \xE9.md", ""},
    {"SearchJson", "search museum --json", 0, "*\"snippet\":\"", ""},
    {"SearchFilesOnly", "search --type document --below vol --newer 1d --larger 5 --sort -size", 0,
     "*a.txt\n", ""},
    {"SearchNothing", "search", 2, "", "wants words"},
    {"PutPage", "doc put docs vol/docs/page.html", 0, "*indexed: /", ""},
    {"SearchPage", "search lighthouse", 0, "*vol/docs/page.html\n", ""},
    {"SearchMarkup", "search strong", 1, "", "0 files found"},
    {"SearchBadSize", "search x --larger 5q", 2, "", "'5q' is no size"},
    {"SearchBadDate", "search x --newer soon", 2, "", "'soon' is no date"},
    {"SearchBadType", "search x --type film", 2, "", "'film' is no type"},
    {"SearchBadOrder", "search x --sort best", 2, "", "'best' is no order"},
    {"Pause", "index pause docs", 0, "paused: the index of docs\n", ""},
    {"SearchPaused", "search museum", 1, "", "not searched: fileindex_docs"},
    {"SearchPausedShare", "search museum --share docs", 3, "", "the index is paused"},
    {"Resume", "index resume docs", 0, "*resumed", ""},
    {"Migrate", "index migrate docs root/elsewhere", 0, "*moved", ""},
    {"SearchMoved", "search museum", 0, "*vol/docs/a.txt\n", ""},
    {"Remove", "doc rm docs /docs", 0, "*and all below it\n", ""},
    {"SearchRemoved", "search museum", 1, "", "0 files found"},
    {"Delete", "index delete docs", 0, "*deleted", ""},
    {"ListNone", "index list", 1, "", ""},
};

// With the engine running, and a socket of the index daemon's that nobody listens on.
const CliCase kFolderCases[] = {
    {"AddNoFolder", "folder add queue", 3, "", "'queue' is no folder"},
    {"Add", "folder add vol/docs --name 'My docs' --group work --types document", 0,
     "added: /docs (document)\n", "made the share 'docs'"},
    {"AddAgain", "folder add vol/docs", 3, "", "indexed already; 'fileindex folder set'"},
    {"AddBelow", "folder add vol/docs/in", 0, "added: /docs/in (document,audio,video,photo)\n",
     "fileindexd does not run"},
    {"AddRefused", "folder add vol/docs/.git", 3, "", "/docs/.git cannot be indexed"},
    {"AddBadType", "folder add vol/docs/in --types film", 2, "", "'film' is no type"},
    {"List", "folder list --sort -path", 0,
     "PATH      NAME     GROUP  TYPES                       STATUS\n"
     "/docs/in  in              document,audio,video,photo  finished\n"
     "/docs     My docs  work   document                    processing\n",
     "2 folders of 2"},
    {"ListJson", "folder list --json --find MY --limit 1", 0, "*\"offset\":0,\"total\":1}", ""},
    {"ListNone", "folder list --group play", 1, "", "0 folders of 0"},
    {"ListBadOrder", "folder list --sort size", 2, "", "'size' is no order"},
    {"Get", "folder get vol/docs/", 0, "*types  document\n", ""},
    {"GetJson", "folder get --json /docs/in", 0, "*\"path\":\"/docs/in\"", ""},
    {"GetOther", "folder get vol/docs/none", 3, "", "'/docs/none' is no indexed folder"},
    {"GetOutside", "folder get vol", 3, "", "'vol' lies in no share"},
    {"Groups", "folder groups", 0, "work\n", ""},
    {"Set", "folder set /docs --types none --group ''", 0, "changed: /docs (none)\n", ""},
    {"SetNothing", "folder set /docs --types none", 1, "", "nothing to change"},
    {"SetAsItIs", "folder set /docs", 0, "renewed: /docs (none)\n", ""},
    {"Reindex", "folder reindex vol/docs", 0, "to be indexed again: /docs\n", "waits for it"},
    {"ReindexElsewhere", "folder reindex vol", 3, "", "'vol' lies in no share"},
    {"Status", "status --json", 0, "\"processing\"\n", "fileindexd does not run"},
    {"Summary", "summary", 0, "in       finished\nMy docs  processing\nin all   processing\n", ""},
    {"SummaryJson", "summary --json", 0, "*\"status\":\"processing\"}", ""},
    {"Delete", "folder delete vol/docs/in", 0, "deleted: /docs/in\n", ""},
    {"DeleteOther", "folder delete /docs/in", 3, "", "'/docs/in' is no indexed folder"},
    {"DeleteNone", "folder delete --share photo", 3, "", "no folder to delete"},
    {"LoseTheIndex", "index delete docs", 0, "*deleted", ""},
    {"DeleteLast", "folder delete --share docs", 0, "deleted: /docs\n", ""},
    {"NoIndex", "index list", 1, "", ""},
    {"AddBack", "folder add vol/docs", 0, "*added", ""},
    {"LoseTheShare", "share remove docs", 0, "*removed", ""},
    {"ListOfGoneShare", "folder list", 3, "", "is gone; 'fileindex folder prune'"},
    {"Prune", "folder prune", 0, "pruned: /docs\n", ""},
    {"PruneAgain", "folder prune", 1, "", "the share of every folder is there"},
    {"IndexPruned", "index list", 1, "", ""},
    {"GroupsOfNone", "folder groups", 1, "", ""},
};

// A run of the program, ended by timeout(1) if it would never end.
class Cli : public testing::Test {
 protected:
  // Runs it in the folder.
  void Start(const std::string& line) {
    const std::string all = "cd " + files_.Path() +
                            "; export FILEINDEX_ROOT=$PWD/root; echo $$; exec timeout 20 " +
                            FILEINDEX_PROGRAM " " + line + " 2> err";
    output_ = popen(all.c_str(), "re");
    out_.clear();
    EXPECT_TRUE(Await("\n"));
    pid_ = std::stoi(std::exchange(out_, ""));
  }

  // Reads on until the output holds `text`; false when it ends before.
  bool Await(const std::string& text) {
    while (out_.find(text) == std::string::npos) {
      const int byte = getc(output_);
      if (byte == EOF) {
        return false;
      }
      out_ += static_cast<char>(byte);
    }
    return true;
  }

  // Reads to the end, after a signal if it is one. The exit status.
  int End(int signal = 0) {
    kill(pid_, signal);
    EXPECT_FALSE(Await("what no program says"));
    const int status = pclose(output_);
    err_ = ReadText(files_ / "err");
    return WIFEXITED(status) ? WEXITSTATUS(status) : -1;
  }

  void Check(const CliCase& row) {
    SCOPED_TRACE(row.name);
    Start(row.line);
    EXPECT_EQ(End(), row.status);
    EXPECT_TRUE(out_ == row.out || (row.out[0] == '*' && out_.find(&row.out[1]) < out_.size()))
        << out_;
    EXPECT_NE(err_.find(row.err), std::string::npos) << err_;
  }

  void CheckWithEngine(std::span<const CliCase> rows) {
    Program engine("cd " + files_.Path() + "; export FILEINDEX_ROOT=$PWD/root",
                   "timeout 60 " KAVOELASTICD_PROGRAM " 2>&1");
    ASSERT_TRUE(engine.Await("ready")) << engine.text;
    for (const CliCase& row : rows) {
      Check(row);
    }
    EXPECT_EQ(engine.End(SIGTERM), 0);
    EXPECT_FALSE(std::filesystem::exists(files_ / "root/var/run/kavoelasticd.sock"));
  }

  const TempFolder files_;
  std::string out_;
  std::string err_;
  FILE* output_ = nullptr;
  pid_t pid_ = 0;
};

TEST_F(Cli, AnswersEveryCommandLine) {
  WriteText(files_ / "queue", R"({"event":64,"path":"/v/s/.plan.new"}
{"event":256,"path":"/v/s/plan","path_old":"/v/s/.plan.new"}
{"event":65536,"path":"/v/s/photo"})");
  WriteText(files_ / "empty", "");
  WriteText(files_ / "bytes", "{\"event\":131072,\"path\":\"/\xE9 \\\"\\n\xE6\"}");
  WriteText(files_ / "crashed", R"({"event":512,"path":"/v/s"})");
  WriteText(files_ / "bad", "\033[1m\n");
  WriteText(files_ / "old.tmp", R"({"event":8,"path":"/v/t/x"})");
  std::filesystem::create_directories(files_ / "vol/photo/.git");
  std::filesystem::create_directories(files_ / "films");
  std::filesystem::create_symlink("films", files_ / "link");
  WriteText(files_ / "vol/photo/a.JPG", "");
  const std::string etc = files_ / "root/var/packages/Vexlo/etc";
  for (const char* needed : {"", "/../../../../tmp", "/../../../lib/kavo/fileindex/queue"}) {
    std::filesystem::create_directories(etc + needed);
  }
  WriteText(files_ / "vol/photo/note.txt", "The harbour\nis closed");
  WriteText(files_ / "vol/photo/note.pdf", "%PDF");
  for (const CliCase& row : kCases) {
    Check(row);
  }
  const std::string rest = R"(,"name":"","document":true,"audio":true,"video":true,"photo":true)";
  WriteText(etc + "/fileindex.folders",
            R"([{"path":"/photo")" + rest + R"(,"owner":{}},{"path":"/photo")" + rest +
                R"(},{"path":"/gone")" + rest + R"(},{"path":"photo")" + rest + "},{}]");
  WriteText(etc + "/fileindex.status", R"({"share": {"photo": "1"}})");
  for (const CliCase& row : kBadConfigCases) {
    Check(row);
  }
  WriteText(etc + "/fileindex.folders", "[\n{");
  WriteText(files_ / "root/etc/kavo/shares.json", "{\"shares\": [\n{\"name\": \"a\"}]}");
  for (const CliCase& row : kBadSharesCases) {
    Check(row);
  }
}

TEST_F(Cli, SearchesWhatItHasIndexed) {
  std::filesystem::create_directories(files_ / "vol/docs");
  WriteText(files_ / "vol/docs/a.txt", "The harbour museum.");
  WriteText(files_ / "vol/docs/Caf\xC3\xA9 \xE9.md", "apples");
  WriteText(files_ / "vol/docs/page.html", "<html><p>The <strong>light</strong>house");
  Start("search museum");
  EXPECT_EQ(End(), 3);
  EXPECT_NE(err_.find("kavoelasticd does not run"), std::string::npos) << err_;
  const std::string in_root = "cd " + files_.Path() + "; export FILEINDEX_ROOT=$PWD/root";
  Program extractor(in_root, "timeout 60 " KAVOCONTENTEXTRACTD_PROGRAM " 2>&1");
  ASSERT_TRUE(extractor.Await("ready\n")) << extractor.text;
  CheckWithEngine(kEngineCases);
  EXPECT_EQ(extractor.End(SIGTERM), 0);
}

TEST_F(Cli, AdministersFolders) {
  std::filesystem::create_directories(files_ / "vol/docs/in");
  std::filesystem::create_directories(files_ / "vol/docs/.git");
  for (const char* needed :
       {"var/packages/Vexlo/etc", "tmp", "var/lib/kavo/fileindex/queue", "var/run"}) {
    std::filesystem::create_directories(files_ / "root/" + needed);
  }
  WriteText(files_ / "queue", "");
  WriteText(files_ / "root/var/run/fileindexd.sock", "");
  CheckWithEngine(kFolderCases);
  EXPECT_EQ(ReadText(files_ / "root/var/lib/kavo/evnotify/fileindex.json"), "{\"queues\": [\n]}\n");
}

TEST_F(Cli, WatchDeliversWhatAnEarlierRunLeftAndThenWhatHappens) {
  const std::string root = files_ / "tree";
  std::filesystem::create_directory(root);
  WriteText(files_ / "queue.tmp", R"({"event":8,"path":"/v/s/first"})");
  WriteText(files_ / "queue", "{\"event\":8,\"path\":\"/v/s/second\"}\n");
  Start("watch tree --interval 0.1 --queue queue");
  EXPECT_TRUE(Await("[02] /v/s/first\n[02] /v/s/second\n"));
  WriteText(root + "/note", "one");
  EXPECT_TRUE(Await("[02] " + root + "/note\n"));
  WriteText(root + "/.note.new", "two");
  std::filesystem::rename(root + "/.note.new", root + "/note");
  EXPECT_TRUE(Await("[05] " + root + "/.note.new -> " + root + "/note\n"));
  std::filesystem::create_directories(root + "/made/below");
  EXPECT_TRUE(Await("[06] " + root + "/made\n"));
  std::filesystem::remove(root + "/note");
  EXPECT_TRUE(Await("[01] " + root + "/note\n"));
  // What is still on its way when Ctrl-C comes is delivered too.
  WriteText(root + "/last", "x");
  EXPECT_EQ(End(SIGINT), 0) << err_;
  EXPECT_TRUE(out_.ends_with("[02] " + root + "/last\n")) << out_;
  EXPECT_NE(err_.find(" operations delivered: a factor of "), std::string::npos);
  EXPECT_EQ(files_.Names(), (std::set<std::string>{"err", "tree"}));
}

}  // namespace
