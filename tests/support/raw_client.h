// A peer on a Unix stream socket that does not keep to the rules, and one that does.
#ifndef SUPPORT_RAW_CLIENT_H_
#define SUPPORT_RAW_CLIENT_H_

#include <gtest/gtest.h>
#include <sys/socket.h>
#include <sys/un.h>
#include <unistd.h>

#include <algorithm>
#include <cstdint>
#include <string>
#include <utility>

#include "kavo/sock_connection.h"

inline std::string LengthBytes(uint64_t length) {
  return std::string(reinterpret_cast<const char*>(&length), sizeof(length));
}
inline std::string Frame(const std::string& body) { return LengthBytes(body.size()) + body; }

// A new socket, given with its address to bind() or connect().
template <typename Use>
int UnixSocket(const std::string& path, int type, Use use) {
  struct sockaddr_un address {};
  address.sun_family = AF_UNIX;
  path.copy(address.sun_path, sizeof(address.sun_path));
  const int fd = socket(AF_UNIX, type, 0);
  EXPECT_EQ(use(fd, reinterpret_cast<const sockaddr*>(&address), sizeof(address)), 0) << path;
  return fd;
}

struct RawClient {
  explicit RawClient(int socket) : fd(socket) {}
  explicit RawClient(const std::string& path, const std::string& bytes = "")
      : fd(UnixSocket(path, SOCK_STREAM, connect)) {
    Send(bytes);
  }
  ~RawClient() { close(fd); }
  RawClient(RawClient&& other) noexcept : fd(std::exchange(other.fd, -1)) {}
  RawClient(const RawClient&) = delete;
  RawClient& operator=(const RawClient&) = delete;
  RawClient& operator=(RawClient&&) = delete;

  // False when the peer is gone. It waits, so a part only of the bytes is never sent.
  bool Send(const std::string& bytes) const {
    return send(fd, bytes.data(), bytes.size(), MSG_NOSIGNAL) == static_cast<ssize_t>(bytes.size());
  }
  // Up to `size` bytes; fewer when the peer closes.
  std::string Receive(size_t size = SIZE_MAX) const {
    std::string bytes;
    char buffer[65536];
    ssize_t count = 0;
    while (bytes.size() < size &&
           (count = recv(fd, buffer, std::min(sizeof(buffer), size - bytes.size()), 0)) > 0) {
      bytes.append(buffer, static_cast<size_t>(count));
    }
    return bytes;
  }

  int fd;
};

// The reply, or "<failed>".
inline std::string Ask(const std::string& path, const std::string& request) {
  kavodaemon::DomainSockConnection connection(path);
  std::string reply;
  const bool done = connection.Connect(60) && connection.Send(request) && connection.Recv(reply);
  return done ? reply : "<failed>";
}

#endif  // SUPPORT_RAW_CLIENT_H_
