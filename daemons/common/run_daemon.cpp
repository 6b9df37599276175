#include "daemons/common/run_daemon.h"

#include <fcntl.h>
#include <linux/capability.h>
#include <poll.h>
#include <sys/eventfd.h>
#include <sys/file.h>
#include <sys/resource.h>
#include <sys/signalfd.h>
#include <sys/socket.h>
#include <sys/stat.h>
#include <sys/un.h>
#include <syslog.h>

#include <algorithm>
#include <cerrno>
#include <climits>
#include <csignal>
#include <cstddef>
#include <cstdint>
#include <cstdio>
#include <cstdlib>
#include <cstring>
#include <filesystem>
#include <iterator>
#include <stdexcept>
#include <system_error>
#include <thread>

#include "daemons/common/folders.h"
#include "daemons/common/sandbox.h"
#include "kavo/local/shares.h"

namespace vexlo::daemon {
namespace {

// Enough for every connection and database; above it only a leak would come.
constexpr rlim_t kWantedFiles = 65536;

[[noreturn]] void Throw(const std::string& what) {
  throw std::system_error(errno, std::system_category(), what);
}

class AlreadyRunning : public std::runtime_error {
  using std::runtime_error::runtime_error;
};

class PidFile {
 public:
  explicit PidFile(const std::string& path) : path_(path) {
    std::filesystem::create_directories(std::filesystem::path(path).parent_path());
    // One that ends removes its file: a lock on a file that is gone excludes nobody.
    do {
      fd_ = UniqueFd(open(path.c_str(), O_RDWR | O_CREAT | O_CLOEXEC | O_NOFOLLOW, 0644));
      if (fd_.Get() < 0) {
        Throw("open failed, path=" + path);
      }
      if (flock(fd_.Get(), LOCK_EX | LOCK_NB) != 0) {
        if (errno == EWOULDBLOCK) {
          throw AlreadyRunning("already running, pid " + Holder() + " holds " + path);
        }
        Throw("flock failed, path=" + path);
      }
    } while (!IsThere());
    const std::string pid = std::to_string(getpid()) + "\n";
    if (ftruncate(fd_.Get(), 0) != 0 ||
        pwrite(fd_.Get(), pid.data(), pid.size(), 0) != static_cast<ssize_t>(pid.size())) {
      Throw("write failed, path=" + path);
    }
  }
  ~PidFile() { unlink(path_.c_str()); }
  PidFile(const PidFile&) = delete;
  PidFile& operator=(const PidFile&) = delete;

 private:
  bool IsThere() const {
    struct stat locked {};
    struct stat named {};
    return fstat(fd_.Get(), &locked) == 0 && stat(path_.c_str(), &named) == 0 &&
           locked.st_dev == named.st_dev && locked.st_ino == named.st_ino;
  }
  std::string Holder() const {
    char text[16];
    const ssize_t count = pread(fd_.Get(), text, sizeof(text), 0);
    std::string pid(text, count > 0 ? static_cast<size_t>(count) : 0);
    pid.erase(std::find(pid.begin(), pid.end(), '\n'), pid.end());
    return pid.empty() ? "(not written yet)" : pid;
  }

