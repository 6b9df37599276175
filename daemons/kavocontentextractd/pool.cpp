#include "daemons/kavocontentextractd/pool.h"

#include <fcntl.h>
#include <poll.h>
#include <spawn.h>
#include <sys/socket.h>
#include <sys/syscall.h>
#include <sys/wait.h>
#include <unistd.h>

#include <algorithm>
#include <cerrno>
#include <csignal>
#include <cstring>
#include <iterator>
#include <optional>
#include <system_error>
#include <utility>

#include "common/check.h"
#include "daemons/common/log.h"
#include "kavo/local/frames.h"

namespace vexlo::extractd {
namespace {

using Clock = std::chrono::steady_clock;

constexpr char kEnding[] = "kavocontentextractd ends";
// From the end of a worker's socket to that of the worker.
constexpr int kEndMilliseconds = 500;
// Of a worker that cannot be confined.
constexpr size_t kMaxComplaintBytes = 256;

// The C library's errors come as return values here.
class SpawnSetup {
 public:
  SpawnSetup() {
    posix_spawn_file_actions_init(&actions_);
    posix_spawnattr_init(&attributes_);
  }
  ~SpawnSetup() {
    posix_spawn_file_actions_destroy(&actions_);
    posix_spawnattr_destroy(&attributes_);
  }
  SpawnSetup(const SpawnSetup&) = delete;
  SpawnSetup& operator=(const SpawnSetup&) = delete;

  // A worker has its socket and nothing else of the daemon's: neither files nor blocked signals,
  // nor the terminal's Ctrl-C, which is the daemon's to answer. What its libraries print is
  // nobody's.
  int Prepare(int socket) {
    sigset_t none;
    sigset_t all;
    sigemptyset(&none);
    sigfillset(&all);
    int error = 0;
    for (const int standard : {STDIN_FILENO, STDOUT_FILENO, STDERR_FILENO}) {
      error = error != 0
                  ? error
                  : posix_spawn_file_actions_addopen(&actions_, standard, "/dev/null", O_RDWR, 0);
    }
    error = error != 0 ? error : posix_spawn_file_actions_adddup2(&actions_, socket, kWorkerSocket);
    error = error != 0 ? error : posix_spawnattr_setsigmask(&attributes_, &none);
    error = error != 0 ? error : posix_spawnattr_setsigdefault(&attributes_, &all);
    error = error != 0 ? error : posix_spawnattr_setpgroup(&attributes_, 0);
    return error != 0 ? error
                      : posix_spawnattr_setflags(&attributes_, POSIX_SPAWN_SETSIGMASK |
                                                                   POSIX_SPAWN_SETSIGDEF |
                                                                   POSIX_SPAWN_SETPGROUP);
  }
  int Spawn(pid_t* pid, const std::string& program, char** arguments) {
    return posix_spawn(pid, program.c_str(), &actions_, &attributes_, arguments, environ);
  }

 private:
  posix_spawn_file_actions_t actions_;
  posix_spawnattr_t attributes_;
};

std::string StatusText(int status) {
  return WIFSIGNALED(status)
             ? "ended by signal " + std::to_string(WTERMSIG(status)) + " while it read the file"
             : "ended with status " + std::to_string(WEXITSTATUS(status)) +
                   " while it read the file";
}

}  // namespace

class Pool::Worker {
 public:
  Worker(daemon::UniqueFd socket, pid_t pid) : socket_(std::move(socket)), pid_(pid) {}
  ~Worker() { Kill(); }
  Worker(const Worker&) = delete;
  Worker& operator=(const Worker&) = delete;

  // Null with the reason in `text`.
  static std::unique_ptr<Worker> Start(const PoolOptions& options, std::string& text) {
    int ends[2] = {-1, -1};
    if (socketpair(AF_UNIX, SOCK_STREAM | SOCK_CLOEXEC, 0, ends) != 0) {
      text = "socketpair failed, reason=" + std::generic_category().message(errno);
      return nullptr;
    }
    daemon::UniqueFd ours(ends[0]);
    daemon::UniqueFd theirs(ends[1]);
    if (theirs.Get() == kWorkerSocket) {  // A duplicate onto itself would be closed by the exec.
      theirs = daemon::UniqueFd(fcntl(theirs.Get(), F_DUPFD_CLOEXEC, kWorkerSocket + 1));
    }
    std::string words[] = {"kavocontentextractd", "--worker", std::to_string(options.memory),
                           std::to_string(options.account.uid),
                           std::to_string(options.account.gid)};
    char* arguments[std::size(words) + 1] = {};
    std::transform(std::begin(words), std::end(words), arguments,
                   [](std::string& word) { return word.data(); });
    SpawnSetup setup;
    pid_t pid = -1;
    int error = setup.Prepare(theirs.Get());
    error = error != 0 ? error : setup.Spawn(&pid, options.program, arguments);
    if (error != 0) {
      text = "a worker cannot be started, reason=" + std::generic_category().message(error);
      return nullptr;
    }
    theirs.Reset();
    auto worker = std::make_unique<Worker>(std::move(ours), pid);
    std::string complaint;
    if (!kavo::local::ReceiveFrame(worker->socket_.Get(), kMaxComplaintBytes, complaint, nullptr,
                                   Clock::now() + options.start_limit)) {
      text = "a worker does not get ready, reason=" + std::generic_category().message(errno);
      return nullptr;
    }
    if (!complaint.empty()) {
      text = "a worker cannot be confined, reason=" + complaint;
      return nullptr;
    }
    return worker;
  }

  // One that ended, or says something unasked, is of no use.
  bool IsIdle() const {
    struct pollfd socket = {socket_.Get(), POLLIN, 0};
    return poll(&socket, 1, 0) == 0;
  }

