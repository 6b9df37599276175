// A server on a Unix stream socket: one request and one reply a connection, each framed as
// kavo/sock_connection.h has it.
#ifndef DAEMONS_COMMON_FRAME_SERVER_H_
#define DAEMONS_COMMON_FRAME_SERVER_H_

#include <sys/types.h>

#include <chrono>
#include <cstddef>
#include <cstdint>
#include <deque>
#include <functional>
#include <memory>
#include <optional>
#include <string>
#include <thread>
#include <unordered_map>
#include <vector>

#include "daemons/common/unique_fd.h"
#include "kavo/local/mutex.h"

namespace vexlo::daemon {

// Requests that the server answers itself.
enum class Refusal {
  kTooLong,        // Over max_request_bytes; nothing of it was kept.
  kHandlerFailed,  // The handler threw. Logged.
  kNotAdmitted,    // The client's user may not ask anything.
  kStopping,       // The server ends before it came to the request.
};

// What is said of it to people, about "the engine" or another `server`.
std::string RefusalSentence(Refusal refusal, const std::string& server);

// Whose process a client is, as the kernel knew it when it connected.
struct Peer {
  uid_t uid = 0;
  gid_t gid = 0;
  std::vector<gid_t> groups;  // Further ones.
};

struct FrameServerOptions {
  std::string socket_path;  // Up to 107 bytes.
  mode_t mode = 0600;       // Of the socket.

  // Root and the user that the server runs as may ask everything. So may whom this admits; unset,
  // nobody else, whatever way they got at the socket. Called on the thread in Run().
  std::function<bool(const Peer& peer)> admits;
  // Connections of each user who is neither; further ones are closed.
  size_t max_connections_per_user = 16;

  // Called on several threads at once, as many as there are workers.
  std::function<std::string(const std::string& request)> handler;
  // Instead of `handler`: gets also the descriptor that came with the first byte of the request, if
  // one did (SCM_RIGHTS; of several the first). Without this a descriptor that is sent is closed.
  std::function<std::string(const std::string& request, UniqueFd file)> file_handler;
  // Instead of `handler`: gets also who asks.
  std::function<std::string(const std::string& request, const Peer& peer)> peer_handler;
  // The reply to a request that is refused; when unset, or when it returns "", the connection is
  // closed without one.
  std::function<std::string(Refusal)> refusal;

  // Called once when the server begins to stop, so that requests in work can be cut short. May be
  // unset.
  std::function<void()> stopping;

  size_t workers = 8;
  // Further ones wait in the kernel's queue, and their connect() when that is full.
  size_t max_connections = 1024;
  uint64_t max_request_bytes = uint64_t{256} << 20;
  // What all requests together may take, from the first byte to the handler's return, and again
  // what all replies together may that their clients do not read. At least twice max_request_bytes.
  // A request that finds no room is not read on until others are done; a reply closes its
  // connection.
  size_t max_total_bytes = size_t{512} << 20;

  // A connection is closed when for so long its client sends nothing, or next to nothing (less than
  // 64 KiB of what is missing), or reads as little of the reply.
  std::chrono::milliseconds idle_timeout{30000};
  std::chrono::milliseconds write_timeout{30000};
  // How long requests in work may take to end once the server stops.
  std::chrono::milliseconds stop_timeout{10000};
};

// Bounds the memory of requests. A request that grows takes from a common part; when that is used
// up, one request at a time gets the other part, which suffices for the longest. So memory is taken
// by bytes that have come, whatever length was announced, and yet of many long requests that have
// all come halfway one can go on. Not thread-safe.
class RequestMemory {
 public:
  // What one request holds.
  struct Share {
    size_t bytes = 0;
    bool reserve = false;
  };

  RequestMemory(size_t total, size_t longest) : common_(total - longest) {}

  // Raises the share to `bytes`; false, and nothing changes, when there is no room now.
  bool Take(Share& share, size_t bytes);
  void GiveBack(Share& share);

 private:
  size_t common_;  // What is left of it.
  bool reserve_taken_ = false;
};

// The server. Each connection has one owner at a time, who alone touches it:
//
//   loop (connections_)  reads the request; writes what is left of a reply; waits in epoll, so that
//                        a stalled connection costs no thread
//   jobs_                a whole request that waits for a worker
//   worker               calls the handler, writes the reply as far as the socket takes it, closes
//   returned_            a reply that the socket did not take whole, on its way back to the loop
//
// mutex_ is held for moments, never over a system call but the one that wakes the loop, and never
// over the handler. What is not marked as guarded by it is the loop's, that is, of the thread in
// Run().
class FrameServer {
 public:
  // Listens: clients may connect from here on, and are served in Run(). The socket appears at its
  // path whole, with its mode and ready for connections. One that is there already is replaced when
  // nobody answers on it; the caller holds a lock that keeps a second one from doing so at the same
  // time (RunDaemon's pid file). Throws Error 502 when somebody does answer, when something else is
  // at the path, or it cannot be made; Error 120 for options without sense.
  explicit FrameServer(FrameServerOptions options);

