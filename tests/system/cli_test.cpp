// The fileindex program as a person or a script runs it.
#include <signal.h>
#include <sys/wait.h>

#include <cstdio>
#include <filesystem>
#include <fstream>

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
    {"RemoveShare", "share remove films", 0, "*removed: films", ""},
    {"RemoveShareTwice", "share remove films", 3, "", "films"},
};

const CliCase kBadSharesCases[] = {
    {"BadShares", "share list", 3, "", "shares.json:2: "},
    {"ExplainBadShares", "explain vol/photo", 3, "", "shares.json:2: "},
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
  for (const CliCase& row : kCases) {
    Check(row);
  }
  WriteText(files_ / "root/etc/kavo/shares.json", "{\"shares\": [\n{\"name\": \"a\"}]}");
  for (const CliCase& row : kBadSharesCases) {
    Check(row);
  }
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
