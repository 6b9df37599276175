// The status file, and the command channel that a pause goes out on.
#include "fileindex/status_mgr.h"

#include <sys/wait.h>

#include <csignal>
#include <optional>
#include <thread>

#include "common/json.h"
#include "common/lock.h"
#include "fileindex/caught.h"
#include "fileindex/communication.h"
#include "support/fake_engine.h"
#include "support/faults.h"
#include "support/private_root.h"

using std::to_string;
using vexlo::fileindex::SendCommandToDaemon;
using vexlo::fileindex::StatusMgr;

namespace {

const PrivateRoot kRoot;
const std::string kFolder = kRoot.MakeFolder("var/packages/Vexlo/etc");
const std::string kFile = kFolder + "/fileindex.status";
const std::string kLockFile = kRoot.MakeFolder("tmp") + "/vexlo_cfg_fi_status.lock";
const std::string kSocketFile = kRoot.MakeFolder("var/run") + "/fileindexd.sock";
std::vector<unsigned> waits;  // In milliseconds, and a thousandth as long.
std::function<void()> on_wait = [] {
  std::this_thread::sleep_for(std::chrono::microseconds(waits.back()));
};
int interruptions = 0;  // So many writes are cut short.

int Wait(unsigned milliseconds) { return waits.push_back(milliseconds), on_wait(), 0; }

}  // namespace

INTERPOSED ssize_t write(int fd, const void* data, size_t size) {
  static const auto real = REAL_FUNCTION(ssize_t, write, (int, const void*, size_t));
  const bool interrupted = interruptions > 0 && --interruptions >= 0;
  errno = interrupted ? EINTR : errno;
  return interrupted ? -1 : real(fd, data, size);
}
INTERPOSED time_t time(time_t* /*copy*/) { return 2000000000; }
INTERPOSED unsigned sleep(unsigned seconds) { return Wait(seconds * 1000); }
INTERPOSED int usleep(useconds_t microseconds) { return Wait(microseconds / 1000); }

