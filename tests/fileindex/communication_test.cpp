#include "fileindex/communication.h"

#include <csignal>
#include <optional>

#include "common/error.h"
#include "common/json.h"
#include "support/fake_daemon.h"
#include "support/faults.h"
#include "support/private_root.h"
#include "support/syslog_capture.h"

using namespace vexlo::fileindex;

namespace {

const PrivateRoot root;
std::vector<unsigned> waits;           // In milliseconds.
std::function<void()> on_wait;         // Called at each.
thread_local int interruptions = 0;    // So many calls of read() and write() are cut short.
thread_local size_t most_at_once = 0;  // Of those that are not.
thread_local bool takes_bytes = true;  // Whether write() does.

int Wait(unsigned milliseconds) {
  waits.push_back(milliseconds);
  on_wait();
  return 0;
}

}  // namespace

INTERPOSED unsigned sleep(unsigned seconds) { return Wait(seconds * 1000); }
INTERPOSED int usleep(useconds_t microseconds) { return Wait(microseconds / 1000); }
FAULTABLE(int, socket, (int domain, int type, int protocol), (domain, type, protocol))
FAULTABLE(int, setsockopt, (int fd, int level, int name, const void* value, socklen_t size),
          (fd, level, name, value, size))
#define INTERRUPTIBLE(name, type)                                               \
  INTERPOSED ssize_t name(int fd, type data, size_t size) {                     \
    static const auto real = REAL_FUNCTION(ssize_t, name, (int, type, size_t)); \
    if (interruptions > 0) {                                                    \
      return --interruptions, errno = EINTR, -1;                                \
    }                                                                           \
    most_at_once = std::max(most_at_once, size);                                \
    return takes_bytes ? real(fd, data, size) : 0;                              \
  }
INTERRUPTIBLE(read, void*)
INTERRUPTIBLE(write, const void*)

