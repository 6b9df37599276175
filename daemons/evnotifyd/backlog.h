// What is still to be appended to a queue file. No I/O and no clock.
#ifndef DAEMONS_EVNOTIFYD_BACKLOG_H_
#define DAEMONS_EVNOTIFYD_BACKLOG_H_

#include <cstddef>
#include <cstdint>
#include <string>
#include <vector>

#include "watch/queue_line.h"

namespace vexlo::evnotifyd {

// Lines in order, up to a bound. What goes over it is not lost in silence: all that waits is
// replaced by one line for each root that says so (kMaskCrashed), and makes whoever reads the queue
// look at everything anew.
class Backlog {
 public:
  explicit Backlog(size_t most_bytes) : most_bytes_(most_bytes) {}

  // The folders that a loss is told of.
  void SetRoots(std::vector<std::string> roots) { roots_ = std::move(roots); }

  void Add(const watch::QueueEvent& event);

  // All that waits, as it goes into the queue.
  const std::string& Text() const { return text_; }
  uint64_t Lines() const { return lines_; }
  uint64_t Crashed() const { return crashed_; }  // How many of them are of kMaskCrashed.

  // The lines have been appended.
  void Clear();

 private:
  void Append(const watch::QueueEvent& event);

  const size_t most_bytes_;
  std::vector<std::string> roots_;
  std::string text_;
  uint64_t lines_ = 0;
  uint64_t crashed_ = 0;
};

}  // namespace vexlo::evnotifyd

#endif  // DAEMONS_EVNOTIFYD_BACKLOG_H_
