#include "common/check.h"

#include <gtest/gtest.h>
#include <unistd.h>

#include <cstring>

#include "common/error.h"
#include "support/syslog_capture.h"

namespace vexlo {

int FailWith(int error, const std::string& reason) {
  errno = error;
  VEXLO_CHECK(reason != "fine" || EACCES == 0, ERR_SYSTEM, reason + strerror(errno));
  return __LINE__ - 1;
}

TEST(Check, LogsOneLineThenThrows) {
  SyslogCapture log;
  const int line = FailWith(ENOENT, "fine");
  EXPECT_EQ(errno, ENOENT);
  std::vector<std::string> want;
  for (const int error : {ENOENT, 0}) {
    const std::string reason = std::string("path=/v/100%s: ") + strerror(error);
    want.push_back("<3>check_test:" + std::to_string(line) + " (" + std::to_string(getpid()) +
                   ", " + std::to_string(geteuid()) +
                   ") (FailWith) Failed [reason != \"fine\" || EACCES == 0], reason: " + reason +
                   (error == 0 ? "" : " [err: No such file or directory]"));
    try {
      FailWith(error, "path=/v/100%s: ");
      ADD_FAILURE() << "no error";
    } catch (const Error& failure) {
      EXPECT_EQ(errno, 0) << "the next check would report it again";
      EXPECT_EQ(failure.GetErrorCode(), ERR_SYSTEM);
      EXPECT_EQ(failure.what(), reason);
      EXPECT_EQ(failure.std::runtime_error::what(),
                "Vexlo error, code=502, reason=[" + reason + "]");
    }
  }
  EXPECT_STREQ(Error(ERR_LOCK).std::runtime_error::what(), "Vexlo error, code=506");
  LogLine("comm", 10, "retry ... %d");
  want.emplace_back("<3>comm:10 retry ... %d");
  EXPECT_EQ(log.Take(), want);
}

TEST(Check, AModuleLogsUnderOneName) {
  EXPECT_STREQ(internal::SourceNameOf("src/fileindex/optree/event.cpp").text, "optree");
  EXPECT_STREQ(internal::SourceNameOf("src/fileindex/queue_mgr.cpp").text, "queue_mgr");
}

}  // namespace vexlo
