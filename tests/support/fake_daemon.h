// The index daemon's end of the command socket.
#ifndef SUPPORT_FAKE_DAEMON_H_
#define SUPPORT_FAKE_DAEMON_H_

#include <gtest/gtest.h>
#include <sys/socket.h>
#include <sys/un.h>
#include <unistd.h>

#include <functional>
#include <string>
#include <thread>
#include <utility>
#include <vector>

#include "fileindex/paths.h"

// Listens from construction on, and reads a command from each connection. What follows is up to
// `answer`; an empty one accepts nothing, and leaves the connections waiting.
class FakeDaemon {
 public:
  explicit FakeDaemon(std::function<void(int fd)> answer = SendEmpty) {
    sockaddr_un address{AF_UNIX, {}};
    path_.copy(address.sun_path, sizeof(address.sun_path) - 1);
    EXPECT_TRUE(bind(fd_, reinterpret_cast<sockaddr*>(&address), sizeof(address)) == 0 &&
                listen(fd_, 64) == 0);
    thread_ = answer ? std::thread(&FakeDaemon::Serve, this, answer) : std::thread();
  }
  ~FakeDaemon() { Stop(); }

  // The JSON texts with their NULs, in order; the socket is gone afterwards.
  const std::vector<std::string>& Stop() {
    shutdown(fd_, SHUT_RDWR);
    if (thread_.joinable()) {
      thread_.join();
    }
    close(std::exchange(fd_, -1));
    unlink(path_.c_str());
    return commands_;
  }

  static void SendEmpty(int fd) { send(fd, "\0\0\0\0\0\0\0", 8, MSG_NOSIGNAL); }

 private:
  void Serve(const std::function<void(int)>& answer) {
    for (int fd = -1; (fd = accept4(fd_, nullptr, nullptr, SOCK_CLOEXEC)) >= 0; close(fd)) {
      uint64_t length = 0;
      recv(fd, &length, sizeof(length), MSG_WAITALL);
      std::string text(length, '?');
      recv(fd, text.data(), length, MSG_WAITALL);
      commands_.push_back(text);
      answer(fd);
    }
  }

  const std::string path_ = vexlo::fileindex::kFileIndexDaemonSocketPath.Get();
  int fd_ = socket(AF_UNIX, SOCK_STREAM | SOCK_CLOEXEC, 0);
  std::vector<std::string> commands_;
  std::thread thread_;
};

#endif  // SUPPORT_FAKE_DAEMON_H_
