#include "daemons/common/frame_server.h"

#include <sys/epoll.h>
#include <sys/eventfd.h>
#include <sys/socket.h>
#include <sys/stat.h>
#include <sys/un.h>

#include <algorithm>
#include <cerrno>
#include <cstdio>
#include <cstring>
#include <exception>
#include <new>
#include <system_error>
#include <utility>

#include "common/check.h"
#include "daemons/common/log.h"
#include "kavo/local/frames.h"

namespace vexlo::daemon {
namespace {

using std::chrono::milliseconds;

constexpr size_t kHeaderBytes = sizeof(uint64_t);
constexpr size_t kScratchBytes = size_t{64} * 1024;
constexpr size_t kFirstBytes = size_t{16} * 1024;
// Requests up to here are not charged: of as many as there are connections they are little.
constexpr size_t kFreeBytes = size_t{64} * 1024;
constexpr size_t kAdvanceBytes = size_t{64} * 1024;
// Of a request that will be refused.
constexpr size_t kStrangerBytes = size_t{64} * 1024;
constexpr int kReadsATurn = 16;
constexpr int kAcceptsATurn = 64;
constexpr int kEventsATurn = 64;
constexpr milliseconds kAcceptPause(100);
constexpr milliseconds kStarvedPause(100);
constexpr std::chrono::minutes kAcceptLogPause(1);

std::string Reason(const std::string& what, const std::string& path) {
  const std::error_code error(errno, std::system_category());
  return what + ", path=" + path + ", reason=" + error.message();
}

struct sockaddr_un AddressOf(const std::string& path) {
  struct sockaddr_un address {};
  address.sun_family = AF_UNIX;
  VEXLO_CHECK(path.empty() || path.size() >= sizeof(address.sun_path), ERR_SYSTEM,
              "a socket's path has 1 to 107 bytes, path=" + path);
  memcpy(address.sun_path, path.data(), path.size());
  return address;
}

const struct sockaddr* Generic(const struct sockaddr_un& address) {
  return reinterpret_cast<const struct sockaddr*>(&address);
}

// Removes a socket that nobody listens on any more. Fails for one that somebody does listen on, and
// for what is no socket.
void RemoveStale(const std::string& path) {
  struct stat there {};
  if (lstat(path.c_str(), &there) != 0 && errno == ENOENT) {
    return;
  }
  VEXLO_CHECK(!S_ISSOCK(there.st_mode), ERR_SYSTEM, "this is no socket, path=" + path);
  const struct sockaddr_un address = AddressOf(path);
  const UniqueFd fd(socket(AF_UNIX, SOCK_STREAM | SOCK_CLOEXEC | SOCK_NONBLOCK, 0));
  // EAGAIN is a listener whose queue is full.
  VEXLO_CHECK(connect(fd.Get(), Generic(address), sizeof(address)) == 0 || errno != ECONNREFUSED,
              ERR_SYSTEM, "somebody listens on the socket, path=" + path);
  VEXLO_CHECK(unlink(path.c_str()) != 0 && errno != ENOENT, ERR_SYSTEM,
              Reason("unlink failed", path));
}

// What recv() and send() say of a connection that has nothing for now.
bool IsForNow() { return errno == EAGAIN || errno == EWOULDBLOCK; }

// False when the system does not say.
bool FindPeer(int fd, Peer& peer) {
  struct ucred known {};
  socklen_t length = sizeof(known);
  if (getsockopt(fd, SOL_SOCKET, SO_PEERCRED, &known, &length) != 0) {
    return false;
  }
  peer.uid = known.uid;
  peer.gid = known.gid;
  length = 0;
  // Says by ERANGE how much room the groups need.
  if (getsockopt(fd, SOL_SOCKET, SO_PEERGROUPS, nullptr, &length) == 0) {
    return true;
  }
  peer.groups.resize(length / sizeof(gid_t));
  return errno == ERANGE &&
         getsockopt(fd, SOL_SOCKET, SO_PEERGROUPS, peer.groups.data(), &length) == 0;
}

bool IsOwn(const Peer& peer) { return peer.uid == 0 || peer.uid == geteuid(); }

ssize_t ReceiveSome(int fd, char* buffer, size_t size) {
  ssize_t count = 0;
  do {
    count = recv(fd, buffer, size, MSG_DONTWAIT);
  } while (count < 0 && errno == EINTR);
  return count;
}

// Sends the frame of `body` from its `sent`-th byte, header included, as far as the socket takes
// it; false when the connection is broken.
bool SendFrame(int fd, const std::string& body, size_t& sent) {
  uint64_t length = body.size();
  while (sent < kHeaderBytes + body.size()) {
    const size_t of_body = sent - std::min(sent, kHeaderBytes);
    const size_t of_header = sent - of_body;
    struct iovec parts[] = {
        {reinterpret_cast<char*>(&length) + of_header, kHeaderBytes - of_header},
        {const_cast<char*>(body.data()) + of_body, body.size() - of_body}};
    struct msghdr message {};
    message.msg_iov = parts;
    message.msg_iovlen = 2;
    const ssize_t count = sendmsg(fd, &message, MSG_NOSIGNAL | MSG_DONTWAIT);
    if (count >= 0) {
      sent += static_cast<size_t>(count);
    } else if (errno != EINTR) {
      return IsForNow();
    }
  }
  return true;
}

}  // namespace

std::string RefusalSentence(Refusal refusal, const std::string& server) {
  switch (refusal) {
    case Refusal::kTooLong:
      return "the request is too long";
    case Refusal::kNotAdmitted:
      return "only root and the user of " + server + " may ask this";
    case Refusal::kStopping:
      return server + " is ending";
    case Refusal::kHandlerFailed:
      break;
  }
  return "the request made " + server + " fail";
}

enum class FrameServer::Received {
  kPart,
  kWhole,
  kBroken,    // Closed by the client, or the system says so.
  kNoMemory,  // At present.
  kTooLong,
};

struct FrameServer::Connection {
  enum class State {
    kReceiving,
    kStarved,   // Its request waits for memory; it is not in epoll.
    kDraining,  // Refused. What the client still sends is thrown away: closing would discard the
                // refusal as well, or fail the client before it comes to read it.
    kInWork,    // Out of the loop's hands.
    kWriting,
  };