  Outcome Ask(const std::string& request, int file, kavo::local::Deadline deadline) {
    ++served_;
    std::string reply;
    if (kavo::local::SendFrame(socket_.Get(), request, file, deadline) &&
        kavo::local::ReceiveFrame(socket_.Get(), kMaxReplyBytes, reply, nullptr, deadline)) {
      return {Outcome::kReply, std::move(reply)};
    }
    const int error = errno;
    if (error == EMSGSIZE) {
      Kill();
      return {Outcome::kDied, "the worker's reply is too long"};
    }
    if (error == ETIMEDOUT) {
      Kill();
      return {Outcome::kDeadline, ""};
    }
    const std::optional<int> status = Kill();
    if (status && WIFEXITED(*status) && WEXITSTATUS(*status) == kOutOfMemory) {
      return {Outcome::kMemory, ""};
    }
    const bool is_killed = status && WIFSIGNALED(*status) && WTERMSIG(*status) == SIGKILL;
    return {is_killed ? Outcome::kKilled : Outcome::kDied,
            status ? "the worker " + StatusText(*status) : "the worker is gone"};
  }

  int Socket() const { return socket_.Get(); }
  size_t Served() const { return served_; }
  bool IsAlive() const { return pid_ > 0; }

 private:
  // Ends it, if it has not ended. How it did so; nothing when it had to be ended.
  std::optional<int> Kill() {
    if (pid_ <= 0) {
      return std::nullopt;
    }
    int status = 0;
    // One that closed its socket is about to end, and how is worth knowing.
    struct pollfd peer = {socket_.Get(), 0, 0};
    if (poll(&peer, 1, 0) == 1 && (peer.revents & POLLHUP) != 0) {
      const daemon::UniqueFd process(static_cast<int>(syscall(SYS_pidfd_open, pid_, 0)));
      struct pollfd end = {process.Get(), POLLIN, 0};
      poll(&end, 1, kEndMilliseconds);
    }
    const bool has_ended = waitpid(pid_, &status, WNOHANG) == pid_;
    if (!has_ended) {
      kill(pid_, SIGKILL);
      while (waitpid(pid_, &status, 0) < 0 && errno == EINTR) {
      }
    }
    pid_ = -1;
    return has_ended ? std::optional(status) : std::nullopt;
  }

  daemon::UniqueFd socket_;
  pid_t pid_;
  size_t served_ = 0;
};

Pool::Pool(PoolOptions options) : options_(std::move(options)) {}

Pool::~Pool() = default;

// Null when one must be started.
std::unique_ptr<Pool::Worker> Pool::TakeIdle(bool new_worker) {
  while (!idle_.empty()) {
    std::unique_ptr<Worker> worker = std::move(idle_.back());
    idle_.pop_back();
    if (new_worker) {
      break;  // It makes room for the new one.
    }
    if (worker->IsIdle()) {
      return worker;
    }
  }
  return nullptr;
}

std::unique_ptr<Pool::Worker> Pool::Take(bool new_worker, Outcome& refusal) {
  kavo::local::MutexLock lock(mutex_);
  const bool is_free = came_free_.WaitFor(
      lock, options_.wait_limit,
      [this]() KAVO_REQUIRES(mutex_) { return taken_ < options_.workers || stopping_; });
  if (!is_free || stopping_) {
    refusal.text = stopping_ ? kEnding : "every worker is busy";
    return nullptr;
  }
  ++taken_;
  std::unique_ptr<Worker> worker = TakeIdle(new_worker);
  if (worker == nullptr) {
    lock.Unlock();
    worker = Worker::Start(options_, refusal.text);
    lock.Lock();
  }
  if (worker == nullptr) {
    daemon::Log(daemon::Level::kWarning, VEXLO_SOURCE, __LINE__, refusal.text);
    --taken_;
    came_free_.NotifyOne();
  } else {
    busy_.insert(worker->Socket());
  }
  return worker;
}

void Pool::GiveBack(std::unique_ptr<Worker> worker) {
  const bool is_alive = worker->IsAlive();
  const bool is_used_up = !is_alive || worker->Served() >= options_.files_per_worker;
  const kavo::local::MutexLock lock(mutex_);
  busy_.erase(worker->Socket());
  --taken_;
  deaths_ += is_alive || stopping_ ? 0 : 1;
  if (is_used_up) {
    worker.reset();
  } else {
    idle_.push_back(std::move(worker));
  }
  came_free_.NotifyOne();
}

Pool::Outcome Pool::Run(const std::string& request, int file, bool new_worker) {
  Outcome outcome = {Outcome::kNoWorker, ""};
  std::unique_ptr<Worker> worker = Take(new_worker, outcome);
  if (worker == nullptr) {
    return outcome;
  }
  outcome = worker->Ask(request, file, Clock::now() + options_.deadline);
  GiveBack(std::move(worker));
  const kavo::local::MutexLock lock(mutex_);
  return stopping_ && outcome.kind != Outcome::kReply ? Outcome{Outcome::kNoWorker, kEnding}
                                                      : std::move(outcome);
}

void Pool::Stop() {
  const kavo::local::MutexLock lock(mutex_);
  stopping_ = true;
  for (const int socket : busy_) {
    shutdown(socket, SHUT_RDWR);  // Whoever waits on it takes the worker for dead.
  }
  came_free_.NotifyAll();
}

size_t Pool::Workers() {
  const kavo::local::MutexLock lock(mutex_);
  return idle_.size() + taken_;
}

size_t Pool::Deaths() {
  const kavo::local::MutexLock lock(mutex_);
  return deaths_;
}

}  // namespace vexlo::extractd
