// The local stack's daemons as children of the tool.
#ifndef CLI_STACK_H_
#define CLI_STACK_H_

#include <sys/types.h>

#include <chrono>
#include <functional>
#include <string>
#include <vector>

#include "cli/service.h"

namespace vexlo::cli {

// Starts those of the four daemons that do not run yet, and ends them: by Stop(), or by SIGTERM
// from the kernel when the tool is killed. Their lines go to files below the root. The programs are
// those beside the tool's own. For a program of one thread that blocks what StopSignalSet() gives;
// the daemons do not inherit that, and signals of the terminal do not reach them.
class Stack {
 public:
  // Told when a daemon has ended unasked, and of those that are somebody else's.
  using Notice = std::function<void(const std::string& sentence)>;

  explicit Stack(Notice notice);
  ~Stack();
  Stack(const Stack&) = delete;
  Stack& operator=(const Stack&) = delete;

  // Starts them in order, each when the one before listens. Throws Failure when one ends instead,
  // with the last line that it wrote, and where a socket is closed to this user. `is_stopped` is
  // asked meanwhile; false when it said so.
  bool Start(const std::function<bool()>& is_stopped);

  // Starts anew those that have ended, also those that ran before Start() and were left alone.
  // Throws Failure for one that does so again and again.
  void Tend();

  // Asks those that it started to end, the ones that depend on others first, and kills after four
  // seconds what has not ended.
  void Stop();

 private:
  using Clock = std::chrono::steady_clock;

  struct Child {
    DaemonPlace place;
    std::vector<Clock::time_point> starts;
    pid_t pid = 0;           // 0: not ours, or not running.
    int exit_status = 0;     // Of the last one that ended; -1 for a signal.
    bool is_missed = false;  // It was somebody else's, it is gone, and that was said.
  };

  void Spawn(Child& child);
  void TakeOver(Child& child);
  bool HasEnded(Child& child);
  std::string LogFile(const Child& child) const;
  std::string LastWords(const Child& child) const;

  const Notice notice_;
  std::vector<Child> children_;
};

}  // namespace vexlo::cli

#endif  // CLI_STACK_H_
