// The failure check and the log lines of the library.
//
// Every line goes to syslog at error priority and begins "SOURCE:LINE ". A monitor that watches for
// one of them matches source and line, so sites whose line is written out in the code (LogSite)
// keep it when the code moves. Any thread may log.
#ifndef COMMON_CHECK_H_
#define COMMON_CHECK_H_

#include <cerrno>
#include <cstddef>
#include <string>
#include <string_view>

#include "common/error.h"
#include "common/export.h"

namespace vexlo {

// Where a line comes from. All texts outlive the call; `condition` is the failing test as text.
struct LogSite {
  const char* source;     // The file's name without folder and extension, or its module's.
  int line;               // From 1.
  const char* function;   // Its bare name.
  const char* condition;  // As it stands in the code.
};

// "SOURCE:LINE text".
VEXLO_EXPORT void LogLine(const char* source, int line, const std::string& text);

// "SOURCE:LINE (pid, euid) (function) text". A non-zero `error` is an errno: " [err: ...]" with its
// meaning follows the text, and errno is 0 afterwards so that a later line does not report it
// again.
VEXLO_EXPORT void LogContext(const LogSite& site, const std::string& text, int error);

// LogContext() with "Failed [condition]", for failures that are not thrown.
VEXLO_EXPORT void LogFailure(const LogSite& site, int error);

// LogContext() with "Failed [condition], reason: reason".
VEXLO_EXPORT void LogFailure(const LogSite& site, const std::string& reason, int error);

// Logs like the above, then throws Error(code, reason).
[[noreturn]] VEXLO_EXPORT void FailCheck(const LogSite& site, ErrorCode code,
                                         const std::string& reason, int error);

namespace internal {

struct SourceName {
  char text[32] = {};
};

// The name a source file logs under: the folder's where a folder is one module, else the file's
// own without its extension.
consteval SourceName SourceNameOf(std::string_view file) {
  for (const std::string_view folder : {"/optree/", "/util/", "/index_mgr/"}) {
    if (file.starts_with(folder.substr(1)) || file.find(folder) != std::string_view::npos) {
      file = folder.substr(1, folder.size() - 2);
      break;
    }
  }
  if (const size_t slash = file.rfind('/'); slash != std::string_view::npos) {
    file.remove_prefix(slash + 1);
  }
  if (const size_t dot = file.rfind('.'); dot != std::string_view::npos) {
    file = file.substr(0, dot);
  }
  SourceName name;
  for (size_t i = 0; i < file.size() && i + 1 < sizeof(name.text); ++i) {
    name.text[i] = file[i];
  }
  return name;
}

}  // namespace internal
}  // namespace vexlo

// The name that this source file logs under, as a const char*.
#define VEXLO_SOURCE                                                              \
  ([]() -> const char* {                                                          \
    static constexpr auto vexlo_name = ::vexlo::internal::SourceNameOf(__FILE__); \
    return static_cast<const char*>(vexlo_name.text);                             \
  }())

// Fails when `failed` is true: logs the condition's text and the reason, then throws
// Error(code, reason). `reason` is evaluated only then, with errno as the condition left it.
#define VEXLO_CHECK(failed, code, reason)                                               \
  do {                                                                                  \
    if (failed) {                                                                       \
      const int vexlo_errno = errno;                                                    \
      ::vexlo::FailCheck({VEXLO_SOURCE, __LINE__, __func__, #failed}, (code), (reason), \
                         vexlo_errno);                                                  \
    }                                                                                   \
  } while (false)

// The same for a site whose source, line, function or condition text is fixed: `site` is a LogSite.
#define VEXLO_CHECK_AT(site, failed, code, reason)               \
  do {                                                           \
    if (failed) {                                                \
      const int vexlo_errno = errno;                             \
      ::vexlo::FailCheck((site), (code), (reason), vexlo_errno); \
    }                                                            \
  } while (false)

#endif  // COMMON_CHECK_H_
