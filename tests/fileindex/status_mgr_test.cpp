#include "fileindex/status_mgr.h"

#include <sys/wait.h>

#include <ctime>
#include <optional>

#include "common/error.h"
#include "common/json.h"
#include "common/lock.h"
#include "fileindex/paths.h"
#include "support/fake_daemon.h"
#include "support/faults.h"
#include "support/private_root.h"
#include "support/syslog_capture.h"

using namespace vexlo::fileindex;

namespace {

const PrivateRoot root;
const std::string folder = root.MakeFolder("var/packages/Vexlo/etc");
const std::string file = folder + "/fileindex.status";
const std::string lock_file = root.MakeFolder("tmp") + "/vexlo_cfg_fi_status.lock";
const std::string sockets = root.MakeFolder("var/run");

}  // namespace

FAULTABLE(ssize_t, write, (int fd, const void* data, size_t size), (fd, data, size))
FAULTABLE(int, fsync, (int fd), (fd))
FAULTABLE(int, rename, (const char* from, const char* to), (from, to))
FAULTABLE(int, chmod, (const char* path, mode_t mode), (path, mode))
INTERPOSED unsigned sleep(unsigned /*seconds*/) { return 0; }
INTERPOSED int usleep(useconds_t microseconds) {  // A thousandth as long.
  const timespec pause{0, static_cast<long>(microseconds)};
  return nanosleep(&pause, nullptr);
}