  std::string path_;
  UniqueFd fd_;
};

void Raise(int event_fd) {
  const uint64_t one = 1;
  while (write(event_fd, &one, sizeof(one)) < 0 && errno == EINTR) {
  }
}

// A datagram of the service manager's protocol; nothing where none is wanted.
void Notify(const std::string& state) {
  // NOLINTNEXTLINE(concurrency-mt-unsafe): nobody sets the environment.
  const char* const path = getenv("NOTIFY_SOCKET");
  struct sockaddr_un address {};
  const size_t length = path == nullptr ? 0 : strlen(path);
  if (length < 2 || length >= sizeof(address.sun_path) || (*path != '/' && *path != '@')) {
    return;
  }
  address.sun_family = AF_UNIX;
  memcpy(address.sun_path, path, length);
  if (*path == '@') {
    address.sun_path[0] = '\0';  // An abstract name.
  }
  const UniqueFd fd(socket(AF_UNIX, SOCK_DGRAM | SOCK_CLOEXEC, 0));
  if (sendto(fd.Get(), state.data(), state.size(), MSG_NOSIGNAL,
             reinterpret_cast<const struct sockaddr*>(&address),
             static_cast<socklen_t>(offsetof(struct sockaddr_un, sun_path) + length)) < 0) {
    syslog(LOG_WARNING, "the service manager cannot be told '%s': %m", state.c_str());
  }
}

// Half of what the service manager lets pass without a sign of life; -1 where it wants none.
int WatchdogMilliseconds() {
  // NOLINTNEXTLINE(concurrency-mt-unsafe): nobody sets the environment.
  const char* const microseconds = getenv("WATCHDOG_USEC");
  const char* const pid = getenv("WATCHDOG_PID");  // NOLINT(concurrency-mt-unsafe)
  const bool is_meant = pid == nullptr || pid == std::to_string(getpid());
  const long long count = microseconds == nullptr || !is_meant ? 0 : atoll(microseconds);
  return count <= 0 ? -1 : static_cast<int>(std::clamp<long long>(count / 2000, 1, INT_MAX));
}

// Takes the signals out of every thread's way, and waits for them on one of its own.
class SignalThread {
 public:
  SignalThread(const DaemonOptions& options, int stop_fd) : options_(options), stop_fd_(stop_fd) {
    sigset_t signals;
    sigemptyset(&signals);
    for (const int signal : {SIGTERM, SIGINT, SIGHUP}) {
      sigaddset(&signals, signal);
    }
    if (pthread_sigmask(SIG_BLOCK, &signals, nullptr) != 0 ||
        std::signal(SIGPIPE, SIG_IGN) == SIG_ERR) {
      Throw("the signals cannot be set up");
    }
    signal_fd_ = UniqueFd(signalfd(-1, &signals, SFD_CLOEXEC | SFD_NONBLOCK));
    quit_ = UniqueFd(eventfd(0, EFD_CLOEXEC));
    if (signal_fd_.Get() < 0 || quit_.Get() < 0) {
      Throw("no descriptor for the signals");
    }
    thread_ = std::thread([this] { Wait(); });
  }
  ~SignalThread() {
    Raise(quit_.Get());
    thread_.join();
  }
  SignalThread(const SignalThread&) = delete;
  SignalThread& operator=(const SignalThread&) = delete;

 private:
  void Wait() {
    const int pause = WatchdogMilliseconds();
    struct pollfd fds[] = {{signal_fd_.Get(), POLLIN, 0}, {quit_.Get(), POLLIN, 0}};
    while (fds[1].revents == 0) {
      struct signalfd_siginfo info {};
      while (read(signal_fd_.Get(), &info, sizeof(info)) == static_cast<ssize_t>(sizeof(info))) {
        Take(static_cast<int>(info.ssi_signo));
      }
      if (poll(fds, 2, pause) == 0) {
        Notify("WATCHDOG=1");
      }
    }
  }

  void Take(int signal) {
    if (signal != SIGHUP) {
      syslog(LOG_NOTICE, "ending, signal %d", signal);
      Notify("STOPPING=1");
      Raise(stop_fd_);
    } else if (options_.reload) {
      try {
        options_.reload();
        syslog(LOG_NOTICE, "reloaded");
      } catch (const std::exception& error) {
        syslog(LOG_ERR, "reloading failed: %s", error.what());
      }
    }
  }

