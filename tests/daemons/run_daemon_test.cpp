// A daemon as a service manager or a person runs it: a program around RunDaemon().
#include "daemons/common/run_daemon.h"

#include <filesystem>

#include "kavo/local/shares.h"
#include "support/program.h"
#include "support/raw_client.h"
#include "support/temp_folder.h"

namespace vexlo::daemon {
namespace {

class RunDaemonTest : public testing::Test {
 protected:
  void SetUp() override {
    if (kavo::local::Root().empty()) {
      GTEST_SKIP() << "this build's paths are the system's own";
    }
  }

  Program Start(const std::string& arguments = "", const std::string& settings = "") const {
    return {"export FILEINDEX_ROOT=" + folder_.Path() + settings,
            ECHO_ENGINE " " + arguments + " 2>&1"};
  }
  std::string Ask(const std::string& request) const { return ::Ask(socket_, request); }
  std::set<std::string> Left() const {
    std::set<std::string> names;
    for (const auto& entry : std::filesystem::directory_iterator(folder_ / "var/run")) {
      names.insert(entry.path().filename());
    }
    return names;
  }

  const TempFolder folder_;
  const std::string socket_ = folder_ / "var/run/kavoelasticd.sock";
};

TEST_F(RunDaemonTest, EndsWithTheStatusThatSaysWhy) {
  const struct {
    const char* name;
    const char* arguments;
    int status;
    std::string says;
    const char* settings = "";
  } cases[] = {
      {"Usage", "--nope", kUsage, "usage: kavoelasticd [throw|stuck]\n"},
      {"WorkThrows", "throw", kFailed, "failed: as asked\n"},
      {"WorkIsStuck", "stuck", kFailed, "ended at once: as asked\n"},
      {"RelativeRoot", "", kFailed,
       "FILEINDEX_ROOT in the environment is no absolute path: 'var'\n", " FILEINDEX_ROOT=var"},
  };
  for (const auto& row : cases) {
    SCOPED_TRACE(row.name);
    Program program = Start(row.arguments, row.settings);
    EXPECT_EQ(program.End(), row.status);
    EXPECT_NE(program.text.find(row.says), std::string::npos) << program.text;
  }
  EXPECT_EQ(Left(), std::set<std::string>{});
}

TEST_F(RunDaemonTest, ServesUntilItIsAskedToEnd) {
  const RawClient manager(UnixSocket(folder_ / "notify", SOCK_DGRAM, bind));
  Program program = Start("", " WATCHDOG_USEC=100000 NOTIFY_SOCKET=" + (folder_ / "notify"));
  ASSERT_TRUE(program.Await("ready\n")) << program.text;
  EXPECT_EQ(manager.Receive(1), "R");  // The rest of a datagram is lost.
  EXPECT_EQ(manager.Receive(1) + manager.Receive(1), "WW") << "two signs of life";
  const std::string pid_file = folder_ / "var/run/kavoelasticd.pid";
  EXPECT_EQ(ReadText(pid_file), std::to_string(program.pid) + "\n");

  const std::pair<std::string, std::string> cases[] = {
      {"{\"name\":\"\xE9\"}", "{\"name\":\"\xE9\"}"},
      {"{} {}", R"({"error":{"code":120,"msg":"the request is no JSON object"},"success":false})"},
      {R"({"throw":1})", R"({"error":{"code":9999,)"},
  };
  for (const auto& [request, reply] : cases) {
    EXPECT_TRUE(Ask(request).starts_with(reply)) << Ask(request);
  }
  EXPECT_EQ(RawClient(socket_, std::string(8, '\xFF')).Receive(31).substr(8),
            R"({"error":{"code":120,"m)");

  Program second = Start();
  EXPECT_EQ(second.End(), kAlreadyRunning);
  EXPECT_NE(second.text.find("already running, pid " + std::to_string(program.pid) + " holds " +
                             pid_file),
            std::string::npos)
      << second.text;
  kill(program.pid, SIGPIPE);
  kill(program.pid, SIGHUP);
  EXPECT_TRUE(program.Await("reloading failed: no settings\n"));
  EXPECT_EQ(Ask("{}"), "{}") << "the first one goes on";

  EXPECT_EQ(program.End(SIGTERM), kEnded);
  std::string last;
  do {
    last = manager.Receive(1);
  } while (last == "W");
  EXPECT_EQ(last, "S");
  EXPECT_EQ(Left(), std::set<std::string>{});
}

}  // namespace
}  // namespace vexlo::daemon
