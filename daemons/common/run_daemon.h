// What every daemon's main() is but for its work: signals, pid file, log, readiness, exit status.
#ifndef DAEMONS_COMMON_RUN_DAEMON_H_
#define DAEMONS_COMMON_RUN_DAEMON_H_

#include <functional>
#include <string>
#include <vector>

#include "daemons/common/unique_fd.h"

namespace vexlo::daemon {

// Service managers and scripts compare with these numbers: never renumber.
enum ExitStatus {
  kEnded = 0,   // In order: asked to by SIGTERM or SIGINT, or the work was done.
  kFailed = 1,  // The log says why.
  kUsage = 2,
  kAlreadyRunning = 3,
};

struct DaemonOptions {
  std::string name;      // In the log and in messages: "kavoelasticd".
  std::string pid_file;  // Its folder is made when it is missing.
  // Shown behind the name by --help, and by a command line that `arguments` refuses.
  std::string usage;
  // Of a superuser's capabilities those (CAP_...) that the work needs; it keeps no others. Files of
  // its own it needs none for.
  std::vector<int> capabilities;
  // Whether it writes below the root's folders of state alone, and so can be kept from writing
  // elsewhere.
  bool keeps_to_state = true;
  // Called while there is one thread and nothing has been given up: for a process of the daemon's
  // that needs other rights. May be unset.
  std::function<void()> prepare;
  // Takes the command line, less the program's name and --help; false for one that is wrong. A path
  // among it must be made absolute here, as the work runs in "/". Unset, no argument is right.
  std::function<bool(const std::vector<std::string>&)> arguments;
  // Called at SIGHUP, on the thread that waits for signals. What it throws is logged. Unset, the
  // signal does nothing.
  std::function<void()> reload;
};

// What the work has of the daemon around it.
class Daemon {
 public:
  // Readable, and stays so, when the work must end; for poll() and epoll, never read from.
  int StopFd() const { return stop_.Get(); }

  // Tells the service manager ($NOTIFY_SOCKET) and the log that clients may come now. The thread
  // that waits for signals gives the signs of life that the manager wants ($WATCHDOG_USEC).
  void Ready();

  // Ends the process without destructors, for work that cannot be brought to an end; with kEnded
  // where that is in order, as it is done again from what is on disk.
  [[noreturn]] void EndAtOnce(const std::string& reason, ExitStatus status = kFailed);

 private:
  friend int RunDaemon(const DaemonOptions& options, int argc, char** argv,
                       const std::function<void(Daemon&)>& work);
  explicit Daemon(const DaemonOptions& options);

  const DaemonOptions& options_;
  UniqueFd stop_;
};

// Runs work(daemon) on the calling thread, in the foreground, and returns the exit status. Called
// once, by main(), before there are other threads: SIGTERM, SIGINT and SIGHUP stay blocked in all
// of them, and one thread waits for them. SIGPIPE is ignored.
//
// Before the work it gives up the capabilities that are not wanted, what ForbidAdministration()
// has, and where the kernel can do it, to write elsewhere than in its folders. CAP_DAC_OVERRIDE
// stays, and the log says so, where a superuser runs it on folders of state that are another
// user's.
//
// The folder of all daemons' state, "/var/lib/kavo" below the root, is made when it is missing, and
// closed to other users.
//
// While it runs it holds an flock on the pid file; where another process does, it says so and
// returns kAlreadyRunning. So whatever belongs to a daemon of this name (its socket, its files) is
// the work's alone. The file is removed at the end; one that a killed daemon left is taken over.
//
// An exception that leaves the work is logged: kFailed. So is a FILEINDEX_ROOT in the environment
// that is no absolute path. The log is syslog, and standard error
// unless that goes to the journal, which has the lines of syslog already.
int RunDaemon(const DaemonOptions& options, int argc, char** argv,
              const std::function<void(Daemon&)>& work);

}  // namespace vexlo::daemon

#endif  // DAEMONS_COMMON_RUN_DAEMON_H_
