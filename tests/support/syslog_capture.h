// Collects what is written to syslog.
#ifndef SUPPORT_SYSLOG_CAPTURE_H_
#define SUPPORT_SYSLOG_CAPTURE_H_

#include <string>
#include <vector>

// Programs that link this never reach the system's log. The lines of every thread are collected,
// formatted as syslog would ("%m" included).
class SyslogCapture {
 public:
  SyslogCapture() { Take(); }

  // The lines since construction or the last call. Each begins "<PRIORITY>".
  std::vector<std::string> Take();
};

#endif  // SUPPORT_SYSLOG_CAPTURE_H_
