#include "kavo/local/frames.h"

#include <poll.h>
#include <sys/socket.h>
#include <sys/time.h>
#include <sys/un.h>
#include <unistd.h>

#include <algorithm>
#include <cerrno>
#include <cstdint>
#include <cstring>

namespace kavo::local {
namespace {

using Clock = std::chrono::steady_clock;

constexpr size_t kHeaderBytes = sizeof(uint64_t);
constexpr size_t kFirstBytes = size_t{64} * 1024;
constexpr size_t kMostFiles = 8;  // The kernel closes those above it.

bool Fail(int error) {
  errno = error;
  return false;
}

// False with ETIMEDOUT.
bool Wait(int socket, short events, Deadline deadline) {
  struct pollfd poll_fd = {socket, events, 0};
  while (true) {
    const auto left = std::chrono::ceil<std::chrono::milliseconds>(deadline - Clock::now()).count();
    const int count = poll(&poll_fd, 1, static_cast<int>(std::clamp<int64_t>(left, 0, 1 << 30)));
    if (count > 0) {
      return true;
    }
    if (count < 0 && errno != EINTR) {
      return false;
    }
    if (count == 0 && left <= 0) {
      return Fail(ETIMEDOUT);
    }
  }
}

// Keeps the first descriptor of the message in `*file`, and closes the others.
void TakeFiles(struct msghdr& message, int* file) {
  for (struct cmsghdr* head = CMSG_FIRSTHDR(&message); head != nullptr;
       head = CMSG_NXTHDR(&message, head)) {
    if (head->cmsg_level != SOL_SOCKET || head->cmsg_type != SCM_RIGHTS) {
      continue;
    }
    const size_t count = (head->cmsg_len - CMSG_LEN(0)) / sizeof(int);
    for (size_t i = 0; i < count; ++i) {
      int received = -1;
      memcpy(&received, CMSG_DATA(head) + i * sizeof(int), sizeof(int));
      if (file != nullptr && *file < 0) {
        *file = received;
      } else {
        close(received);
      }
    }
  }
}

bool ReceiveAll(int socket, char* buffer, size_t size, int* file, Deadline deadline) {
  while (size > 0) {
    const ssize_t count = ReceiveSome(socket, buffer, size, file);
    if (count > 0) {
      buffer += count;
      size -= static_cast<size_t>(count);
    } else if (count == 0) {
      return Fail(ECONNRESET);
    } else if (errno != EAGAIN || !Wait(socket, POLLIN, deadline)) {
      return false;
    }
  }
  return true;
}

bool ReceiveBody(int socket, size_t most, std::string& body, int* file, Deadline deadline) {
  uint64_t length = 0;
  if (!ReceiveAll(socket, reinterpret_cast<char*>(&length), sizeof(length), file, deadline)) {
    return false;
  }
  if (length > most) {
    return Fail(EMSGSIZE);
  }
  while (body.size() < length) {
    const size_t had = body.size();
    body.resize(std::min<size_t>(length, std::max(2 * had, kFirstBytes)));
    if (!ReceiveAll(socket, body.data() + had, body.size() - had, nullptr, deadline)) {
      return false;
    }
  }
  return true;
}

}  // namespace

ssize_t ReceiveSome(int socket, char* buffer, size_t size, int* file) {
  alignas(struct cmsghdr) char control[CMSG_SPACE(kMostFiles * sizeof(int))];
  struct iovec part = {buffer, size};
  struct msghdr message {};
  message.msg_iov = &part;
  message.msg_iovlen = 1;
  ssize_t count = 0;
  do {
    message.msg_control = control;
    message.msg_controllen = sizeof(control);
    count = recvmsg(socket, &message, MSG_DONTWAIT | MSG_CMSG_CLOEXEC);
  } while (count < 0 && errno == EINTR);
  if (count >= 0) {
    TakeFiles(message, file);
  }
  return count;
}

int ConnectWithin(const std::string& path, Deadline deadline) {
  struct sockaddr_un address {};
  address.sun_family = AF_UNIX;
  if (path.empty() || path.size() >= sizeof(address.sun_path)) {
    errno = path.empty() ? ENOENT : ENAMETOOLONG;
    return -1;
  }
  memcpy(address.sun_path, path.data(), path.size());
  const int fd = socket(AF_UNIX, SOCK_STREAM | SOCK_CLOEXEC, 0);
  if (fd < 0) {
    return -1;
  }
  int error = 0;
  do {
    // connect() takes its limit from that of sending; 0 would be none.
    const auto left = std::max<int64_t>(
        1, std::chrono::duration_cast<std::chrono::microseconds>(deadline - Clock::now()).count());
    struct timeval wait {};
    wait.tv_sec = static_cast<time_t>(left / 1000000);
    wait.tv_usec = static_cast<suseconds_t>(left % 1000000);
    const bool done =
        setsockopt(fd, SOL_SOCKET, SO_SNDTIMEO, &wait, sizeof(wait)) == 0 &&
        connect(fd, reinterpret_cast<const struct sockaddr*>(&address), sizeof(address)) == 0;
    error = done ? 0 : errno;
  } while (error == EINTR);
  if (error != 0) {
    close(fd);
    errno = error == EAGAIN ? ETIMEDOUT : error;
    return -1;
  }
  return fd;
}

bool SendFrame(int socket, std::string_view body, int file, Deadline deadline) {
  uint64_t length = body.size();
  size_t sent = 0;
  while (sent < kHeaderBytes + body.size()) {
    const size_t of_body = sent - std::min(sent, kHeaderBytes);
    const size_t of_header = sent - of_body;
    struct iovec parts[] = {
        {reinterpret_cast<char*>(&length) + of_header, kHeaderBytes - of_header},
        {const_cast<char*>(body.data()) + of_body, body.size() - of_body}};
    struct msghdr message {};
    message.msg_iov = parts;
    message.msg_iovlen = 2;
    alignas(struct cmsghdr) char control[CMSG_SPACE(sizeof(int))] = {};
    if (sent == 0 && file >= 0) {
      message.msg_control = control;
      message.msg_controllen = sizeof(control);
      struct cmsghdr* const head = CMSG_FIRSTHDR(&message);
      head->cmsg_level = SOL_SOCKET;
      head->cmsg_type = SCM_RIGHTS;
      head->cmsg_len = CMSG_LEN(sizeof(int));
      memcpy(CMSG_DATA(head), &file, sizeof(int));
    }
    const ssize_t count = sendmsg(socket, &message, MSG_NOSIGNAL | MSG_DONTWAIT);
    if (count >= 0) {
      sent += static_cast<size_t>(count);
    } else if (errno == EAGAIN) {
      if (!Wait(socket, POLLOUT, deadline)) {
        return false;
      }
    } else if (errno != EINTR) {
      return false;
    }
  }
  return true;
}

bool ReceiveFrame(int socket, size_t most, std::string& body, int* file, Deadline deadline) {
  int received = -1;
  body.clear();
  if (!ReceiveBody(socket, most, body, &received, deadline)) {
    const int error = errno;
    if (received >= 0) {
      close(received);
    }
    return Fail(error);
  }
  if (file != nullptr) {
    *file = received;
  } else if (received >= 0) {
    close(received);
  }
  return true;
}

}  // namespace kavo::local
