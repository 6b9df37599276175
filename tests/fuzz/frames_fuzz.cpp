// Frames: a server that is sent any bytes answers the request that they are, if they are one, and
// the next client after it; a client that receives any bytes takes the message that they begin
// with.
#include <sys/eventfd.h>
#include <sys/socket.h>
#include <sys/un.h>
#include <unistd.h>

#include <cerrno>
#include <chrono>
#include <cstring>
#include <optional>
#include <thread>

#include "daemons/common/frame_server.h"
#include "fuzz/target.h"
#include "kavo/local/frames.h"

namespace {

constexpr size_t kMostBytes = 1000;
constexpr char kTooLong[] = "too long";

std::string Frame(const std::string& body) {
  const uint64_t length = body.size();
  return std::string(reinterpret_cast<const char*>(&length), sizeof(length)) + body;
}

std::string Answer(const std::string& request) { return "<" + request + ">"; }

std::string Socket() { return fuzz::Folder() + "/socket"; }

// Serves until the program ends.
vexlo::daemon::FrameServer* Serve() {
  vexlo::daemon::FrameServerOptions options;
  options.socket_path = Socket();
  options.handler = Answer;
  options.refusal = [](vexlo::daemon::Refusal refusal) {
    return refusal == vexlo::daemon::Refusal::kTooLong ? kTooLong : "";
  };
  options.workers = 1;
  options.max_request_bytes = kMostBytes;
  options.max_total_bytes = 2 * kMostBytes;
  auto* const server = new vexlo::daemon::FrameServer(options);
  std::thread([server] { server->Run(eventfd(0, EFD_CLOEXEC)); }).detach();
  return server;
}

// All that a server sends to who sends it the bytes and no more.
std::string Exchange(std::string_view bytes) {
  const auto deadline = std::chrono::steady_clock::now() + std::chrono::seconds(5);
  const int fd = kavo::local::ConnectWithin(Socket(), deadline);
  fuzz::Require(fd >= 0, "the server takes no connection");
  // A refused client may be cut off.
  (void)TEMP_FAILURE_RETRY(send(fd, bytes.data(), bytes.size(), MSG_NOSIGNAL));
  shutdown(fd, SHUT_WR);
  std::string received;
  char buffer[4096];
  // libFuzzer's clock interrupts.
  for (ssize_t count = 0; (count = TEMP_FAILURE_RETRY(recv(fd, buffer, sizeof(buffer), 0))) > 0;) {
    received.append(buffer, static_cast<size_t>(count));
  }
  close(fd);
  return received;
}

// The body of the frame that the bytes begin with, if there is a whole one within the limit.
std::optional<std::string> BodyOf(std::string_view bytes) {
  uint64_t length = UINT64_MAX;
  if (bytes.size() >= sizeof(length)) {
    memcpy(&length, bytes.data(), sizeof(length));
  }
  if (length > kMostBytes || bytes.size() - sizeof(length) < length) {
    return std::nullopt;
  }
  return std::string(bytes.substr(sizeof(length), length));
}

void CheckServer(std::string_view bytes) {
  uint64_t length = 0;
  memcpy(&length, bytes.data(), bytes.size() < sizeof(length) ? 0 : sizeof(length));
  const std::optional<std::string> request = BodyOf(bytes);
  const std::string want = length > kMostBytes ? Frame(kTooLong)
                           : request           ? Frame(Answer(*request))
                                               : "";
  fuzz::RequireEqual(Exchange(bytes), want, "the server answers otherwise");
  fuzz::RequireEqual(Exchange(Frame("next")), Frame(Answer("next")),
                     "the next client is not served");
}

void CheckClient(std::string_view bytes) {
  int sockets[2] = {-1, -1};
  fuzz::Require(socketpair(AF_UNIX, SOCK_STREAM | SOCK_CLOEXEC, 0, sockets) == 0, "socketpair");
  const bool is_sent = TEMP_FAILURE_RETRY(send(sockets[0], bytes.data(), bytes.size(),
                                               MSG_NOSIGNAL)) == static_cast<ssize_t>(bytes.size());
  close(sockets[0]);
  std::string body;
  int file = -1;
  const bool is_received =
      kavo::local::ReceiveFrame(sockets[1], kMostBytes, body, &file,
                                std::chrono::steady_clock::now() + std::chrono::seconds(5));
  close(sockets[1]);
  fuzz::Require(is_sent && (is_received ? std::optional(body) : std::nullopt) == BodyOf(bytes),
                "a message is another one");
}

}  // namespace

extern "C" int LLVMFuzzerTestOneInput(const uint8_t* data, size_t size) {
  static const vexlo::daemon::FrameServer* const server = Serve();
  fuzz::Require(server != nullptr, "nobody serves");
  const std::string_view bytes = fuzz::TextOf(data, size).substr(0, size_t{64} << 10);
  CheckServer(bytes);
  CheckClient(bytes);
  return 0;
}