  // Removes the socket, and waits for handlers that still run.
  ~FrameServer();
  FrameServer(const FrameServer&) = delete;
  FrameServer& operator=(const FrameServer&) = delete;

  // Serves until `stop_fd` is readable; called once. Then the socket is removed, connections whose
  // request has not come whole are closed, and the others are given stop_timeout to be answered.
  // False when a handler still runs after it: the destructor would wait for that. Throws Error 502
  // when the system refuses what the loop needs.
  bool Run(int stop_fd);

 private:
  using Clock = std::chrono::steady_clock;
  struct Connection;
  enum class Received;

  void Listen();
  void RemoveSocket();
  void Add(int fd, uint32_t events);

  // The loop.
  void Handle(int fd, uint32_t events);
  void Accept();
  void Admit(UniqueFd fd);
  bool TakePlace(Connection& connection);
  void GiveUpPlace(const Connection& connection) KAVO_REQUIRES(mutex_);
  void UpdateAccepting();
  void Read(Connection& connection);
  Received Receive(Connection& connection);
  Received ReceiveHeader(Connection& connection);
  Received ReceiveBody(Connection& connection);
  bool Grow(Connection& connection);
  void Refuse(Connection& connection);
  void Drain(Connection& connection);
  void Write(Connection& connection);
  void Watch(Connection& connection, uint32_t events);
  void Unwatch(Connection& connection);
  void Submit(Connection& connection);
  void Close(Connection& connection);
  void Advance(Connection& connection, size_t bytes, std::chrono::milliseconds timeout);
  void SetDeadline(Connection& connection, Clock::time_point deadline);
  void TakeReturned();
  void ResumeStarved();
  void CloseOverdue();
  int WaitMilliseconds() const;
  void BeginStop();
  bool IsStopped();
  bool FinishStop();

  // The workers.
  void Work();
  std::optional<std::string> Answer(Connection& connection);
  std::string Handle(const std::string& request, Connection& connection);
  void Wake();

  const FrameServerOptions options_;
  UniqueFd listener_;
  UniqueFd epoll_;
  UniqueFd wake_;  // Raised by workers while wake_wanted_, and for each returned connection.
  dev_t socket_device_ = 0;
  ino_t socket_inode_ = 0;

  std::unordered_map<int, std::unique_ptr<Connection>> connections_;  // By descriptor.
  std::vector<char> scratch_;
  Clock::time_point now_;            // When the loop last woke.
  Clock::time_point next_deadline_;  // No connection's is earlier.
  Clock::time_point accept_after_;   // Later than now_ while the system has no descriptors left.
  Clock::time_point last_accept_log_;
  Clock::time_point stop_deadline_;
  size_t starved_ = 0;  // Connections that wait for memory.
  bool accepting_ = true;
  bool stopping_ = false;

  kavo::local::Mutex mutex_;
  kavo::local::Condition jobs_changed_;
  std::deque<std::unique_ptr<Connection>> jobs_ KAVO_GUARDED_BY(mutex_);
  std::vector<std::unique_ptr<Connection>> returned_ KAVO_GUARDED_BY(mutex_);
  RequestMemory memory_ KAVO_GUARDED_BY(mutex_);
  size_t unsent_bytes_ KAVO_GUARDED_BY(mutex_) = 0;  // Of replies in returned_ and connections_.
  size_t open_ KAVO_GUARDED_BY(mutex_) = 0;          // Connections, whoever owns them.
  std::unordered_map<uid_t, size_t> places_
      KAVO_GUARDED_BY(mutex_);               // Of them those of other users.
  size_t busy_ KAVO_GUARDED_BY(mutex_) = 0;  // Workers in the handler or at its reply.
  bool wake_wanted_ KAVO_GUARDED_BY(mutex_) = false;
  bool ending_ KAVO_GUARDED_BY(mutex_) = false;

  std::vector<std::thread> workers_;  // Started by Run(), joined by the destructor.
};

}  // namespace vexlo::daemon

#endif  // DAEMONS_COMMON_FRAME_SERVER_H_
