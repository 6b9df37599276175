#include "kavo/sock_connection.h"

#include <signal.h>
#include <sys/resource.h>
#include <sys/time.h>

#include <cerrno>
#include <thread>

#include "support/raw_client.h"
#include "support/temp_folder.h"

namespace {

using kavodaemon::DomainSockConnection;

constexpr uint64_t kMost = uint64_t{1} << 30;

struct PeerCase {
  const char* name;
  std::string request;
  std::string answer;
  // 0: the answer's body is received, and what stands behind it is not.
  int error = 0;
  // How the answer is sent; deaf: not at all, and the request is not read either.
  enum { kWhole, kByByte, kDeaf } way = kWhole;
};

TEST(SockConnectionTest, BearsWhatThePeerDoes) {
  const std::string large = std::string("\0\xFF\n", 3) + std::string(3000000, 'x');
  const PeerCase cases[] = {
      {"ByteByByte", large, Frame(large.substr(0, 3000)), 0, PeerCase::kByByte},
      {"Empty", "", Frame("")},
      {"ClosesInTheBody", "r", LengthBytes(5) + "repl", ECONNRESET, PeerCase::kByByte},
      {"LiesAboutTheLength", "r", LengthBytes(kMost) + "reply", ECONNRESET},
      {"TooLong", "r", LengthBytes(kMost + 1), EMSGSIZE},
      {"NeverReads", large, "", EPIPE, PeerCase::kDeaf},
  };
  const TempFolder folder;
  const RawClient listener(UnixSocket(folder / "s", SOCK_STREAM, bind));
  listen(listener.fd, 1);
  // Interrupts whatever the connection waits in; the peer's thread has the signal blocked.
  struct sigaction action {};
  action.sa_handler = [](int) {};
  sigaction(SIGALRM, &action, nullptr);
  sigset_t alarm;
  sigemptyset(&alarm);
  sigaddset(&alarm, SIGALRM);
  for (const PeerCase& row : cases) {
    SCOPED_TRACE(row.name);
    std::string read;
    pthread_sigmask(SIG_BLOCK, &alarm, nullptr);
    std::thread peer([&] {
      const RawClient client(accept(listener.fd, nullptr, nullptr));
      const size_t step = row.way == PeerCase::kByByte ? 1 : SIZE_MAX;
      read = row.way == PeerCase::kDeaf ? Frame(row.request)
                                        : client.Receive(Frame(row.request).size());
      for (size_t at = 0; at < row.answer.size(); at += std::min(step, row.answer.size())) {
        client.Send(row.answer.substr(at, step));
      }
    });
    struct itimerval interval {
      {0, 200}, { 0, 200 }
    };
    setitimer(ITIMER_REAL, &interval, nullptr);
    pthread_sigmask(SIG_UNBLOCK, &alarm, nullptr);
    DomainSockConnection connection(folder / "s");
    std::string reply = "before";
    EXPECT_TRUE(connection.Connect(864000)) << strerror(errno);
    errno = 0;
    const bool done = connection.Send(row.request) && connection.Recv(reply);
    // The kernel may say either of a peer that closes.
    const int error = row.error == EPIPE && errno == ECONNRESET ? EPIPE : errno;
    EXPECT_TRUE(done ? row.error == 0 : error == row.error) << strerror(error);
    EXPECT_TRUE(!done || row.answer.starts_with(Frame(reply)));
    interval = {};
    setitimer(ITIMER_REAL, &interval, nullptr);
    peer.join();
    EXPECT_TRUE(read == Frame(row.request));
  }
  struct rusage used {};
  getrusage(RUSAGE_SELF, &used);
  EXPECT_LT(used.ru_maxrss, 400 * 1024) << "in KiB: a length is no reason to take memory";
}

TEST(SockConnectionTest, ConnectFailsAtOnceWithTheReason) {
  const TempFolder folder;
  const std::string longest = folder / std::string(106 - folder.Path().size(), 'x');
  const RawClient good(UnixSocket(longest, SOCK_STREAM, bind));
  const RawClient bound(UnixSocket(folder / "bound", SOCK_STREAM, bind));
  const RawClient full(UnixSocket(folder / "full", SOCK_STREAM, bind));
  ASSERT_TRUE(listen(good.fd, 1) == 0 && listen(full.fd, 0) == 0);
  const RawClient first(folder / "full");
  const std::pair<std::string, int> cases[] = {
      {longest, 0}, {longest + "x", ENAMETOOLONG},    {folder / "missing", ENOENT},
      {"", ENOENT}, {folder / "bound", ECONNREFUSED}, {folder / "full", ETIMEDOUT},
  };
  for (const auto& [path, error] : cases) {
    SCOPED_TRACE(path);
    DomainSockConnection connection(path);
    errno = 0;
    EXPECT_EQ(connection.Connect(error == ETIMEDOUT ? 0 : 864000), error == 0);
    EXPECT_EQ(errno, error);
    std::string reply;
    EXPECT_TRUE(error == 0 || (!connection.Send("r") && !connection.Recv(reply)));
  }
}

}  // namespace