  UniqueFd fd;
  Peer peer;
  bool admitted = false;
  bool has_place = false;  // Counted in places_.
  State state = State::kReceiving;
  uint32_t watched = 0;  // The events that epoll waits for; 0 when it is not in epoll.
  Clock::time_point deadline;
  size_t advance = 0;  // Bytes since the deadline was last put off.

  char header[kHeaderBytes] = {};
  size_t header_got = 0;
  uint64_t length = 0;  // Of the request, then of what is left to drain.
  UniqueFd file;        // That came with it.
  std::string request;  // Its size is what there is room for.
  size_t got = 0;
  RequestMemory::Share share;

  std::string reply;
  size_t sent = 0;
};

bool RequestMemory::Take(Share& share, size_t bytes) {
  if (share.reserve || bytes <= share.bytes) {
    return true;
  }
  const size_t more = bytes - share.bytes;
  if (more <= common_) {
    common_ -= more;
    share.bytes = bytes;
    return true;
  }
  if (reserve_taken_) {
    return false;
  }
  share.reserve = reserve_taken_ = true;
  return true;
}

void RequestMemory::GiveBack(Share& share) {
  common_ += share.bytes;
  if (share.reserve) {
    reserve_taken_ = false;
  }
  share = Share();
}

FrameServer::FrameServer(FrameServerOptions options)
    : options_(std::move(options)),
      scratch_(kScratchBytes),
      next_deadline_(Clock::time_point::max()),
      memory_(options_.max_total_bytes, options_.max_request_bytes) {
  VEXLO_CHECK((!options_.handler && !options_.file_handler && !options_.peer_handler) ||
                  options_.workers == 0 || options_.max_connections == 0 ||
                  options_.max_total_bytes / 2 < options_.max_request_bytes,
              ERR_BAD_PARAMETER, "a server's options make no sense, path=" + options_.socket_path);
  epoll_ = UniqueFd(epoll_create1(EPOLL_CLOEXEC));
  wake_ = UniqueFd(eventfd(0, EFD_CLOEXEC | EFD_NONBLOCK));
  VEXLO_CHECK(epoll_.Get() < 0 || wake_.Get() < 0, ERR_SYSTEM,
              Reason("no descriptors for the server", options_.socket_path));
  Listen();
}

// Made under another name and renamed: whoever sees the socket can connect, and before that nobody
// can who may not. The other name is as long, so that a path that fits does so twice.
void FrameServer::Listen() {
  const std::string& path = options_.socket_path;
  AddressOf(path);
  RemoveStale(path);
  std::string made = path;
  made.back() = made.back() == '~' ? '_' : '~';
  RemoveStale(made);
  const struct sockaddr_un address = AddressOf(made);
  listener_ = UniqueFd(socket(AF_UNIX, SOCK_STREAM | SOCK_CLOEXEC | SOCK_NONBLOCK, 0));
  struct stat there {};
  VEXLO_CHECK(
      listener_.Get() < 0 || bind(listener_.Get(), Generic(address), sizeof(address)) != 0 ||
          chmod(made.c_str(), options_.mode) != 0 || listen(listener_.Get(), SOMAXCONN) != 0 ||
          lstat(made.c_str(), &there) != 0 || rename(made.c_str(), path.c_str()) != 0,
      ERR_SYSTEM, Reason("the socket cannot be made", path));
  socket_device_ = there.st_dev;
  socket_inode_ = there.st_ino;
}

void FrameServer::RemoveSocket() {
  struct stat there {};
  if (listener_.Get() >= 0 && lstat(options_.socket_path.c_str(), &there) == 0 &&
      there.st_dev == socket_device_ && there.st_ino == socket_inode_) {
    unlink(options_.socket_path.c_str());
  }
  listener_.Reset();
}

FrameServer::~FrameServer() {
  RemoveSocket();
  {
    const kavo::local::MutexLock lock(mutex_);
    ending_ = true;
    jobs_.clear();
  }
  jobs_changed_.NotifyAll();
  for (std::thread& worker : workers_) {
    worker.join();
  }
}

void FrameServer::Add(int fd, uint32_t events) {
  struct epoll_event event {};
  event.events = events;
  event.data.fd = fd;
  VEXLO_CHECK(epoll_ctl(epoll_.Get(), EPOLL_CTL_ADD, fd, &event) != 0, ERR_SYSTEM,
              Reason("epoll_ctl failed", options_.socket_path));
}

bool FrameServer::Run(int stop_fd) {
  for (size_t i = 0; i < options_.workers; ++i) {
    workers_.emplace_back([this] { Work(); });
  }
  for (const int fd : {listener_.Get(), wake_.Get(), stop_fd}) {
    Add(fd, EPOLLIN);
  }
  while (true) {
    now_ = Clock::now();
    TakeReturned();  // Also says whether workers shall wake the loop, so it stands before the rest.
    CloseOverdue();
    ResumeStarved();
    if (stopping_ && IsStopped()) {
      return FinishStop();
    }
    UpdateAccepting();
    struct epoll_event events[kEventsATurn];
    const int count = epoll_wait(epoll_.Get(), events, kEventsATurn, WaitMilliseconds());
    VEXLO_CHECK(count < 0 && errno != EINTR, ERR_SYSTEM,
                Reason("epoll_wait failed", options_.socket_path));
    now_ = Clock::now();
    for (int i = 0; i < count; ++i) {
      const int fd = events[i].data.fd;
      if (fd == stop_fd) {
        epoll_ctl(epoll_.Get(), EPOLL_CTL_DEL, fd, nullptr);
        BeginStop();
      } else {
        Handle(fd, events[i].events);
      }
    }
  }
}

void FrameServer::Handle(int fd, uint32_t events) {
  if (fd == wake_.Get()) {
    uint64_t times = 0;
    while (read(fd, &times, sizeof(times)) < 0 && errno == EINTR) {
    }
    return;
  }
  if (fd == listener_.Get()) {
    Accept();
    return;
  }
  // Closed since, by the stop.
  const auto found = connections_.find(fd);
  if (found == connections_.end()) {
    return;
  }
  Connection& connection = *found->second;
  if (connection.state == Connection::State::kWriting) {
    Write(connection);
  } else if (connection.state == Connection::State::kDraining) {
    Drain(connection);
  } else if ((events & (EPOLLIN | EPOLLHUP | EPOLLERR)) != 0) {
    Read(connection);
  }
}

void FrameServer::Accept() {
  for (int i = 0; i < kAcceptsATurn && accepting_; ++i) {
    UniqueFd fd(accept4(listener_.Get(), nullptr, nullptr, SOCK_CLOEXEC | SOCK_NONBLOCK));
    if (fd.Get() < 0) {
      if (errno == EMFILE || errno == ENFILE || errno == ENOBUFS || errno == ENOMEM) {
        // The client stays in the queue, and the listener readable: looking again at once would
        // only burn time.
        accept_after_ = now_ + kAcceptPause;
        if (now_ - last_accept_log_ > kAcceptLogPause) {
          Log(Level::kWarning, VEXLO_SOURCE, __LINE__,
              Reason("connections must wait", options_.socket_path));
          last_accept_log_ = now_;
        }
        UpdateAccepting();
      }
      return;
    }
    Admit(std::move(fd));
    UpdateAccepting();
  }
}

void FrameServer::Admit(UniqueFd fd) {
  auto connection = std::make_unique<Connection>();
  if (!FindPeer(fd.Get(), connection->peer) || !TakePlace(*connection)) {
    return;
  }
  connection->admitted =
      IsOwn(connection->peer) || (options_.admits && options_.admits(connection->peer));
  const int number = fd.Get();
  connection->fd = std::move(fd);
  Connection& added = *connection;
  connections_[number] = std::move(connection);
  SetDeadline(added, now_ + options_.idle_timeout);
  Read(added);  // Mostly the request is there already.
}

// False when its user has as many connections as one may have.
bool FrameServer::TakePlace(Connection& connection) {
  const kavo::local::MutexLock lock(mutex_);
  if (!IsOwn(connection.peer)) {
    size_t& places = places_[connection.peer.uid];
    if (places >= options_.max_connections_per_user) {
      return false;
    }
    ++places;
    connection.has_place = true;
  }
  ++open_;
  return true;
}

void FrameServer::GiveUpPlace(const Connection& connection) {
  --open_;
  if (connection.has_place && --places_[connection.peer.uid] == 0) {
    places_.erase(connection.peer.uid);
  }
}

void FrameServer::UpdateAccepting() {
  if (stopping_) {
    return;
  }
  bool wanted = accept_after_ <= now_;
  {
    const kavo::local::MutexLock lock(mutex_);
    wanted = wanted && open_ < options_.max_connections;
    wake_wanted_ = wake_wanted_ || open_ >= options_.max_connections;
  }
  if (wanted != accepting_) {
    struct epoll_event event {};
    event.events = wanted ? uint32_t{EPOLLIN} : 0;
    event.data.fd = listener_.Get();
    VEXLO_CHECK(epoll_ctl(epoll_.Get(), EPOLL_CTL_MOD, listener_.Get(), &event) != 0, ERR_SYSTEM,
                Reason("epoll_ctl failed", options_.socket_path));
    accepting_ = wanted;
  }
}

void FrameServer::Read(Connection& connection) {
  switch (Receive(connection)) {
    case Received::kPart:
      Watch(connection, EPOLLIN);
      break;
    case Received::kWhole:
      Submit(connection);
      break;
    case Received::kBroken:
      Close(connection);
      break;
    case Received::kNoMemory:
      // Those who hold it have deadlines; this one is not at fault.
      Unwatch(connection);
      connection.state = Connection::State::kStarved;
      connection.deadline = Clock::time_point::max();
      ++starved_;
      break;
    case Received::kTooLong:
      Refuse(connection);
      break;
  }
}

FrameServer::Received FrameServer::Receive(Connection& connection) {
  Received received = Received::kPart;
  for (int i = 0; i < kReadsATurn && received == Received::kPart; ++i) {
    const size_t before = connection.header_got + connection.got;
    received =
        connection.header_got < kHeaderBytes ? ReceiveHeader(connection) : ReceiveBody(connection);
    const size_t bytes = connection.header_got + connection.got - before;
    if (bytes == 0) {
      break;
    }
    Advance(connection, bytes, options_.idle_timeout);
  }
  return received;
}

// Reads what there is, a short request whole.
FrameServer::Received FrameServer::ReceiveHeader(Connection& connection) {
  ssize_t count = 0;
  if (options_.file_handler) {
    int file = connection.file.Get();
    count = kavo::local::ReceiveSome(connection.fd.Get(), scratch_.data(), scratch_.size(), &file);
    if (file != connection.file.Get()) {
      connection.file = UniqueFd(file);
    }
  } else {
    count = ReceiveSome(connection.fd.Get(), scratch_.data(), scratch_.size());
  }
  if (count <= 0) {
    return count < 0 && IsForNow() ? Received::kPart : Received::kBroken;
  }
  size_t size = static_cast<size_t>(count);
  const size_t of_header = std::min(size, kHeaderBytes - connection.header_got);
  memcpy(connection.header + connection.header_got, scratch_.data(), of_header);
  connection.header_got += of_header;
  if (connection.header_got < kHeaderBytes) {
    return Received::kPart;
  }
  memcpy(&connection.length, connection.header, kHeaderBytes);
  size -= of_header;
  if (connection.length > (connection.admitted ? options_.max_request_bytes : kStrangerBytes)) {
    connection.length -= std::min<uint64_t>(size, connection.length);
    return Received::kTooLong;
  }
  connection.got = static_cast<size_t>(std::min<uint64_t>(size, connection.length));
  connection.request.assign(scratch_.data() + of_header, connection.got);
  return connection.got == connection.length ? Received::kWhole : Received::kPart;
}

FrameServer::Received FrameServer::ReceiveBody(Connection& connection) {
  std::string& request = connection.request;
  if (connection.got == request.size() && !Grow(connection)) {
    return Received::kNoMemory;
  }
  const ssize_t count = ReceiveSome(connection.fd.Get(), request.data() + connection.got,
                                    request.size() - connection.got);
  if (count <= 0) {
    return count < 0 && IsForNow() ? Received::kPart : Received::kBroken;
  }
  connection.got += static_cast<size_t>(count);
  return connection.got == connection.length ? Received::kWhole : Received::kPart;
}

// Makes room for as much again as has come, so that an announced length costs nothing by itself.
bool FrameServer::Grow(Connection& connection) {
  const size_t room = static_cast<size_t>(
      std::min<uint64_t>(connection.length, std::max(2 * connection.got, kFirstBytes)));
  if (room > kFreeBytes) {
    const kavo::local::MutexLock lock(mutex_);
    if (!memory_.Take(connection.share, room)) {
      wake_wanted_ = true;
      return false;
    }
  }
  try {
    connection.request.resize(room);
    return true;
  } catch (const std::bad_alloc&) {
    return false;
  }
}

void FrameServer::Refuse(Connection& connection) {
  const Refusal reason = connection.admitted ? Refusal::kTooLong : Refusal::kNotAdmitted;
  const std::string reply = options_.refusal ? options_.refusal(reason) : "";
  size_t sent = 0;
  // A fresh socket takes a text of this kind whole.
  if (reply.empty() || !SendFrame(connection.fd.Get(), reply, sent) || connection.length == 0) {
    Close(connection);
    return;
  }
  shutdown(connection.fd.Get(), SHUT_WR);
  connection.state = Connection::State::kDraining;
  SetDeadline(connection, now_ + options_.idle_timeout);
  Watch(connection, EPOLLIN);
}

void FrameServer::Drain(Connection& connection) {
  for (int i = 0; i < kReadsATurn; ++i) {
    const ssize_t count = ReceiveSome(connection.fd.Get(), scratch_.data(), scratch_.size());
    if (count < 0 && IsForNow()) {
      return;
    }
    if (count <= 0 || static_cast<uint64_t>(count) >= connection.length) {
      Close(connection);
      return;
    }
    connection.length -= static_cast<uint64_t>(count);
  }
}

void FrameServer::Write(Connection& connection) {
  const size_t before = connection.sent;
  if (!SendFrame(connection.fd.Get(), connection.reply, connection.sent) ||
      connection.sent == kHeaderBytes + connection.reply.size()) {
    Close(connection);
    return;
  }
  Advance(connection, connection.sent - before, options_.write_timeout);
}

void FrameServer::Watch(Connection& connection, uint32_t events) {
  if (connection.watched == events) {
    return;
  }
  struct epoll_event event {};
  event.events = events;
  event.data.fd = connection.fd.Get();
  if (epoll_ctl(epoll_.Get(), connection.watched == 0 ? EPOLL_CTL_ADD : EPOLL_CTL_MOD,
                connection.fd.Get(), &event) != 0) {
    Log(Level::kWarning, VEXLO_SOURCE, __LINE__,
        Reason("a connection is closed", options_.socket_path));
    Close(connection);
    return;
  }
  connection.watched = events;
}

// Also keeps the end of a connection that is not the loop's from being reported again and again.
void FrameServer::Unwatch(Connection& connection) {
  if (connection.watched != 0) {
    epoll_ctl(epoll_.Get(), EPOLL_CTL_DEL, connection.fd.Get(), nullptr);
    connection.watched = 0;
  }
}

void FrameServer::Submit(Connection& connection) {
  Unwatch(connection);
  connection.state = Connection::State::kInWork;
  auto node = connections_.extract(connection.fd.Get());
  {
    const kavo::local::MutexLock lock(mutex_);
    jobs_.push_back(std::move(node.mapped()));
  }
  jobs_changed_.NotifyOne();
}

void FrameServer::Close(Connection& connection) {
  if (connection.state == Connection::State::kStarved) {
    --starved_;
  }
  const auto node = connections_.extract(connection.fd.Get());  // Closes, in epoll too, at the end.
  const kavo::local::MutexLock lock(mutex_);
  memory_.GiveBack(connection.share);
  unsent_bytes_ -= connection.reply.size();
  GiveUpPlace(*node.mapped());
}

// Puts the deadline off for every so many bytes: a byte now and then would hold a connection for
// ever.
void FrameServer::Advance(Connection& connection, size_t bytes, milliseconds timeout) {
  connection.advance += bytes;
  if (connection.advance >= kAdvanceBytes) {
    connection.advance = 0;
    SetDeadline(connection, now_ + timeout);
  }
}

void FrameServer::SetDeadline(Connection& connection, Clock::time_point deadline) {
  connection.deadline = deadline;
  next_deadline_ = std::min(next_deadline_, deadline);
}

void FrameServer::TakeReturned() {
  std::vector<std::unique_ptr<Connection>> returned;
  {
    const kavo::local::MutexLock lock(mutex_);
    returned.swap(returned_);
    wake_wanted_ = stopping_ || starved_ > 0;
  }
  for (std::unique_ptr<Connection>& connection : returned) {
    Connection& added = *connection;
    added.state = Connection::State::kWriting;
    added.advance = 0;
    connections_[added.fd.Get()] = std::move(connection);
    SetDeadline(added, now_ + options_.write_timeout);
    Watch(added, EPOLLOUT);
  }
}

void FrameServer::ResumeStarved() {
  if (starved_ == 0) {
    return;
  }
  std::vector<Connection*> starved;
  for (const auto& [fd, connection] : connections_) {
    if (connection->state == Connection::State::kStarved) {
      starved.push_back(connection.get());
    }
  }
  for (Connection* const connection : starved) {
    connection->state = Connection::State::kReceiving;
    --starved_;
    SetDeadline(*connection, now_ + options_.idle_timeout);
    Read(*connection);
  }
}

void FrameServer::CloseOverdue() {
  if (now_ < next_deadline_) {
    return;
  }
  std::vector<Connection*> overdue;
  next_deadline_ = Clock::time_point::max();
  for (const auto& [fd, connection] : connections_) {
    if (connection->deadline <= now_) {
      overdue.push_back(connection.get());
    } else {
      next_deadline_ = std::min(next_deadline_, connection->deadline);
    }
  }
  for (Connection* const connection : overdue) {
    Close(*connection);
  }
}

int FrameServer::WaitMilliseconds() const {
  Clock::time_point until = next_deadline_;
  if (accept_after_ > now_) {
    until = std::min(until, accept_after_);
  }
  if (stopping_) {
    until = std::min(until, stop_deadline_);
  }
  if (starved_ > 0) {  // Memory may come free elsewhere in the process.
    until = std::min(until, now_ + kStarvedPause);
  }
  if (until == Clock::time_point::max()) {
    return -1;
  }
  const auto wait = std::chrono::ceil<milliseconds>(until - now_).count();
  return static_cast<int>(std::clamp<decltype(wait)>(wait, 0, 60000));
}

void FrameServer::BeginStop() {
  stopping_ = true;
  stop_deadline_ = now_ + options_.stop_timeout;
  RemoveSocket();
  if (options_.stopping) {
    options_.stopping();
  }
  std::vector<Connection*> incomplete;
  for (const auto& [fd, connection] : connections_) {
    if (connection->state != Connection::State::kWriting) {
      incomplete.push_back(connection.get());
    }
  }
  for (Connection* const connection : incomplete) {
    Close(*connection);
  }
}

bool FrameServer::IsStopped() {
  const kavo::local::MutexLock lock(mutex_);
  return open_ == 0 || now_ >= stop_deadline_;
}

bool FrameServer::FinishStop() {
  const kavo::local::MutexLock lock(mutex_);
  if (open_ > 0) {
    Log(Level::kWarning, VEXLO_SOURCE, __LINE__,
        "stopped with " + std::to_string(open_) + " connections not served to the end");
  }
  const std::string refusal = options_.refusal ? options_.refusal(Refusal::kStopping) : "";
  for (const std::unique_ptr<Connection>& job : jobs_) {
    if (!refusal.empty()) {
      SendFrame(job->fd.Get(), refusal, job->sent);  // Which a fresh socket takes whole.
    }
  }
  jobs_.clear();
  ending_ = true;
  jobs_changed_.NotifyAll();
  return busy_ == 0;
}

void FrameServer::Work() {
  kavo::local::MutexLock lock(mutex_);
  while (true) {
    jobs_changed_.Wait(lock, [this]() KAVO_REQUIRES(mutex_) { return !jobs_.empty() || ending_; });
    if (ending_) {
      return;
    }
    std::unique_ptr<Connection> connection = std::move(jobs_.front());
    jobs_.pop_front();
    ++busy_;
    lock.Unlock();

    RequestMemory::Share share = std::exchange(connection->share, {});
    std::optional<std::string> reply = Answer(*connection);
    size_t unsent = 0;
    bool is_done = false;
    if (reply && SendFrame(connection->fd.Get(), *reply, connection->sent) &&
        connection->sent < kHeaderBytes + reply->size()) {
      unsent = reply->size();
      connection->reply = *std::move(reply);
    } else {
      is_done = true;
      connection->fd.Reset();
    }

    lock.Lock();
    --busy_;
    memory_.GiveBack(share);
    if (!is_done && unsent_bytes_ + unsent <= options_.max_total_bytes) {
      unsent_bytes_ += unsent;
      returned_.push_back(std::move(connection));
      Wake();
    } else {
      GiveUpPlace(*connection);
      if (wake_wanted_) {
        Wake();
      }
    }
  }
}

std::string FrameServer::Handle(const std::string& request, Connection& connection) {
  if (options_.file_handler) {
    return options_.file_handler(request, std::move(connection.file));
  }
  return options_.peer_handler ? options_.peer_handler(request, connection.peer)
                               : options_.handler(request);
}

// The request goes with the handler's call, before the reply is sent.
std::optional<std::string> FrameServer::Answer(Connection& connection) {
  const Refusal reason = connection.admitted ? Refusal::kHandlerFailed : Refusal::kNotAdmitted;
  const std::string request = std::move(connection.request);
  try {
    if (connection.admitted) {
      return Handle(request, connection);
    }
  } catch (const std::exception& error) {
    Log(Level::kError, VEXLO_SOURCE, __LINE__,
        std::string("the handler failed, reason=") + error.what());
  } catch (...) {
    Log(Level::kError, VEXLO_SOURCE, __LINE__, "the handler failed");
  }
  std::string refusal = options_.refusal ? options_.refusal(reason) : "";
  return refusal.empty() ? std::nullopt : std::optional(std::move(refusal));
}

void FrameServer::Wake() {
  const uint64_t one = 1;
  while (write(wake_.Get(), &one, sizeof(one)) < 0 && errno == EINTR) {
  }
}

}  // namespace vexlo::daemon
