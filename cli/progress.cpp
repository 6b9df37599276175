#include "cli/progress.h"

#include <algorithm>
#include <string>

#include "cli/text.h"

namespace vexlo::cli {
namespace {

constexpr auto kDelay = std::chrono::seconds(1);
constexpr auto kInterval = std::chrono::milliseconds(100);
constexpr uint64_t kWidth = 30;
constexpr const char* kWipe = "\r\033[K";

}  // namespace

ProgressBar::ProgressBar(const Console& console)
    : err_(console.err),
      wanted_(console.err_is_terminal),
      begin_(Clock::now()),
      next_(begin_ + kDelay) {}

ProgressBar::~ProgressBar() {
  if (drawn_) {
    err_ << kWipe << std::flush;
  }
}

void ProgressBar::Show(uint64_t bytes_done, uint64_t bytes_total, uint64_t lines) {
  const Clock::time_point now = Clock::now();
  if (!wanted_ || now < next_) {
    return;
  }
  next_ = now + kInterval;
  drawn_ = true;
  const uint64_t total = std::max<uint64_t>(bytes_total, 1);
  const uint64_t done = std::min(bytes_done, total);
  const auto filled = static_cast<size_t>(done * kWidth / total);
  const double seconds = std::chrono::duration<double>(now - begin_).count();
  err_ << kWipe << "[" << std::string(filled, '#') << std::string(kWidth - filled, '.') << "] "
       << done * 100 / total << " %  " << Counted(lines, "line") << ", "
       << Grouped(static_cast<uint64_t>(static_cast<double>(lines) / seconds)) << " a second"
       << std::flush;
}

}  // namespace vexlo::cli
