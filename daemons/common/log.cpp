#include "daemons/common/log.h"

#include <cstdio>

#include "kavo/local/mutex.h"

namespace vexlo::daemon {
namespace {

std::string Printable(const std::string& text) {
  std::string printable;
  printable.reserve(text.size());
  for (const char character : text) {
    if (printable.size() >= kMostLogBytes) {
      return printable + "...";
    }
    const auto byte = static_cast<unsigned char>(character);
    if (byte < 0x20 || byte == 0x7F) {
      char escaped[8];
      (void)snprintf(escaped, sizeof(escaped), "\\%03o", byte);
      printable += escaped;
    } else {
      printable += character;
    }
  }
  return printable;
}

}  // namespace

bool LogRate::Admit(const char* source, int line, Clock::time_point now, uint64_t* held_back) {
  *held_back = 0;
  const auto [found, is_new] = places_.try_emplace({source, line});
  Place& place = found->second;
  if (is_new || now - place.since >= kPeriod) {
    *held_back = place.lines > kMostInPeriod ? place.lines - kMostInPeriod : 0;
    place = {now, 0};
  }
  return ++place.lines <= kMostInPeriod;
}

void Log(Level level, const char* source, int line, const std::string& text) {
  static kavo::local::Mutex mutex;
  static LogRate rate KAVO_GUARDED_BY(mutex);
  uint64_t held_back = 0;
  {
    const kavo::local::MutexLock lock(mutex);
    if (!rate.Admit(source, line, LogRate::Clock::now(), &held_back)) {
      return;
    }
  }
  const int priority = static_cast<int>(level);
  if (held_back > 0) {
    syslog(priority, "%s:%d %llu more lines like this were held back", source, line,
           static_cast<unsigned long long>(held_back));
  }
  syslog(priority, "%s:%d %s", source, line, Printable(text).c_str());
}

}  // namespace vexlo::daemon