namespace {

// "" or what was thrown: an Error's reason, or the text with which a wait was broken off.
std::string Caught(const std::function<void()>& act) {
  try {
    return act(), "";
  } catch (const vexlo::Error& error) {
    EXPECT_EQ(error.GetErrorCode(), vexlo::ERR_SYSTEM);
    return error.what();
  } catch (const char* text) {
    return text;
  }
}

int NextFd() {
  const int fd = dup(0);
  close(fd);
  return fd;
}

const std::string kNobody = "write failed, reason=Transport endpoint is not connected";
const std::vector<unsigned> kBackOff = {1, 2, 4, 8, 16, 32, 64, 100, 100};

constexpr int kNever = -1, kStale = -2;  // A socket that nobody listens on.

struct Case {
  const char* name;
  int listens_after;                // Waits; or one of the two above.
  std::function<void(int)> answer;  // None accepts nothing.
  const char* fault;                // The system call that fails.
  std::string want;
  std::vector<unsigned> want_waits;
  const char* want_logged;
};

TEST(SendCommandToDaemon, TellsWhetherTheDaemonTookIt) {
  root.MakeFolder("var/run");
  const auto drip = [](int fd) {
    for (const char byte : std::string("\3\0\0\0\0\0\0\0ok", 11)) {
      send(fd, &byte, 1, MSG_NOSIGNAL);
    }
  };
  const auto lie = [](int fd) { send(fd, "\0\0\0\0\0\0\0\x80yes", 11, MSG_NOSIGNAL); };
  const auto nothing = [](int) {};
  const Case cases[] = {
      {"Absent", kNever, nothing, "", kNobody, {1000, 1000, 1000, 1000}, "(BufferWrite)"},
      {"Late", 3, FakeDaemon::SendEmpty, "", "", {1000, 1000, 1000}, ""},
      {"AtTheLastTry", 4, FakeDaemon::SendEmpty, "", "", {1000, 1000, 1000, 1000}, ""},
      {"Stale", kStale, nothing, "", kNobody, {}, "(BufferWrite)"},
      {"ByteByByte", 0, drip, "", "", {}, ""},
      {"TakesNothingForASecond",
       0,
       nullptr,
       "",
       "write failed, reason=Resource temporarily unavai"
       "lable",
       {},
       "(BufferWrite)"},
      {"ClosesUnasked", 0, nothing, "", "broken off", kBackOff, ""},
      {"SaysThatItSends2To63", 0, lie, "", "broken off", kBackOff, ""},
      {"NoSocket",
       0,
       nothing,
       "socket",
       "socket failed, reason=Too many open files",
       {},
       "communication:75 "},
      {"NoTimeout",
       0,
       nothing,
       "setsockopt",
       "setsockopt failed, reason=Too many open files",
       {},
       "communication:90 "},
  };
  const std::string data(size_t{1} << 20, 'x');
  const int next_fd = NextFd();
  for (const Case& row : cases) {
    SCOPED_TRACE(row.name);
    std::optional<FakeDaemon> daemon;
    const auto listen_if_due = [&] {
      if (static_cast<int>(waits.size()) == row.listens_after) {
        daemon.emplace(row.answer);
      } else if (waits.size() == kBackOff.size()) {
        throw "broken off";
      }
    };
    on_wait = listen_if_due;
    waits.clear();
    listen_if_due();
    row.listens_after == kStale ? WriteText(root / "var/run/fileindexd.sock", "") : void();
    SyslogCapture log;
    {
      std::optional<ScopedFault> fault;
      *row.fault != '\0' ? void(fault.emplace(row.fault, EMFILE)) : void();
      EXPECT_EQ(Caught([&] { SendCommandToDaemon("pause", data); }), row.want);
    }
    EXPECT_EQ(waits, row.want_waits);
    const std::vector<std::string> lines = log.Take();
    EXPECT_EQ(lines.size(), *row.want_logged == '\0' ? 0U : 1U);
    EXPECT_TRUE(lines.empty() || lines[0].find(row.want_logged) != std::string::npos) << lines[0];
    if (row.want.empty()) {
      Json::Value want;
      want["type"] = "pause";
      want["data"] = data;
      EXPECT_EQ(daemon->Stop(), std::vector{vexlo::JsonToString(want) + '\0'});
    }
    daemon.reset();
    unlink((root / "var/run/fileindexd.sock").c_str());
  }
  EXPECT_EQ(signal(SIGPIPE, SIG_DFL), SIG_IGN);
  EXPECT_EQ(NextFd(), next_fd);  // Every socket was closed.
}

TEST(Buffers, TransferAllOrFail) {
  struct Row {
    size_t size;
    int interruptions;
    bool takes_bytes;
    std::string want_written, want_read;
  };
  const std::string interrupted = "failed, reason=Interrupted system call";
  for (const Row& row : {Row{0, 11, false, "", ""}, Row{1, 10, true, "", ""},
                         Row{1024, 0, false, "write failed, reason=Success", "broken off"},
                         Row{3000, 10, true, "", ""},
                         Row{1, 11, true, "write " + interrupted, "read " + interrupted}}) {
    SCOPED_TRACE(std::to_string(row.size) + ", " + std::to_string(row.interruptions));
    const std::unique_ptr<FILE, decltype(&fclose)> file(tmpfile(), &fclose);
    const int fd = fileno(file.get());
    const std::vector<unsigned char> data(row.size, 'x');
    std::vector<unsigned char> got(row.size);
    waits.clear();
    on_wait = [&] { waits.size() == kBackOff.size() ? throw "broken off" : 0; };
    most_at_once = 0;
    takes_bytes = row.takes_bytes;
    interruptions = row.interruptions;
    EXPECT_EQ(Caught([&] { BufferWrite(fd, row.size, data.data()); }), row.want_written);
    lseek(fd, 0, SEEK_SET);
    takes_bytes = true;
    interruptions = row.interruptions;
    if (row.want_read.empty() && row.size > 1) {  // The last byte comes late.
      EXPECT_EQ(ftruncate(fd, static_cast<off_t>(row.size - 1)), 0);
      on_wait = [&] { pwrite(fd, "x", waits.size() / 3, static_cast<off_t>(row.size - 1)); };
    }
    EXPECT_EQ(Caught([&] { BufferRead(fd, row.size, got.data()); }), row.want_read);
    EXPECT_EQ(got == data, row.want_read.empty());
    EXPECT_LE(most_at_once, 1024U);
    EXPECT_EQ(std::exchange(interruptions, 0), row.size == 0 ? 11 : 0);
  }
}

}  // namespace
