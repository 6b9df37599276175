#include "daemons/common/frame_server.h"

#include <signal.h>
#include <sys/eventfd.h>
#include <sys/stat.h>

#include <filesystem>
#include <functional>
#include <future>
#include <optional>

#include "common/error.h"
#include "support/as_user.h"
#include "support/faults.h"
#include "support/raw_client.h"
#include "support/syslog_capture.h"
#include "support/temp_folder.h"

FAULTABLE(int, accept4, (int fd, struct sockaddr* address, socklen_t* length, int flags),
          (fd, address, length, flags))

namespace vexlo::daemon {
namespace {

using std::chrono::milliseconds;

constexpr size_t kMost = 1 << 20;

class FrameServerTest : public testing::Test {
 protected:
  FrameServerTest() {
    options_.socket_path = path_;
    options_.handler = Handle;
    options_.refusal = [](Refusal refusal) {
      return "refused " + std::to_string(static_cast<int>(refusal));
    };
    options_.workers = 2;
  }
  void TearDown() override { EXPECT_TRUE(!thread_.joinable() || Stop()); }

  static std::string Handle(const std::string& request) {
    if (request == "throw") {
      throw std::runtime_error("as asked");
    }
    return request.size() < 100 ? request : std::to_string(request.size());
  }
  void Start() {
    server_.emplace(options_);
    thread_ = std::thread([this] { finished_ = server_->Run(stop_.fd); });
  }
  // Whether all handlers had ended.
  bool Stop() {
    EXPECT_EQ(eventfd_write(stop_.fd, 1), 0);
    thread_.join();
    return finished_;
  }
  std::string Ask(const std::string& request) const { return ::Ask(path_, request); }
  RawClient Sending(const std::string& bytes) const { return RawClient(path_, bytes); }