  const DaemonOptions& options_;
  const int stop_fd_;
  UniqueFd signal_fd_;
  UniqueFd quit_;
  std::thread thread_;
};

// Services are started with few descriptors allowed, and a higher number that they may ask for.
void AllowManyFiles() {
  struct rlimit limit {};
  if (getrlimit(RLIMIT_NOFILE, &limit) == 0 && limit.rlim_cur < kWantedFiles) {
    limit.rlim_cur = std::max(limit.rlim_cur, std::min(limit.rlim_max, kWantedFiles));
    setrlimit(RLIMIT_NOFILE, &limit);
  }
}

// The journal's own standard error is known by its device and inode; the variable alone may have
// been inherited.
bool IsJournal(int fd) {
  // NOLINTNEXTLINE(concurrency-mt-unsafe): there is one thread.
  const char* const stream = getenv("JOURNAL_STREAM");
  struct stat there {};
  return stream != nullptr && fstat(fd, &there) == 0 &&
         std::to_string(there.st_dev) + ":" + std::to_string(there.st_ino) == stream;
}

// With what is below them.
constexpr const char* kWrittenFolders[] = {"/tmp", "/var/lib/kavo", "/var/packages/Vexlo/etc",
                                           "/var/run"};
constexpr char kStateFolder[] = "/var/lib/kavo";
// The folders below the root that daemons write to.
constexpr const char* kStateFolders[] = {
    "/tmp",
    "/var/lib/kavo",
    "/var/lib/kavo/elastic",
    "/var/lib/kavo/evnotify",
    "/var/lib/kavo/extract",
    "/var/lib/kavo/fileindex",
    "/var/lib/kavo/fileindex/db",
    "/var/lib/kavo/fileindex/queue",
    "/var/lib/kavo/fileindexd",
    "/var/packages/Vexlo/etc",
    "/var/run",
};

// Whether root can write there by owning it. A root folder of an ordinary user's is another matter.
bool OwnsStateFolders() {
  return std::all_of(std::begin(kStateFolders), std::end(kStateFolders), [](const char* folder) {
    struct stat info {};
    return stat((kavo::local::Root() + folder).c_str(), &info) != 0 || info.st_uid == geteuid();
  });
}

// What is in there tells of everybody's files. The sockets, which others may see, are not.
void CloseStateFolder() {
  const std::string folder = kavo::local::Root() + kStateFolder;
  MakeFolders(folder);
  struct stat info {};
  if (stat(folder.c_str(), &info) == 0 && info.st_uid == geteuid() && (info.st_mode & 077U) != 0 &&
      chmod(folder.c_str(), info.st_mode & 07700U) == 0) {
    syslog(LOG_NOTICE, "closed to other users: %s", folder.c_str());
  }
}

bool KeepToState() {
  std::vector<std::string> folders;
  folders.reserve(std::size(kWrittenFolders) + 1);
  for (const char* const folder : kWrittenFolders) {
    folders.push_back(kavo::local::Root() + folder);
    MakeFolders(folders.back());
  }
  folders.emplace_back("/dev/null");  // What programs are started with.
  return ForbidWriting(folders) != PathRule::kFailed;
}

void GiveUpRights(const DaemonOptions& options) {
  std::vector<int> capabilities = options.capabilities;
  if (geteuid() == 0 && !OwnsStateFolders()) {
    syslog(LOG_NOTICE,
           "the folders below '%s' are another user's: the right to write to any file is kept",
           kavo::local::Root().c_str());
    capabilities.push_back(CAP_DAC_OVERRIDE);
  }
  if (!KeepCapabilities(capabilities) || (kCanBeConfined && !ForbidAdministration()) ||
      (kCanBeConfined && options.keeps_to_state && !KeepToState())) {
    Throw("rights cannot be given up");
  }
}

void OpenLog(const DaemonOptions& options) {
  openlog(options.name.c_str(), LOG_PID | (IsJournal(STDERR_FILENO) ? 0 : LOG_PERROR), LOG_DAEMON);
}

}  // namespace

Daemon::Daemon(const DaemonOptions& options) : options_(options), stop_(eventfd(0, EFD_CLOEXEC)) {
  if (stop_.Get() < 0) {
    Throw("eventfd failed");
  }
}

// NOLINTNEXTLINE(readability-convert-member-functions-to-static): a daemon is what gets ready.
void Daemon::Ready() {
  Notify("READY=1\nMAINPID=" + std::to_string(getpid()));
  syslog(LOG_NOTICE, "ready");
}

void Daemon::EndAtOnce(const std::string& reason, ExitStatus status) {
  syslog(status == kEnded ? LOG_NOTICE : LOG_ERR, "ended at once: %s", reason.c_str());
  unlink(options_.pid_file.c_str());
  _exit(status);
}

int RunDaemon(const DaemonOptions& options, int argc, char** argv,
              const std::function<void(Daemon&)>& work) {
  const std::vector<std::string> arguments(argv + std::min(argc, 1), argv + argc);
  const bool help = arguments == std::vector<std::string>{"--help"};
  if (help || !(options.arguments ? options.arguments(arguments) : arguments.empty())) {
    fprintf(
        help ? stdout : stderr,
        "usage: %s%s%s\n\nexit status: %d ended in order, %d failed (the log says why), %d wrong "
        "usage, %d already running\n",
        options.name.c_str(), options.usage.starts_with('\n') ? "" : " ", options.usage.c_str(),
        kEnded, kFailed, kUsage, kAlreadyRunning);
    return help ? kEnded : kUsage;
  }
  OpenLog(options);
  try {
    if (const std::string fault = kavo::local::RootFault(); !fault.empty()) {
      throw std::runtime_error(fault);
    }
    umask(022);
    if (chdir("/") != 0) {  // A folder that is held may be of a volume that is to be unmounted.
      Throw("chdir failed, path=/");
    }
    AllowManyFiles();
    const PidFile pid_file(options.pid_file);
    CloseStateFolder();
    if (options.prepare) {
      options.prepare();
    }
    GiveUpRights(options);
    Daemon daemon(options);
    const SignalThread signals(options, daemon.StopFd());
    work(daemon);
    syslog(LOG_NOTICE, "ended");
    return kEnded;
  } catch (const AlreadyRunning& error) {
    syslog(LOG_ERR, "%s", error.what());
    return kAlreadyRunning;
  } catch (const std::exception& error) {
    syslog(LOG_ERR, "failed: %s", error.what());
  } catch (...) {
    syslog(LOG_ERR, "failed: an exception of no known type");
  }
  return kFailed;
}

}  // namespace vexlo::daemon
