#include "kavo/sock_connection.h"

#include <signal.h>
#include <sys/resource.h>
#include <sys/time.h>

#include <thread>

#include "support/raw_client.h"
#include "support/temp_folder.h"

namespace {

using kavodaemon::DomainSockConnection;

constexpr int kTimeout = 864000;
constexpr uint64_t kMost = uint64_t{1} << 30;

struct PeerCase {
  const char* name;
  std::string request;
  bool reads;  // Whether the peer reads the request.
  std::string answer;
  bool byte_by_byte;
  int error;  // 0: the answer's body is received, and what stands behind it is not.
};

std::string AnyBytes(size_t size) {
  std::string bytes(size, '\0');
  for (size_t i = 0; i < size; ++i) {
    bytes[i] = static_cast<char>(i * 7 + i / 251);
  }
  return bytes;
}

TEST(SockConnectionTest, BearsWhatThePeerDoes) {
  const PeerCase cases[] = {
      {"Whole", "request", true, Frame("reply"), false, 0},
      {"ByteByByte", AnyBytes(3000000), true, Frame(AnyBytes(3000)), true, 0},
      {"Nothing", "", true, Frame(""), false, 0},
      {"Large", AnyBytes(1), true, Frame(AnyBytes(3000000)), false, 0},
      {"MoreThanWasAsked", "r", true, Frame("reply") + "more", false, 0},
      {"ClosesAtOnce", "r", true, "", false, ECONNRESET},
      {"ClosesInTheLength", "r", true, LengthBytes(5).substr(0, 7), false, ECONNRESET},
      {"ClosesInTheBody", "r", true, LengthBytes(5) + "repl", true, ECONNRESET},
      {"LiesAboutTheLength", "r", true, LengthBytes(kMost) + "reply", false, ECONNRESET},
      {"TooLong", "r", true, LengthBytes(kMost + 1), false, EMSGSIZE},
      {"Garbage", "r", true, std::string(64, '\xFF'), false, EMSGSIZE},
      {"NeverReads", AnyBytes(3000000), false, "", false, EPIPE},
  };
  const TempFolder folder;
  const int listener = BindTo(folder / "s", 10);
  // Interrupts whatever the connection waits in.
  struct sigaction action {};
  action.sa_handler = [](int) {};
  sigaction(SIGALRM, &action, nullptr);
  const struct itimerval often {
    {0, 200}, { 0, 200 }
  };
  for (const PeerCase& row : cases) {
    SCOPED_TRACE(row.name);
    std::string read;
    sigset_t alarm;
    sigemptyset(&alarm);
    sigaddset(&alarm, SIGALRM);
    pthread_sigmask(SIG_BLOCK, &alarm, nullptr);  // In the thread only.
    std::thread peer([&] {
      const RawClient client(accept(listener, nullptr, nullptr));
      read = row.reads ? client.Receive(Frame(row.request).size()) : Frame(row.request);
      for (size_t at = 0; at < row.answer.size();) {
        const size_t step = row.byte_by_byte ? 1 : row.answer.size();
        client.Send(row.answer.substr(at, step));
        at += step;
      }
    });
    pthread_sigmask(SIG_UNBLOCK, &alarm, nullptr);
    setitimer(ITIMER_REAL, &often, nullptr);
    struct rusage before {};
    struct rusage after {};
    getrusage(RUSAGE_SELF, &before);
    DomainSockConnection connection(folder / "s");
    std::string reply = "before";
    ASSERT_TRUE(connection.Connect(kTimeout)) << strerror(errno);
    errno = 0;
    const bool done = connection.Send(row.request) && connection.Recv(reply);
    const int error = errno;
    getrusage(RUSAGE_SELF, &after);
    EXPECT_EQ(done, row.error == 0) << strerror(error);
    // The kernel may say either of a peer that closes.
    EXPECT_TRUE(done || error == row.error || (row.error == EPIPE && error == ECONNRESET))
        << strerror(error);
    EXPECT_TRUE(!done || row.answer.starts_with(Frame(reply)));
    EXPECT_LT(after.ru_maxrss - before.ru_maxrss, 200 * 1024);
    const struct itimerval never {};
    setitimer(ITIMER_REAL, &never, nullptr);
    peer.join();
    EXPECT_TRUE(read == Frame(row.request));
  }
  close(listener);
}

TEST(SockConnectionTest, ConnectFailsAtOnceWithTheReason) {
  const TempFolder folder;
  const std::string longest = folder / std::string(106 - folder.Path().size(), 'x');
  const int good = BindTo(longest, 1);
  const int bound = BindTo(folder / "bound", -1);
  const int full = BindTo(folder / "full", 0);
  const RawClient first(folder / "full");
  const struct {
    const char* name;
    std::string path;
    int error;
  } cases[] = {
      {"Longest", longest, 0},
      {"TooLong", longest + "x", ENAMETOOLONG},
      {"Missing", folder / "missing", ENOENT},
      {"Empty", "", ENOENT},
      {"HoldsANul", (folder / "bound") + '\0' + "x", ENOENT},
      {"Refused", folder / "bound", ECONNREFUSED},
      {"Busy", folder / "full", ETIMEDOUT},
  };
  for (const auto& row : cases) {
    SCOPED_TRACE(row.name);
    DomainSockConnection connection(row.path);
    errno = 0;
    EXPECT_EQ(connection.Connect(row.error == ETIMEDOUT ? 0 : kTimeout), row.error == 0);
    EXPECT_EQ(errno, row.error);
    std::string reply = "before";
    EXPECT_TRUE(row.error == 0 || (!connection.Send("request") && errno == ENOTCONN));
    EXPECT_TRUE(row.error == 0 || (!connection.Recv(reply) && errno == ENOTCONN && reply.empty()));
  }
  for (const int fd : {good, bound, full}) {
    close(fd);
  }
}

}  // namespace
