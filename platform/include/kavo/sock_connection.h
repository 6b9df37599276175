// A client's connection to a daemon of the platform, for one request and its reply.
//
// On the wire a message is its length, an unsigned 64-bit number in the host's byte order, and that
// many bytes. The bytes may be anything, also none at all.
#ifndef KAVO_SOCK_CONNECTION_H_
#define KAVO_SOCK_CONNECTION_H_

#include <string>

namespace kavodaemon {

// Each call returns false on a failure, with errno. An object is for one thread at a time; several
// threads have one each.
class SockConnection {
 public:
  SockConnection() = default;
  virtual ~SockConnection();
  SockConnection(const SockConnection&) = delete;
  SockConnection& operator=(const SockConnection&) = delete;

  // Waits up to `timeout` seconds (not at all when it is 0 or less) for a daemon that is too busy
  // to take connections: ETIMEDOUT then. One that does not listen is not waited for: ENOENT or
  // ECONNREFUSED. Closes the connection that the object had.
  virtual bool Connect(int timeout) = 0;

  // Sends one message. EPIPE or ECONNRESET when the peer closes before it has all of it; no SIGPIPE
  // is raised. Waits as long as a peer lives that does not read.
  virtual bool Send(const std::string& message) = 0;

  // Receives one message; `message` is empty after a failure. ECONNRESET when the peer closes
  // before all of it has come, EMSGSIZE for one over 1 GiB, ENOMEM when there is no memory for it,
  // which is taken as the bytes come. Waits as long as a peer lives that does not answer.
  virtual bool Recv(std::string& message) = 0;
};

// A connection by a Unix stream socket.
class DomainSockConnection : public SockConnection {
 public:
  // A path over 107 bytes makes Connect() fail with ENAMETOOLONG.
  explicit DomainSockConnection(const std::string& path);
  ~DomainSockConnection() override;
  DomainSockConnection(const DomainSockConnection&) = delete;
  DomainSockConnection& operator=(const DomainSockConnection&) = delete;

  bool Connect(int timeout) override;
  bool Send(const std::string& message) override;
  bool Recv(std::string& message) override;

 private:
  void Close();

  std::string path_;
  int fd_ = -1;
};

}  // namespace kavodaemon

#endif  // KAVO_SOCK_CONNECTION_H_
