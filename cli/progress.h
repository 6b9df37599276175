// A progress bar.
#ifndef CLI_PROGRESS_H_
#define CLI_PROGRESS_H_

#include <chrono>
#include <cstdint>
#include <ostream>

#include "cli/command.h"

namespace vexlo::cli {

// Drawn on the error stream, when that is a terminal, from a second after the beginning, ten times
// a second at the most; wiped away at the end.
class ProgressBar {
 public:
  explicit ProgressBar(const Console& console);
  ~ProgressBar();
  ProgressBar(const ProgressBar&) = delete;
  ProgressBar& operator=(const ProgressBar&) = delete;

  void Show(uint64_t bytes_done, uint64_t bytes_total, uint64_t lines);

 private:
  using Clock = std::chrono::steady_clock;

  std::ostream& err_;
  const bool wanted_;
  const Clock::time_point begin_;
  Clock::time_point next_;
  bool drawn_ = false;
};

}  // namespace vexlo::cli

#endif  // CLI_PROGRESS_H_