namespace {

Json::Value Parsed(const std::string& text) {
  Json::Value value;
  EXPECT_TRUE(vexlo::JsonFromString(value, text)) << text;
  return value;
}

// What is thrown, 0 for nothing.
int CodeOf(const std::function<void(StatusMgr&)>& act) {
  try {
    StatusMgr manager;
    act(manager);
    return 0;
  } catch (const vexlo::Error& error) {
    return error.GetErrorCode();
  }
}

struct Case {
  const char* name;
  std::function<void(StatusMgr&)> act;
  std::string before, want;  // The file, "" for none; with NOW for the instant of the pause.
  int code = 0;
  std::string want_command = "";  // As the daemon gets it.
  long want_now = 0;              // Seconds from now to that instant.
};

TEST(StatusMgr, ChangesTheFileAndTellsTheDaemon) {
  const auto set = [](StatusMgr& manager) { manager.SetShareStatus("\xE9", 5); };
  const auto unset = [](StatusMgr& manager) { manager.UnsetShareStatus("\xE9", 3); };
  const auto clear = [](StatusMgr& manager) { manager.ClearShareStatus("\xE9"); };
  const auto resume = [](StatusMgr& manager) { manager.Resume(); };
  const auto pause = [](int hours) { return [=](StatusMgr& manager) { manager.Pause(hours); }; };
  const auto locked = [](StatusMgr& manager) {
    const vexlo::LockFile lock(lock_file, /*exclusive=*/true);
    manager.Pause(-1);
  };
  const std::string tell = R"({"data":{"resume_time":NOW},"type":"pause"})";
  const Case cases[] = {
      {"SetFirst", set, "", "{\"share\":{\"\xE9\":5}}"},
      {"SetOnNull", set, "null", "{\"share\":{\"\xE9\":5}}"},
      {"SetAddsBits", set, "{\"new\":1,\"share\":{\"a\":1,\"\xE9\":2}}",
       "{\"new\":1,\"share\":{\"a\":1,\"\xE9\":7}}"},
      {"SetOverAnotherType", set, "{\"share\":{\"\xE9\":\"x\"}}", "{\"share\":{\"\xE9\":5}}"},
      {"Unset", unset, "{\"share\":{\"\xE9\":4294967295}}", "{\"share\":{\"\xE9\":4294967292}}"},
      {"UnsetWithoutWord", unset, "{\"share\":null}", "{\"share\":{\"\xE9\":0}}"},
      {"Clear", clear, "{\"share\":{\"a\":1,\"\xE9\":2}}", "{\"share\":{\"a\":1}}"},
      {"ClearWithoutShares", clear, "", "{}"},
      {"NoObject", set, "[1]", "[1]", 120},
      {"PauseOfNoObject", pause(0), "[1]", "[1]", 120},
      {"SharesAreNoObject", clear, "{\"share\":[]}", "{\"share\":[]}", 120},
      {"NoJson", set, "7 {", "7 {", 504},
      {"Pause", pause(2), "{\"a\":1}", "{\"a\":1,\"resume_time\":NOW}", 0, tell, 7200},
      {"PauseThatWraps", pause(600000), "", "{\"resume_time\":NOW}", 0, tell, -2134967296},
      {"PauseWithoutEnd", pause(0), "", "{\"resume_time\":0}", 0,
       R"({"data":{"resume_time":0},"type":"pause"})"},
      {"NegativePause", pause(-1), "{}", "{}", 120},
      {"NegativePauseUnderLock", locked, "{}", "{}", 506},
      {"Resume", resume, "{\"resume_time\":0}", "{\"resume_time\":-1}", 0,
       R"({"data":null,"type":"resume"})"},
  };
  for (const Case& row : cases) {
    SCOPED_TRACE(row.name);
    row.before.empty() ? void(unlink(file.c_str())) : WriteText(file, row.before);
    FakeDaemon daemon;
    SyslogCapture log;
    const time_t start = time(nullptr);
    EXPECT_EQ(CodeOf(row.act), row.code);
    std::string want = row.want, want_command = row.want_command;
    if (row.want_now != 0) {
      const long instant = StatusMgr().GetPauseInfo();
      EXPECT_NEAR(instant - start, row.want_now, 2);
      want.replace(want.find("NOW"), 3, std::to_string(instant));
      want_command.replace(want_command.find("NOW"), 3, std::to_string(instant));
    }
    const std::string text = ReadText(file);
    EXPECT_TRUE(row.code == 0 ? Parsed(text) == Parsed(want) : text == want) << text;
    std::vector<std::string> want_commands;
    want_command.empty() ? void() : want_commands.push_back(want_command + '\0');
    EXPECT_EQ(daemon.Stop(), want_commands);
  }
}

TEST(StatusMgr, SavesWhatItReadNotWhatOthersSaved) {
  unlink(file.c_str());
  StatusMgr a, b;
  EXPECT_EQ(a.GetPauseInfo(), -1);
  a.SetShareStatus("a", 1);
  b.SetShareStatus("b", 1);
  EXPECT_EQ(Parsed(ReadText(file)), Parsed("{\"share\":{\"b\":1}}"));
  EXPECT_EQ(CodeOf(&StatusMgr::Resume), 502);  // Without a daemon the change stands.
  EXPECT_EQ(Parsed(ReadText(file)), Parsed("{\"resume_time\":-1,\"share\":{\"b\":1}}"));
}

TEST(StatusMgr, AFailedSaveLeavesTheOldFile) {
  for (const auto& [function, code] :
       {std::pair{"write", 505}, {"fsync", 505}, {"rename", 505}, {"chmod", 502}}) {
    SCOPED_TRACE(function);
    WriteText(file, "{}");
    SyslogCapture log;
    {
      const ScopedFault fault(function, EIO);
      EXPECT_EQ(CodeOf([](StatusMgr& manager) { manager.SetShareStatus("a", 1); }), code);
    }
    EXPECT_EQ(ReadText(file) == "{}", code == 505);
    EXPECT_EQ(std::distance(std::filesystem::directory_iterator(folder), {}), 1);
  }
}

TEST(StatusMgr, IsWholeAtEveryMomentAmongManyWriters) {
  FakeDaemon daemon;
  WriteText(file, "{}");
  int running = 0;
  for (; running < 16; ++running) {
    if (const pid_t pid = fork(); pid == 0) {
      for (int i = 0; i < 24;) {
        const int code = CodeOf([&](StatusMgr& manager) {
          i % 3 == 0   ? manager.SetShareStatus(std::to_string(running), 1)
          : i % 3 == 1 ? manager.Pause(1)
                       : manager.Resume();
        });
        i += code == 0 ? 1 : 0;
        if (code != 0 && code != vexlo::ERR_LOCK) {  // Out of tries: the lock is in demand.
          _exit(1);
        }
      }
      _exit(0);
    }
  }
  for (size_t reads = 0; running > 0; ++reads) {
    EXPECT_EQ(CodeOf([](StatusMgr& manager) { manager.GetShareStatus("0"); }), 0) << reads;
    int status = 0;
    if (waitpid(-1, &status, WNOHANG) > 0) {
      EXPECT_EQ(status, 0);
      --running;
    }
  }
  EXPECT_EQ(daemon.Stop().size(), size_t{16} * 16);
  EXPECT_EQ(StatusMgr().GetPauseInfo(), -1);  // Each of them resumed last.
  EXPECT_EQ(std::filesystem::status(file).permissions(), std::filesystem::perms{0644});
}

}  // namespace
