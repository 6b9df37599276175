#include "kavo/sock_connection.h"

#include <sys/socket.h>
#include <sys/time.h>
#include <sys/un.h>
#include <unistd.h>

#include <algorithm>
#include <cerrno>
#include <chrono>
#include <cstdint>
#include <cstring>
#include <exception>

namespace kavodaemon {
namespace {

using Clock = std::chrono::steady_clock;

constexpr uint64_t kMaxMessageBytes = uint64_t{1} << 30;
constexpr size_t kFirstBytes = size_t{64} * 1024;

bool Fail(int error) {
  errno = error;
  return false;
}

// Bounds the wait of connect(), which takes its limit from that of sending; none for nullptr.
bool SetWait(int fd, const Clock::time_point* deadline) {
  struct timeval wait {};
  if (deadline != nullptr) {
    const auto left =
        std::chrono::duration_cast<std::chrono::microseconds>(*deadline - Clock::now()).count();
    const auto micros = std::max<decltype(left)>(left, 1);  // 0 would be no limit.
    wait.tv_sec = static_cast<time_t>(micros / 1000000);
    wait.tv_usec = static_cast<suseconds_t>(micros % 1000000);
  }
  return setsockopt(fd, SOL_SOCKET, SO_SNDTIMEO, &wait, sizeof(wait)) == 0;
}

bool ConnectWithin(int fd, const struct sockaddr_un& address, int timeout) {
  const Clock::time_point deadline = Clock::now() + std::chrono::seconds(std::max(timeout, 0));
  while (SetWait(fd, &deadline)) {
    // An interrupted attempt leaves no connection behind, unlike one over TCP.
    if (connect(fd, reinterpret_cast<const struct sockaddr*>(&address), sizeof(address)) == 0) {
      return SetWait(fd, nullptr);
    }
    if (errno != EINTR) {
      return Fail(errno == EAGAIN ? ETIMEDOUT : errno);
    }
  }
  return false;
}

// False with ECONNRESET when the peer closes before.
bool ReceiveAll(int fd, char* buffer, size_t size) {
  while (size > 0) {
    const ssize_t count = recv(fd, buffer, size, 0);
    if (count > 0) {
      buffer += count;
      size -= static_cast<size_t>(count);
    } else if (count == 0) {
      return Fail(ECONNRESET);
    } else if (errno != EINTR) {
      return false;
    }
  }
  return true;
}

}  // namespace

SockConnection::~SockConnection() = default;

DomainSockConnection::DomainSockConnection(const std::string& path) : path_(path) {}

DomainSockConnection::~DomainSockConnection() { Close(); }

void DomainSockConnection::Close() {
  if (fd_ >= 0) {
    const int saved = errno;
    close(fd_);
    errno = saved;
    fd_ = -1;
  }
}

bool DomainSockConnection::Connect(int timeout) {
  Close();
  struct sockaddr_un address {};
  address.sun_family = AF_UNIX;
  if (path_.size() >= sizeof(address.sun_path)) {
    return Fail(ENAMETOOLONG);
  }
  // A name that begins with a NUL is none of a file, and what stands behind a NUL would be lost.
  if (path_.empty() || path_.find('\0') != std::string::npos) {
    return Fail(ENOENT);
  }
  memcpy(address.sun_path, path_.data(), path_.size());
  fd_ = socket(AF_UNIX, SOCK_STREAM | SOCK_CLOEXEC, 0);
  if (fd_ < 0) {
    return false;
  }
  if (!ConnectWithin(fd_, address, timeout)) {
    Close();
    return false;
  }
  return true;
}

bool DomainSockConnection::Send(const std::string& message) {
  if (fd_ < 0) {
    return Fail(ENOTCONN);
  }
  uint64_t length = message.size();
  struct iovec parts[] = {{&length, sizeof(length)},
                          {const_cast<char*>(message.data()), message.size()}};
  struct msghdr header {};
  header.msg_iov = parts;
  header.msg_iovlen = 2;
  while (parts[0].iov_len + parts[1].iov_len > 0) {
    const ssize_t count = sendmsg(fd_, &header, MSG_NOSIGNAL);
    if (count < 0 && errno != EINTR) {
      return false;
    }
    size_t sent = count > 0 ? static_cast<size_t>(count) : 0;
    for (struct iovec& part : parts) {
      const size_t of_part = std::min(sent, part.iov_len);
      part.iov_base = static_cast<char*>(part.iov_base) + of_part;
      part.iov_len -= of_part;
      sent -= of_part;
    }
  }
  return true;
}

bool DomainSockConnection::Recv(std::string& message) {
  message.clear();
  if (fd_ < 0) {
    return Fail(ENOTCONN);
  }
  uint64_t length = 0;
  if (!ReceiveAll(fd_, reinterpret_cast<char*>(&length), sizeof(length))) {
    return false;
  }
  if (length > kMaxMessageBytes) {
    return Fail(EMSGSIZE);
  }
  try {
    std::string received;
    while (received.size() < length) {
      const size_t had = received.size();
      received.resize(std::min<size_t>(length, std::max(2 * had, kFirstBytes)));
      if (!ReceiveAll(fd_, received.data() + had, received.size() - had)) {
        return false;
      }
    }
    message = std::move(received);
    return true;
  } catch (const std::exception&) {
    return Fail(ENOMEM);
  }
}

}  // namespace kavodaemon