  SyslogCapture log_;
  const TempFolder folder_;
  const std::string path_ = folder_ / "s";
  const RawClient stop_{eventfd(0, 0)};
  FrameServerOptions options_;
  std::optional<FrameServer> server_;
  std::thread thread_;
  bool finished_ = false;
};

TEST_F(FrameServerTest, AnswersEachRequestOrRefusesIt) {
  Start();
  constexpr size_t kLongest = 256 << 20;
  const std::pair<std::string, std::string> cases[] = {
      {std::string(kLongest, 'x'), "268435456"},
      {std::string(kLongest + 1, 'x'), "refused 0"},
      {"throw", "refused 1"},
      {std::string("\0\xFF", 2), std::string("\0\xFF", 2)}};
  for (const auto& [request, reply] : cases) {
    const RawClient client(path_);
    EXPECT_TRUE(client.Send(Frame(request))) << "the client may send it all before it reads";
    EXPECT_EQ(client.Receive(Frame(reply).size()), Frame(reply));
  }
}

TEST_F(FrameServerTest, AsksWhoAsks) {
  if (geteuid() != 0) {
    GTEST_SKIP() << "only root can start processes of other users";
  }
  constexpr uid_t kGuest = 4711;
  constexpr uid_t kStranger = 4811;
  ASSERT_EQ(chmod(folder_.Path().c_str(), 0755), 0);
  options_.mode = 0666;
  options_.handler = nullptr;
  options_.max_connections_per_user = 3;
  options_.admits = [](const Peer& peer) { return peer.uid == kGuest; };
  options_.peer_handler = [](const std::string& request, const Peer& peer) {
    std::string text = request + " " + std::to_string(peer.uid) + " " + std::to_string(peer.gid);
    for (const gid_t group : peer.groups) {
      text += "+" + std::to_string(group);
    }
    return text;
  };
  Start();
  const auto ask = [this] { return Ask("who"); };
  const std::string refused = "refused " + std::to_string(static_cast<int>(Refusal::kNotAdmitted));
  EXPECT_TRUE(Ask("who").starts_with("who 0 0"));
  EXPECT_EQ(HearAs(kGuest, ask), "who 4711 4711+4712+4713");
  EXPECT_EQ(HearAs(kStranger, ask), refused);
  EXPECT_EQ(HearAs(kStranger, [this] { return Ask(std::string(100000, 'x')); }), refused)
      << "little is read of what will be refused";
  const auto ask_beside = [this](size_t others) {
    std::vector<RawClient> held;
    held.reserve(others);
    while (held.size() < others) {
      held.emplace_back(path_);
    }
    return Ask("who");
  };
  EXPECT_EQ(HearAs(kGuest, [&] { return ask_beside(2); }), "who 4711 4711+4712+4713");
  EXPECT_EQ(HearAs(kGuest, [&] { return ask_beside(3); }), "<failed>");
  EXPECT_TRUE(Ask("who").starts_with("who 0 0")) << "one user does not shut out another";
}

TEST_F(FrameServerTest, StalledConnectionsCostNoThread) {
  const auto threads = [] {
    return std::distance(std::filesystem::directory_iterator("/proc/self/task"), {});
  };
  Start();
  EXPECT_EQ(Ask("warm"), "warm");
  const auto before = threads();
  const std::string parts[] = {"", LengthBytes(9).substr(0, 3), LengthBytes(kMost) + "x"};
  std::vector<RawClient> stalled;
  for (int i = 0; i < 200; ++i) {
    stalled.push_back(Sending(parts[i % 3]));
    EXPECT_EQ(Ask(std::to_string(i)), std::to_string(i));
  }
  EXPECT_EQ(threads(), before);
  EXPECT_TRUE(stalled[1].Send(LengthBytes(9).substr(3) + "nine byte"));
  EXPECT_EQ(stalled[1].Receive(), Frame("nine byte"));
  EXPECT_TRUE(Stop());
  EXPECT_EQ(stalled[0].Receive() + stalled[2].Receive(), "");
}

TEST_F(FrameServerTest, ClosesWhoeverDoesNothing) {
  // Time enough for one that reads on a busy machine.
  options_.idle_timeout = milliseconds(500);
  options_.write_timeout = milliseconds(500);
  options_.handler = [](const std::string& request) {
    return request == "much" ? std::string(8 * kMost, 'y') : request;
  };
  options_.workers = 1;
  Start();
  const RawClient deaf = Sending(Frame("much"));
  const RawClient silent = Sending("");
  const RawClient half = Sending(LengthBytes(kMost) + std::string(200000, 'x'));
  const RawClient refused = Sending(std::string(8, '\xFF'));
  EXPECT_EQ(Ask("meanwhile"), "meanwhile");
  EXPECT_EQ(Ask("much").size(), 8 * kMost);
  EXPECT_EQ(silent.Receive(), "");
  EXPECT_EQ(half.Receive(), "");
  EXPECT_EQ(refused.Receive(), Frame("refused 0"));
  // A byte now and then puts nothing off.
  const RawClient trickling = Sending(LengthBytes(60000));
  while (trickling.Send("x")) {
    Ask("tick");
  }
  EXPECT_EQ(trickling.Receive(), "");
  // By now its time is over, too: only what the socket held is left.
  const std::string heard = deaf.Receive();
  EXPECT_TRUE(heard.size() > 8 && heard.size() < 8 * kMost) << heard.size();
}

TEST_F(FrameServerTest, LongRequestsWaitForMemoryAndGoOn) {
  options_.max_request_bytes = kMost;
  options_.max_total_bytes = 2 * kMost;
  Start();
  const std::string part(700000, 'x');
  const std::string rest(kMost - part.size(), 'x');
  const RawClient common = Sending(LengthBytes(kMost) + part);
  const RawClient reserve = Sending(LengthBytes(kMost) + part);
  std::vector<std::future<std::string>> others(4);
  for (std::future<std::string>& other : others) {
    other = std::async(std::launch::async, [this] { return Ask(std::string(kMost, 'x')); });
  }
  EXPECT_EQ(Ask(std::string(60000, 'x')), "60000");
  for (const RawClient* const client : {&reserve, &common}) {
    EXPECT_TRUE(client->Send(rest));
    EXPECT_EQ(client->Receive(), Frame("1048576"));
  }
  for (std::future<std::string>& other : others) {
    EXPECT_EQ(other.get(), "1048576");
  }
}

TEST(RequestMemoryTest, NeverGivesOutMoreThanThereIs) {
  RequestMemory memory(100, 40);
  RequestMemory::Share a, b, c;
  EXPECT_TRUE(memory.Take(a, 35) && memory.Take(b, 25)) << "60 in common";
  EXPECT_TRUE(memory.Take(a, 40)) << "the reserve";
  EXPECT_FALSE(memory.Take(b, 26) || memory.Take(c, 1));
  memory.GiveBack(b);
  EXPECT_TRUE(memory.Take(c, 25));
  EXPECT_FALSE(memory.Take(c, 26)) << "the reserve is still taken";
  memory.GiveBack(a);
  EXPECT_TRUE(memory.Take(b, 35) && memory.Take(c, 40));
}

TEST_F(FrameServerTest, WaitsForConnectionsAndDescriptorsToComeFree) {
  options_.max_connections = 2;
  Start();
  const RawClient first = Sending("");
  const RawClient second = Sending("");
  const RawClient third = Sending(Frame("third"));
  EXPECT_TRUE(first.Send(Frame("first")));
  EXPECT_EQ(first.Receive(), Frame("first"));
  EXPECT_EQ(third.Receive(), Frame("third"));
  const ScopedFault fault("accept4", EMFILE);
  EXPECT_EQ(Ask("no descriptor"), "no descriptor");
  EXPECT_TRUE(fault.Fired());
}

TEST_F(FrameServerTest, StopsWhenRequestsInWorkAreDone) {
  for (const bool in_time : {true, false}) {
    SCOPED_TRACE(in_time);
    std::promise<void> begun;
    std::promise<void> let_go;
    options_.handler = [&](const std::string& request) {
      if (request == "first") {
        begun.set_value();
        let_go.get_future().wait();
      }
      return request;
    };
    options_.workers = 1;
    options_.stop_timeout = in_time ? milliseconds(60000) : milliseconds(20);
    Start();
    const RawClient first = Sending(Frame("first"));
    begun.get_future().wait();
    const RawClient second = Sending(Frame("second"));
    const RawClient half = Sending(LengthBytes(9) + "half");
    // Connections are taken in order: once this one was refused, those before it have been read.
    EXPECT_EQ(Sending(std::string(8, '\xFF')).Receive(17), Frame("refused 0"));
    std::future<bool> done = std::async(std::launch::async, [this] { return Stop(); });
    EXPECT_EQ(half.Receive(), "");
    EXPECT_EQ(Ask("late"), "<failed>");
    if (!in_time) {
      EXPECT_FALSE(done.get());
    }
    let_go.set_value();
    EXPECT_EQ(first.Receive(), Frame("first"));
    EXPECT_EQ(second.Receive(), in_time ? Frame("second") : Frame("refused 3"));
    EXPECT_TRUE(!in_time || done.get());
    server_.reset();
    eventfd_t value = 0;
    EXPECT_EQ(eventfd_read(stop_.fd, &value), 0);
  }
}

TEST_F(FrameServerTest, ReplacesOnlyASocketThatNobodyServes) {
  options_.mode = 0660;
  WriteText(folder_ / "file", "text");
  const std::string longest = folder_ / std::string(106 - folder_.Path().size(), 'x');
  close(UnixSocket(folder_ / "stale", SOCK_STREAM, bind));
  close(UnixSocket(folder_ / "stal~", SOCK_STREAM, bind));  // From a start that was cut short.
  const RawClient full(UnixSocket(folder_ / "full", SOCK_STREAM, bind));
  listen(full.fd, 0);
  const RawClient waiting(folder_ / "full");
  const struct {
    std::string path;
    bool good;
  } cases[] = {{folder_ / "stale", true}, {longest, true},           {longest + "x", false},
               {folder_ / "file", false}, {folder_ / "full", false}, {folder_ / "no/s", false}};
  for (const auto& row : cases) {
    SCOPED_TRACE(row.path);
    options_.socket_path = row.path;
    try {
      const FrameServer server(options_);
      EXPECT_TRUE(row.good);
      struct stat made {};
      EXPECT_TRUE(lstat(row.path.c_str(), &made) == 0 && made.st_mode == (S_IFSOCK | 0660));
      EXPECT_THROW(FrameServer{options_}, Error) << "it is in use now";
    } catch (const Error& error) {
      EXPECT_TRUE(!row.good && error.GetErrorCode() == ERR_SYSTEM) << error.what();
    }
  }
  EXPECT_EQ(ReadText(folder_ / "file"), "text");
  EXPECT_EQ(folder_.Names(), (std::set<std::string>{"file", "full"}));
}

}  // namespace
}  // namespace vexlo::daemon
