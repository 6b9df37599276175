// "fileindex watch": changes in folders as operations, live.
#include <poll.h>
#include <signal.h>
#include <sys/signalfd.h>
#include <unistd.h>

#include <algorithm>
#include <cerrno>
#include <charconv>
#include <chrono>
#include <cmath>
#include <cstdio>
#include <cstdlib>
#include <cstring>
#include <optional>
#include <string>

#include "cli/command.h"
#include "cli/operation_writer.h"
#include "cli/stop_signals.h"
#include "cli/text.h"
#include "common/error.h"
#include "common/file.h"
#include "fileindex/queue_mgr.h"
#include "watch/queue_line.h"
#include "watch/watcher.h"

namespace vexlo::cli {
namespace {

using Clock = std::chrono::steady_clock;
using watch::QueueEvent;
using watch::Watcher;

constexpr double kDefaultIntervalSeconds = 1;
constexpr double kMostIntervalSeconds = 86400;
constexpr int64_t kMostPollMilliseconds = 3'600'000;

std::chrono::milliseconds IntervalOf(const Arguments& arguments) {
  double seconds = kDefaultIntervalSeconds;
  if (arguments.Has("--interval")) {
    const std::string text = arguments.Get("--interval");
    const auto [end, error] = std::from_chars(text.data(), text.data() + text.size(), seconds);
    if (error != std::errc() || end != text.data() + text.size() || !(seconds > 0) ||
        seconds > kMostIntervalSeconds) {
      throw UsageError("'" + text + "' is no interval: seconds, above 0 and up to 86400");
    }
  }
  return std::max(std::chrono::milliseconds(std::llround(seconds * 1000)),
                  std::chrono::milliseconds(1));
}

std::vector<std::string> RootsOf(const Arguments& arguments) {
  std::vector<std::string> roots;
  for (const std::string& folder : arguments.positional) {
    const std::string path = RealPath(folder);
    if (path.empty()) {
      throw Failure("the folder '" + folder + "' cannot be found: " + strerror(errno));
    }
    if (!IsDirExist(path, /*follow_link=*/false)) {
      throw Failure("'" + folder + "' is no folder");
    }
    roots.push_back(path);
  }
  return roots;
}

// The queue that the events go through: the caller's, or one of our own that goes with us.
class QueueFile {
 public:
  explicit QueueFile(const std::string& given) {
    if (!given.empty()) {
      // As the watcher names it, whose folders have no links in their paths: it must know its own.
      path_ = AbsolutePath(given);
      const size_t slash = path_.rfind('/');
      const std::string folder = RealPath(path_.substr(0, std::max<size_t>(slash, 1)));
      if (!folder.empty()) {
        path_.replace(0, slash, folder == "/" ? "" : folder);
      }
      return;
    }
    const char* const base = getenv("TMPDIR");
    const std::string parent = AbsolutePath(base == nullptr || *base == '\0' ? "/tmp" : base);
    const std::string real = RealPath(parent);
    folder_ = (real.empty() ? parent : real) + "/fileindex-watch.XXXXXX";
    if (mkdtemp(folder_.data()) == nullptr) {
      const int error = errno;
      throw Failure("a folder for the queue cannot be made, '" + std::exchange(folder_, "") +
                    "': " + strerror(error));
    }
    path_ = folder_ + "/queue";
  }
  ~QueueFile() {
    if (!folder_.empty()) {
      unlink(path_.c_str());
      unlink((path_ + ".tmp").c_str());
      rmdir(folder_.c_str());
    }
  }
  QueueFile(const QueueFile&) = delete;
  QueueFile& operator=(const QueueFile&) = delete;

  const std::string& Path() const { return path_; }

  // What the watcher must not report, or it would report its own reports for ever.
  std::vector<std::string> Ignored() const {
    std::vector<std::string> ignored = {path_, path_ + ".tmp"};
    if (!folder_.empty()) {
      ignored.push_back(folder_);
    }
    return ignored;
  }

 private:
  std::string folder_;
  std::string path_;
};

// Ctrl-C and its like as something to poll, from here on.
class StopSignals {
 public:
  StopSignals() {
    const sigset_t stop = StopSignalSet();
    sigprocmask(SIG_BLOCK, &stop, nullptr);
    fd_ = signalfd(-1, &stop, SFD_CLOEXEC | SFD_NONBLOCK);
    if (fd_ < 0) {
      throw Failure(std::string("signals cannot be waited for: ") + strerror(errno));
    }
  }
  ~StopSignals() { close(fd_); }
  StopSignals(const StopSignals&) = delete;
  StopSignals& operator=(const StopSignals&) = delete;

  int Fd() const { return fd_; }

 private:
  int fd_ = -1;
};

// The notify daemon and the index daemon in one: appends what the watcher sees, and each interval
// takes a snapshot, folds and prints it, and deletes it.
class Session {
 public:
  Session(const Arguments& arguments, const Console& console)
      : console_(console),
        interval_(IntervalOf(arguments)),
        queue_(arguments.Get("--queue")),
        writer_(console, arguments.Has("--json")),
        watcher_(
            RootsOf(arguments), Options(),
            [this](QueueEvent&& event) {
              lines_ += watch::QueueLine(event);
              ++events_;
            },
            Clock::now()) {
    // What an earlier run left is delivered first.
    if (IsFileExist(queue_.Path()) || IsFileExist(queue_.Path() + ".tmp")) {
      next_cycle_ = Clock::now();
    }
  }

