// A peer on a Unix stream socket that does not keep to the rules.
#ifndef SUPPORT_RAW_CLIENT_H_
#define SUPPORT_RAW_CLIENT_H_

#include <gtest/gtest.h>
#include <sys/socket.h>
#include <sys/un.h>
#include <unistd.h>

#include <algorithm>
#include <cerrno>
#include <cstdint>
#include <cstring>
#include <string>
#include <utility>

inline std::string LengthBytes(uint64_t length) {
  return std::string(reinterpret_cast<const char*>(&length), sizeof(length));
}
inline std::string Frame(const std::string& body) { return LengthBytes(body.size()) + body; }

inline struct sockaddr_un UnixAddress(const std::string& path) {
  struct sockaddr_un address {};
  address.sun_family = AF_UNIX;
  EXPECT_LT(path.size(), sizeof(address.sun_path));
  memcpy(address.sun_path, path.data(), std::min(path.size(), sizeof(address.sun_path) - 1));
  return address;
}

// Bound to the path; it listens when `backlog` is not negative.
inline int BindTo(const std::string& path, int backlog) {
  const struct sockaddr_un address = UnixAddress(path);
  const int fd = socket(AF_UNIX, SOCK_STREAM, 0);
  EXPECT_EQ(bind(fd, reinterpret_cast<const sockaddr*>(&address), sizeof(address)), 0) << path;
  EXPECT_TRUE(backlog < 0 || listen(fd, backlog) == 0);
  return fd;
}

// An end of a connection: one that was accepted, or a new one to the path.
class RawClient {
 public:
  explicit RawClient(int fd) : fd_(fd) {}
  explicit RawClient(const std::string& path) : fd_(socket(AF_UNIX, SOCK_STREAM, 0)) {
    const struct sockaddr_un address = UnixAddress(path);
    EXPECT_EQ(connect(fd_, reinterpret_cast<const sockaddr*>(&address), sizeof(address)), 0)
        << strerror(errno);
  }
  ~RawClient() { Close(); }
  RawClient(RawClient&& other) noexcept : fd_(std::exchange(other.fd_, -1)) {}
  RawClient(const RawClient&) = delete;
  RawClient& operator=(const RawClient&) = delete;

  // False when the peer is gone.
  bool Send(const std::string& bytes) const {
    size_t sent = 0;
    while (sent < bytes.size()) {
      const ssize_t count = send(fd_, bytes.data() + sent, bytes.size() - sent, MSG_NOSIGNAL);
      if (count < 0) {
        return false;
      }
      sent += static_cast<size_t>(count);
    }
    return true;
  }
  // Up to `size` bytes; fewer when the peer closes.
  std::string Receive(size_t size = SIZE_MAX) const {
    std::string bytes;
    char buffer[65536];
    ssize_t count = 0;
    while (bytes.size() < size &&
           (count = recv(fd_, buffer, std::min(sizeof(buffer), size - bytes.size()), 0)) > 0) {
      bytes.append(buffer, static_cast<size_t>(count));
    }
    return bytes;
  }
  void Close() {
    if (fd_ >= 0) {
      close(std::exchange(fd_, -1));
    }
  }

 private:
  int fd_;
};

#endif  // SUPPORT_RAW_CLIENT_H_