namespace {

// As Caught(), and the text that a wait was broken off with.
using Act = std::function<void(StatusMgr&)>;
std::string Outcome(const Act& act) {
  try {
    return Caught([&] {
      StatusMgr manager;
      act(manager);
    });
  } catch (const char* text) {
    return text;
  }
}
const Act kSet = [](StatusMgr& manager) { manager.SetShareStatus("\xE9", 5); };
const Act kUnset = [](StatusMgr& manager) { manager.UnsetShareStatus("\xE9", 3); };
const Act kClear = [](StatusMgr& manager) { manager.ClearShareStatus("\xE9"); };
const Act kResume = &StatusMgr::Resume;
Act Pause(int hours, const std::string& lock_path = kLockFile + "2") {
  return [=](StatusMgr& manager) {
    const vexlo::LockFile lock(lock_path, /*exclusive=*/true);
    manager.Pause(hours);
  };
}
Json::Value Parsed(const std::string& text) {
  Json::Value value;
  return vexlo::JsonFromString(value, text) ? value : text;
}

TEST(StatusMgr, ChangesTheFileAndTellsTheDaemon) {
  struct Row {
    const char* name;
    Act act;
    std::string before, want;  // The file, "" for none, with ' for ".
    std::string code = {}, want_sent = {};
  };
  const auto pause = [](const std::string& instant) {
    return R"({"data":{"resume_time":)" + instant + R"(},"type":"pause"})" + '\0';
  };
  const std::string resume = R"({"data":null,"type":"resume"})" + std::string(1, '\0');
  for (const Row& row : {
           Row{"SetFirst", kSet, "", "{'share':{'\xE9':5}}"},
           Row{"SetAdds", kSet, "{'x':1,'share':{'\xE9':2}}", "{'x':1,'share':{'\xE9':7}}"},
           Row{"Unset", kUnset, "{'share':{'\xE9':4294967295}}", "{'share':{'\xE9':4294967292}}"},
           Row{"Clear", kClear, "{'share':{'a':1,'\xE9':2}}", "{'share':{'a':1}}"},
           Row{"NoObject", kSet, "[1]", "[1]", "120"},
           Row{"SharesAreNoObject", kClear, "{'share':[]}", "{'share':[]}", "120"},
           Row{"NoJson", kSet, "7 {", "7 {", "504"},
           Row{"Pause", Pause(2), "{'a':1}", "{'a':1,'resume_time':2000007200}", "",
               pause("2000007200")},
           Row{"Wraps", Pause(600000), "", "{'resume_time':-134967296}", "", pause("-134967296")},
           Row{"Negative", Pause(-1), "{}", "{}", "120"},
           Row{"NegativeUnderLock", Pause(-1, kLockFile), "{}", "{}", "506"},
           Row{"Resume", kResume, "{'resume_time':0}", "{'resume_time':-1}", "", resume},
       }) {
    SCOPED_TRACE(row.name);
    std::string before = row.before, want = row.want;
    std::replace(before.begin(), before.end(), '\'', '"');
    std::replace(want.begin(), want.end(), '\'', '"');
    before.empty() ? void(unlink(kFile.c_str())) : WriteText(kFile, before);
    FakeEngine daemon(kSocketFile);
    EXPECT_EQ(Outcome(row.act).substr(0, 3), row.code);
    EXPECT_EQ(Parsed(ReadText(kFile)), Parsed(want));
    EXPECT_EQ(daemon.Take(),
              std::vector<std::string>(row.want_sent.empty() ? 0 : 1, row.want_sent));
  }
}

TEST(StatusMgr, SavesWhatItRead) {
  unlink(kFile.c_str());
  StatusMgr first, second;
  EXPECT_EQ(first.GetPauseInfo() + first.GetShareStatus("a"), -1);
  first.SetShareStatus("b", 2);
  second.SetShareStatus("b", 1);
  EXPECT_EQ(Outcome(kResume).substr(0, 3), "502");  // Without a daemon the change stays.
  const std::string text = ReadText(kFile);
  EXPECT_EQ(Parsed(text), Parsed(R"({"resume_time":-1,"share":{"b":1}})"));
}

TEST(StatusMgr, IsWholeAtEveryMomentAmongManyWriters) {
  const FakeEngine daemon(kSocketFile);
  for (int writer = 0; writer < 16; ++writer) {
    if (fork() == 0) {
      const Act set = [=](StatusMgr& manager) { manager.SetShareStatus(to_string(writer), 1); };
      const Act acts[] = {set, Pause(1, kLockFile + to_string(writer)), kResume};
      std::string error;
      for (int i = 0; i < 24 && error.empty(); i += error.empty() ? 1 : 0) {
        error = Outcome(acts[i % 3]);
        error = error.starts_with("506 Exceed") ? "" : error;  // The lock is in demand.
      }
      _exit(error.empty() ? 0 : 1);
    }
  }
  int status = 0;
  for (pid_t ended = 0; ended >= 0; ended = waitpid(-1, &status, WNOHANG)) {
    EXPECT_EQ(status, 0);
    EXPECT_EQ(Outcome([](StatusMgr& manager) { manager.GetShareStatus("0"); }), "");
  }
  EXPECT_EQ(StatusMgr().GetPauseInfo(), -1);  // Each of them resumed last.
  EXPECT_EQ(std::filesystem::status(kFile).permissions(), std::filesystem::perms{0644});
}

TEST(SendCommandToDaemon, TellsWhetherTheDaemonTookIt) {
  constexpr int kNever = -1, kStale = -2;  // A socket that nobody listens on.
  const std::vector<unsigned> growing = {1, 2, 4, 8, 16, 32, 64, 100, 100};
  const std::string nobody = "502 write failed, reason=Transport endpoint is not connected";
  const std::string cut = "502 write failed, reason=Interrupted system call";
  struct Row {
    const char* name;
    int listens_after;  // Waits, or one of the two above.
    std::deque<std::string> replies;
    std::string want;
    std::vector<unsigned> want_waits = {};
    int cuts = 0;
  };
  WriteText(kFile, "{}");
  const auto send = [](StatusMgr&) { SendCommandToDaemon("x", std::string(1 << 20, 'x')); };
  for (const Row& row : {
           Row{"Absent", kNever, {}, nobody, {1000, 1000, 1000, 1000}},
           Row{"Stale", kStale, {}, nobody},
           Row{"AtTheLastTry", 4, {}, "", {1000, 1000, 1000, 1000}},
           Row{"ClosesUnasked", 0, {""}, "broken off", growing},
           Row{"TenInterruptions", 0, {}, "", {}, 10},
           Row{"Eleven", 0, {}, cut, {}, 11},
       }) {
    SCOPED_TRACE(row.name);
    std::optional<FakeEngine> daemon;
    on_wait = [&] {
      if (static_cast<int>(waits.size()) == row.listens_after) {
        daemon.emplace(kSocketFile).Script(row.replies);
      } else if (waits.size() == growing.size()) {
        throw "broken off";
      }
    };
    row.listens_after == kStale ? WriteText(kSocketFile, "") : void(unlink(kSocketFile.c_str()));
    waits.clear();
    on_wait();
    interruptions = row.cuts;
    EXPECT_EQ(Outcome(send), row.want);
    EXPECT_EQ(waits, row.want_waits);
  }
  const RawClient deaf(UnixSocket(kSocketFile, SOCK_STREAM, bind));
  ASSERT_EQ(listen(deaf.fd, 1), 0);
  EXPECT_EQ(Outcome(send), "502 write failed, reason=Resource temporarily unavailable");
  // A length is no reason to take memory.
  waits.clear();
  std::thread liar([&deaf] {
    for (int i = 0; i < 2; ++i) {  // The one before is waiting still.
      const RawClient client(accept(deaf.fd, nullptr, nullptr));
      client.Receive(Frame(R"({"data":null,"type":"x"})" + std::string(1, '\0')).size());
      client.Send(std::string("\0\0\0\0\0\0\0\x80yes", 11));
    }
  });
  EXPECT_EQ(Outcome([](StatusMgr&) { SendCommandToDaemon("x", Json::Value()); }), "broken off");
  liar.join();
  EXPECT_EQ(signal(SIGPIPE, SIG_DFL), SIG_IGN);
}

}  // namespace