  void Run(const Arguments& arguments) {
    Introduce(arguments);
    while (!WaitForStop()) {
      const Clock::time_point now = Clock::now();
      watcher_.Poll(now);
      Append(now);
      if (next_cycle_.has_value() && *next_cycle_ <= now) {
        Cycle();
      }
      TellState();
    }
    watcher_.Poll(Clock::now());
    Append(Clock::now());
    // A snapshot of an earlier run is delivered alone: the second round takes what is live.
    for (int round = 0; round < 2 && next_cycle_.has_value(); ++round) {
      Cycle();
    }
    Summarise();
  }

 private:
  watch::WatchOptions Options() const {
    watch::WatchOptions options;
    options.ignored = queue_.Ignored();
    return options;
  }

  // True when the session is to end, false when there is something to do.
  bool WaitForStop() {
    Clock::time_point wake = watcher_.NextDeadline();
    if (next_cycle_.has_value()) {
      wake = std::min(wake, *next_cycle_);
    }
    // The watcher's deadline may be as early as can be, too early to count from.
    const Clock::time_point now = Clock::now();
    const auto wait = std::chrono::ceil<std::chrono::milliseconds>(std::max(wake, now) - now);
    pollfd fds[] = {{stop_.Fd(), POLLIN, 0}, {watcher_.fd(), POLLIN, 0}};
    const int timeout = static_cast<int>(std::min<int64_t>(wait.count(), kMostPollMilliseconds));
    if (poll(fds, std::size(fds), timeout) < 0 && errno != EINTR) {
      throw Failure(std::string("waiting for changes failed: ") + strerror(errno));
    }
    return (fds[0].revents & POLLIN) != 0;
  }

  void Append(Clock::time_point now) {
    if (lines_.empty()) {
      return;
    }
    try {
      AppendLines(queue_.Path(), lines_);
    } catch (const Error& error) {
      throw Failure("the queue '" + queue_.Path() +
                    "' cannot be written: " + CauseOf(error.what()));
    }
    lines_.clear();
    if (!next_cycle_.has_value()) {
      next_cycle_ = now + interval_;
    }
  }

  void Cycle() {
    // Of no use for a second snapshot: a manager keeps the tree that it built.
    fileindex::QueueMgr queue(queue_.Path());
    try {
      queue.ProcessOP([this](const std::shared_ptr<fileindex::OP>& op) { writer_.Write(op); },
                      /*use_tmp=*/true);
    } catch (const Error& error) {
      throw Failure("the queue '" + queue_.Path() + "' cannot be read: " + CauseOf(error.what()));
    }
    console_.out.flush();
    if (!console_.out) {
      throw Failure("the output cannot be written");  // The snapshot stays for the next run.
    }
    queue.DeleteTmp();
    next_cycle_.reset();
    if (IsFileExist(queue_.Path())) {
      next_cycle_ = Clock::now() + interval_;
    }
  }

  void Introduce(const Arguments& arguments) {
    const watch::WatchState state = watcher_.State();
    console_.err << "watching " << Counted(state.watched, "folder") << " below";
    for (const std::string& folder : arguments.positional) {
      console_.err << " " << ForTerminal(folder);
    }
    console_.err << "; Ctrl-C ends it\n";
    if (console_.err_is_terminal && !arguments.Has("--json")) {
      console_.err << "[01] remove  [02] index  [03] attributes  [05] rename  [06] index with all "
                      "below  [07] rebuild\n";
    }
    console_.err.flush();
    TellState();
  }

  void TellState() {
    const watch::WatchState state = watcher_.State();
    if (state.text != told_) {
      told_ = state.text;
      console_.err << "fileindex watch: "
                   << (told_.empty() ? "live again: every folder is watched" : told_) << std::endl;
    }
  }

  void Summarise() {
    if (events_ == 0 && writer_.GetCount() == 0) {
      console_.err << "no changes seen\n";
      return;
    }
    char factor[32];
    (void)snprintf(factor, sizeof(factor), "%.1f",
                   static_cast<double>(events_) /
                       static_cast<double>(std::max<uint64_t>(writer_.GetCount(), 1)));
    console_.err << Counted(events_, "event") << " seen, "
                 << Counted(writer_.GetCount(), "operation") << " delivered: a factor of " << factor
                 << "\n";
  }

  const Console& console_;
  const StopSignals stop_;
  const std::chrono::milliseconds interval_;
  const QueueFile queue_;
  OperationWriter writer_;
  std::string lines_;  // Seen and not appended yet.
  uint64_t events_ = 0;
  std::optional<Clock::time_point> next_cycle_;  // None while the queue is empty.
  std::string told_;
  Watcher watcher_;
};

ExitStatus WatchFolders(const Arguments& arguments, const Console& console) {
  Session session(arguments, console);
  session.Run(arguments);
  return kDone;
}

}  // namespace

std::vector<Command> WatchCommands() {
  return {
      {"watch",
       "DIR...",
       "shows changes in folders as operations, live",
       "Watches each DIR and everything below it. Changes go into a queue file; each interval it "
       "is\n"
       "snapshot, folded and deleted, and the operations that an indexer would be handed are\n"
       "printed ('fileindex queue show --help' explains them). Symbolic links are not followed.\n"
       "Ctrl-C ends it with a summary. Where the system's limit of watches is too low, it says so\n"
       "and looks at the remaining folders every 30 seconds.\n"
       "\n"
       "  fileindex watch ~/Documents\n"
       "  fileindex watch --json --interval 5 /srv/photo /srv/music >> operations.json\n",
       {{"--json", nullptr, "one JSON object a line: op, path, path_old, data"},
        {"--interval", "SECONDS", "from the first change to its operation; default 1"},
        {"--queue", "FILE", "use this queue and keep it; default is a temporary one"}},
       {},
       1,
       static_cast<size_t>(-1),
       WatchFolders},
  };
}

}  // namespace vexlo::cli
