#include "support/syslog_capture.h"

#include <syslog.h>

#include <cstdarg>
#include <cstdio>
#include <cstdlib>
#include <mutex>
#include <utility>

namespace {

std::mutex mutex;
std::vector<std::string> captured;

}  // namespace

std::vector<std::string> SyslogCapture::Take() {
  const std::lock_guard<std::mutex> lock(mutex);
  return std::exchange(captured, {});
}

// Stands before the C library's; exported, so that it does for calls from the shared library too.
extern "C" __attribute__((visibility("default"))) void syslog(int priority, const char* format,
                                                              ...) {
  char* text = nullptr;  // A log line is as long as the queue line that it quotes.
  va_list arguments;
  va_start(arguments, format);
  const bool made = vasprintf(&text, format, arguments) >= 0;
  va_end(arguments);
  const std::lock_guard<std::mutex> lock(mutex);
  if (made) {
    captured.push_back("<" + std::to_string(priority) + ">" + text);
    free(text);
  }
}
