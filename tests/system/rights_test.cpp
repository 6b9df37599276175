// Who may do what: the daemons with the rights that they keep, and what other users get of them.
#include <gtest/gtest.h>
#include <linux/capability.h>
#include <sys/stat.h>
#include <unistd.h>

#include <fstream>
#include <initializer_list>

#include "support/as_user.h"
#include "support/stack.h"

namespace {

const PrivateRoot kRoot;
constexpr uid_t kSomebody = 12345;

// Of /proc/PID/status.
std::string StatusLine(pid_t pid, const std::string& name) {
  std::ifstream status("/proc/" + std::to_string(pid) + "/status");
  for (std::string line; std::getline(status, line);) {
    if (line.starts_with(name + ":\t")) {
      return line.substr(name.size() + 2);
    }
  }
  return "";
}

std::string CapabilityMask(std::initializer_list<int> capabilities) {
  uint64_t mask = 0;
  for (const int capability : capabilities) {
    mask |= uint64_t{1} << static_cast<unsigned>(capability);
  }
  char text[17];
  snprintf(text, sizeof(text), "%016lx", static_cast<unsigned long>(mask));
  return text;
}

TEST(Rights, DaemonsOfRootIndexEverybodysFilesWithFewCapabilities) {
  if (geteuid() != 0) {
    GTEST_SKIP() << "only root has capabilities to give up";
  }
  Stack stack(kRoot);
  const struct {
    const char* name;
    std::string kept;
  } rows[] = {
      {"kavoelasticd", CapabilityMask({})},
      {"kavocontentextractd", CapabilityMask({CAP_KILL, CAP_SETGID, CAP_SETUID})},
      {"fileindexd", CapabilityMask({CAP_DAC_READ_SEARCH})},
      {"evnotifyd", CapabilityMask({CAP_DAC_READ_SEARCH, CAP_SYS_ADMIN})},
  };
  for (const auto& row : rows) {
    const pid_t pid = stack.Pid(row.name);
    for (const char* const set : {"CapPrm", "CapEff", "CapBnd"}) {
      EXPECT_EQ(StatusLine(pid, set), row.kept) << row.name << " " << set;
    }
    EXPECT_EQ(StatusLine(pid, "NoNewPrivs"), "1") << row.name;
  }
  struct stat state {};
  ASSERT_EQ(stat((kRoot / "var/lib/kavo").c_str(), &state), 0);
  EXPECT_EQ(state.st_mode & 0777U, 0700U) << "state tells of everybody's files";
  const std::string folder = stack.In() + "/private";
  std::filesystem::create_directory(folder);
  WriteText(folder / std::filesystem::path("plain.txt"), "tokenofplain");
  WriteText(folder / std::filesystem::path("page.html"), "<html><body>tokenofpage</body></html>");
  for (const std::string& path : {folder + "/plain.txt", folder + "/page.html", folder}) {
    ASSERT_EQ(chown(path.c_str(), kSomebody, kSomebody), 0);
    ASSERT_EQ(chmod(path.c_str(), path == folder ? 0700 : 0600), 0);
  }
  EXPECT_TRUE(stack.AwaitQuiet());
  EXPECT_TRUE(stack.IsFound("tokenofplain"));
  EXPECT_TRUE(stack.IsFound("tokenofpage"));
  // It is watched as well, not read once.
  WriteText(folder + "/plain.txt", "tokenofchange");
  EXPECT_TRUE(stack.AwaitQuiet());
  EXPECT_TRUE(stack.IsFound("tokenofchange"));
}

TEST(Rights, OthersFindWhatTheyMayReadAndDoNothingElse) {
  if (geteuid() != 0) {
    GTEST_SKIP() << "only root can start processes of other users";
  }
  Stack stack(kRoot);
  ASSERT_EQ(chmod(kRoot.Path().c_str(), 0755), 0);
  // As an installation has them: a folder of everybody's, and in it what is one user's alone.
  WriteText(stack.In() + "/open.txt", "lighthouse for all");
  WriteText(stack.In() + "/theirs.txt", "lighthouse of one");
  WriteText(stack.In() + "/roots.txt", "lighthouse of root");
  ASSERT_EQ(chown((stack.In() + "/theirs.txt").c_str(), kSomebody, kSomebody), 0);
  ASSERT_EQ(chmod((stack.In() + "/theirs.txt").c_str(), 0600), 0);
  ASSERT_EQ(chmod((stack.In() + "/roots.txt").c_str(), 0600), 0);
  ASSERT_TRUE(stack.AwaitQuiet());
  const std::string search = R"({"command":"search","data":{"words":"lighthouse","snippet":true}})";
  const auto hear = [&](uid_t uid, const std::string& socket, const std::string& request) {
    return HearAs(uid, [&] { return Ask(kRoot / ("var/run/" + socket + ".sock"), request); });
  };
  const auto finds = [&](uid_t uid) {
    Json::Value reply;
    EXPECT_TRUE(vexlo::JsonFromString(reply, hear(uid, "kavoelasticd.search", search)));
    std::string names;
    for (const Json::Value& hit : reply["data"]) {
      EXPECT_NE(hit["snippet"].asString().find("lighthouse"), std::string::npos);
      names += hit["name"].asString() + " ";
    }
    return names + reply["total"].asString();
  };
  EXPECT_EQ(finds(kSomebody + 10), "open.txt 1");
  EXPECT_EQ(finds(kSomebody), "open.txt theirs.txt 2");
  const struct {
    const char* socket;
    const char* request;
    const char* reply;  // Part of it.
  } rows[] = {
      {"kavoelasticd", R"({"command":"index_list","data":{}})", "<failed>"},
      {"fileindexd", R"({"type":"pause","data":{"resume_time":0}})", "<failed>"},
      {"evnotifyd", R"({"command":"stats"})", "<failed>"},
      {"kavocontentextractd", R"({"command":"stats"})", "<failed>"},
      {"kavoelasticd.search", R"({"command":"index_delete","data":{"id":"fileindex_docs"}})",
       "only searches are answered here"},
  };
  for (const auto& row : rows) {
    EXPECT_NE(hear(kSomebody, row.socket, row.request).find(row.reply), std::string::npos)
        << row.socket << " " << row.request;
  }
  const std::string counted = hear(0, "kavoelasticd", R"({"command":"stats"})");
  EXPECT_NE(counted.find(R"("errors":{"2000":1})"), std::string::npos) << counted;  // The last.
  const auto tool = [&](const std::string& arguments) {
    return HearAs(kSomebody + 10, [&arguments] {
      Program program("cd /", FILEINDEX_PROGRAM " " + arguments + " 2>&1");
      const int status = program.End();
      return program.text + std::to_string(status);
    });
  };
  const auto reaches_tool = [] { return access(FILEINDEX_PROGRAM, X_OK) == 0 ? "yes" : "no"; };
  if (HearAs(kSomebody + 10, reaches_tool) == "yes") {
    EXPECT_EQ(tool("search lighthouse --limit 20000"), stack.In() + "/open.txt\n0");
    // What runs is not said to be down, and no probe has it started again.
    for (const char* const arguments : {"status", "status --all", "index list", "health"}) {
      const std::string told = tool(arguments);
      EXPECT_NE(told.find("closed to this user"), std::string::npos) << told;
      EXPECT_EQ(told.find("does not"), std::string::npos) << told;
    }
    EXPECT_EQ(tool("health").back(), '3');
    EXPECT_EQ(stack.Tool("resume"), 0);
    EXPECT_NE(tool("resume").find("not the rights for it; root has (error 503)"),
              std::string::npos);
  }
}

}  // namespace
