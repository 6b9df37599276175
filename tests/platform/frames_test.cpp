#include "kavo/local/frames.h"

#include <fcntl.h>
#include <sys/stat.h>

#include <cerrno>
#include <filesystem>
#include <thread>

#include "support/raw_client.h"
#include "support/temp_folder.h"

namespace kavo::local {
namespace {

using std::chrono::milliseconds;

Deadline In(int ms) { return std::chrono::steady_clock::now() + milliseconds(ms); }

std::pair<RawClient, RawClient> Pair() {
  int ends[2] = {};
  EXPECT_EQ(socketpair(AF_UNIX, SOCK_STREAM, 0, ends), 0);
  return {RawClient(ends[0]), RawClient(ends[1])};
}

auto OpenFiles() { return std::distance(std::filesystem::directory_iterator("/proc/self/fd"), {}); }

TEST(Frames, CarryAFile) {
  const TempFolder folder;
  WriteText(folder / "file", "content");
  const RawClient file(open((folder / "file").c_str(), O_RDONLY));
  const auto before = OpenFiles();
  {
    const auto [here, there] = Pair();
    const std::string long_body(1 << 20, 'x');
    std::string body;
    int received = -1;
    std::thread sender(
        [&, to = there.fd] { EXPECT_TRUE(SendFrame(to, long_body, file.fd, In(30000))); });
    EXPECT_TRUE(ReceiveFrame(here.fd, 1 << 20, body, &received, In(30000)));
    sender.join();
    EXPECT_TRUE(body == long_body);
    struct stat sent {};
    struct stat got {};
    EXPECT_TRUE(fstat(file.fd, &sent) == 0 && fstat(received, &got) == 0);
    EXPECT_EQ(sent.st_ino, got.st_ino);
    EXPECT_EQ(fcntl(received, F_GETFD), FD_CLOEXEC);
    close(received);

    // One that nobody wants, and one of a message that fails.
    EXPECT_TRUE(SendFrame(there.fd, "a", file.fd, In(30000)));
    EXPECT_TRUE(ReceiveFrame(here.fd, 1, body, nullptr, In(30000)));
    EXPECT_TRUE(SendFrame(there.fd, "ab", file.fd, In(30000)));
    EXPECT_FALSE(ReceiveFrame(here.fd, 1, body, &received, In(30000)));
    EXPECT_EQ(errno, EMSGSIZE);
  }
  EXPECT_EQ(OpenFiles(), before);
}

TEST(Frames, GiveUpOnAPeerThatIsSilentOrDoesNotRead) {
  const auto [here, there] = Pair();
  std::string body;
  EXPECT_TRUE(there.Send(Frame("abc").substr(0, 10)));
  EXPECT_FALSE(ReceiveFrame(here.fd, 100, body, nullptr, In(50)));
  EXPECT_EQ(errno, ETIMEDOUT);
  EXPECT_FALSE(SendFrame(there.fd, std::string(16 << 20, 'x'), -1, In(50)));
  EXPECT_EQ(errno, ETIMEDOUT);
  EXPECT_LT(ConnectWithin("", In(50)), 0);
  EXPECT_EQ(errno, ENOENT);
  EXPECT_LT(ConnectWithin(std::string(200, 'x'), In(50)), 0);
  EXPECT_EQ(errno, ENAMETOOLONG);
}

}  // namespace
}  // namespace kavo::local
