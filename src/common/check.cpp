#include "common/check.h"

#include <syslog.h>
#include <unistd.h>

namespace vexlo {
namespace {

void WriteLog(const std::string& body, int error) {
  if (error == 0) {
    syslog(LOG_ERR, "%s", body.c_str());
    return;
  }
  errno = error;
#pragma GCC diagnostic push
#pragma GCC diagnostic ignored "-Wformat"  // %m is glibc's and syslog's own.
  syslog(LOG_ERR, "%s [err: %m]", body.c_str());
#pragma GCC diagnostic pop
  errno = 0;
}

std::string Prefix(const char* source, int line) {
  return std::string(source) + ":" + std::to_string(line) + " ";
}

}  // namespace

void LogLine(const char* source, int line, const std::string& text) {
  WriteLog(Prefix(source, line) + text, /*error=*/0);
}

void LogContext(const LogSite& site, const std::string& text, int error) {
  WriteLog(Prefix(site.source, site.line) + "(" + std::to_string(getpid()) + ", " +
               std::to_string(geteuid()) + ") (" + site.function + ") " + text,
           error);
}

void LogFailure(const LogSite& site, int error) {
  LogContext(site, std::string("Failed [") + site.condition + "]", error);
}

void LogFailure(const LogSite& site, const std::string& reason, int error) {
  LogContext(site, std::string("Failed [") + site.condition + "], reason: " + reason, error);
}

void FailCheck(const LogSite& site, ErrorCode code, const std::string& reason, int error) {
  LogFailure(site, reason, error);
  throw Error(code, reason);
}

}  // namespace vexlo
