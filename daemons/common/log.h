// The daemons' own lines in the log: one an event, with a level, at no rate that fills the disk.
#ifndef DAEMONS_COMMON_LOG_H_
#define DAEMONS_COMMON_LOG_H_

#include <syslog.h>

#include <chrono>
#include <cstddef>
#include <cstdint>
#include <map>
#include <mutex>
#include <string>
#include <utility>

namespace vexlo::daemon {

// Of syslog: errors lose something or need somebody; warnings mend themselves or cost little;
// notices are good to know.
enum class Level { kError = LOG_ERR, kWarning = LOG_WARNING, kNotice = LOG_NOTICE };

// How often each place in the code may write. Not thread-safe.
class LogRate {
 public:
  using Clock = std::chrono::steady_clock;
  static constexpr uint64_t kMostInPeriod = 20;
  static constexpr std::chrono::seconds kPeriod{60};

  // Whether the place may write now. When a period has ended of which lines were held back,
  // `held_back` is their number, else 0.
  bool Admit(const char* source, int line, Clock::time_point now, uint64_t* held_back);

 private:
  struct Place {
    Clock::time_point since;
    uint64_t lines = 0;
  };
  std::map<std::pair<const char*, int>, Place> places_;
};

// Writes "SOURCE:LINE text" to syslog. Control characters are written as "\012", since a path may
// hold a line break; what is longer than kMostLogBytes is cut. Of more than 20 lines that one place
// writes in a minute the rest are counted, and the place's next line after it says how many there
// were. What is in files is never part of a text. Any thread.
constexpr size_t kMostLogBytes = 4096;
void Log(Level level, const char* source, int line, const std::string& text);

}  // namespace vexlo::daemon

#endif  // DAEMONS_COMMON_LOG_H_
