#include "fileindex/communication.h"

#include <sys/socket.h>
#include <sys/time.h>
#include <sys/un.h>
#include <unistd.h>

#include <algorithm>
#include <cerrno>
#include <csignal>
#include <cstdint>
#include <cstring>

#include "common/check.h"
#include "common/error.h"
#include "common/json.h"
#include "common/scoped_fd.h"
#include "fileindex/paths.h"

namespace vexlo::fileindex {
namespace {

constexpr unsigned long kChunkBytes = 1024;
constexpr int kMaxInterruptions = 10;
constexpr useconds_t kFirstPauseMicroseconds = 1000;
constexpr useconds_t kLongestPauseMicroseconds = 100000;
constexpr int kConnectTries = 5;

constexpr LogSite kMakeSocket = {"communication", 75, "SendCommandToDaemon",
                                 "0 > (fd_socket = socket(PF_UNIX, SOCK_STREAM, 0))"};
constexpr LogSite kSetTimeout = {
    "communication", 90, "SendCommandToDaemon",
    "0 > setsockopt(fd_socket, SOL_SOCKET, SO_SNDTIMEO, (char *)&timeout, sizeof(timeout))"};

constexpr LogSite kWrite = {"communication", __LINE__, "BufferWrite", "1 > write(fd, data, size)"};
constexpr LogSite kRead = {"communication", __LINE__, "BufferRead", "0 > read(fd, data, size)"};

// Calls `transfer(offset, size)` until `length` bytes are done, over interruptions. It returns what
// the system call did; a count below `least` is a failure.
template <typename Transfer>
void TransferAll(const LogSite& site, const char* deed, unsigned long length, ssize_t least,
                 Transfer transfer) {
  int interruptions = 0;
  for (unsigned long done = 0; done < length;) {
    errno = 0;
    const ssize_t count = transfer(done, std::min(length - done, kChunkBytes));
    if (count < 0 && errno == EINTR && interruptions < kMaxInterruptions) {
      ++interruptions;
      continue;
    }
    VEXLO_CHECK_AT(site, count < least, ERR_SYSTEM,
                   std::string(deed) + " failed, reason=" + strerror(errno));
    done += static_cast<unsigned long>(count);
  }
}

// BufferRead(); without a buffer what comes is dropped, so that a length costs no memory.
void Read(int fd, unsigned long length, unsigned char* buffer) {
  unsigned char dropped[kChunkBytes];
  useconds_t pause = kFirstPauseMicroseconds;
  TransferAll(kRead, "read", length, /*least=*/0, [&](unsigned long offset, unsigned long size) {
    const ssize_t count = read(fd, buffer == nullptr ? dropped : buffer + offset, size);
    if (count == 0) {
      usleep(pause);
      pause = std::min(2 * pause, kLongestPauseMicroseconds);
    } else if (count > 0) {
      pause = kFirstPauseMicroseconds;
    }
    return count;
  });
}

// Connects to the daemon, waiting for its socket to be there. A failure shows in the first write.
void Connect(int fd, const std::string& path) {
  sockaddr_un address{};
  address.sun_family = AF_UNIX;
  VEXLO_CHECK(path.size() >= sizeof(address.sun_path), ERR_SYSTEM,
              "socket path is too long, path=" + path);
  path.copy(address.sun_path, path.size());
  for (int tries = 1; connect(fd, reinterpret_cast<const sockaddr*>(&address), sizeof(address)) < 0;
       ++tries) {
    if (errno != ENOENT || tries == kConnectTries) {
      return;
    }
    sleep(1);
  }
}

}  // namespace

void BufferWrite(int fd, unsigned long length, const unsigned char* buffer) {
  TransferAll(kWrite, "write", length, /*least=*/1, [&](unsigned long offset, unsigned long size) {
    return write(fd, buffer + offset, size);
  });
}

void BufferRead(int fd, unsigned long length, unsigned char* buffer) { Read(fd, length, buffer); }

void SendCommandToDaemon(const std::string& command, const Json::Value& data) {
  signal(SIGPIPE, SIG_IGN);  // A daemon that goes away is an error of ours, not our end.
  const ScopedFd fd(socket(PF_UNIX, SOCK_STREAM | SOCK_CLOEXEC, 0));
  VEXLO_CHECK_AT(kMakeSocket, !fd.IsOpen(), ERR_SYSTEM,
                 std::string("socket failed, reason=") + strerror(errno));
  Connect(fd.Get(), kFileIndexDaemonSocketPath.Get());
  const timeval timeout{1, 0};
  VEXLO_CHECK_AT(kSetTimeout,
                 setsockopt(fd.Get(), SOL_SOCKET, SO_SNDTIMEO, &timeout, sizeof(timeout)) < 0,
                 ERR_SYSTEM, std::string("setsockopt failed, reason=") + strerror(errno));
  Json::Value request;
  request["type"] = command;
  request["data"] = data;
  const std::string text = JsonToString(request);
  uint64_t length = text.size() + 1;
  BufferWrite(fd.Get(), sizeof(length), reinterpret_cast<const unsigned char*>(&length));
  BufferWrite(fd.Get(), length, reinterpret_cast<const unsigned char*>(text.c_str()));
  BufferRead(fd.Get(), sizeof(length), reinterpret_cast<unsigned char*>(&length));
  Read(fd.Get(), length, /*buffer=*/nullptr);
}

}  // namespace vexlo::fileindex
