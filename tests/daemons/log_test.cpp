// The daemons' own log lines.
#include "daemons/common/log.h"

#include <gtest/gtest.h>

#include "support/syslog_capture.h"

namespace vexlo::daemon {
namespace {

using std::chrono::seconds;

TEST(LogTest, LinesHaveALevelAndAreOneLine) {
  SyslogCapture capture;
  Log(Level::kWarning, "a.cpp", 7,
      "path=/a\n\x7F"
      "b \xC3\xA9");
  Log(Level::kError, "a.cpp", 8, std::string(kMostLogBytes + 100, 'x'));
  const auto lines = capture.Take();
  ASSERT_EQ(lines.size(), 2U);
  EXPECT_EQ(lines[0], "<4>a.cpp:7 path=/a\\012\\177b \xC3\xA9");
  EXPECT_EQ(lines[1].size(), std::string("<3>a.cpp:8 ...").size() + kMostLogBytes);
}

TEST(LogTest, APlaceThatRepeatsItselfIsHeldBack) {
  SyslogCapture capture;
  for (int i = 0; i < 100; ++i) {
    Log(Level::kNotice, "b.cpp", 1, std::to_string(i));
  }
  Log(Level::kNotice, "b.cpp", 2, "another place");
  EXPECT_EQ(capture.Take().size(), LogRate::kMostInPeriod + 1);

  LogRate rate;
  const LogRate::Clock::time_point begin{};
  uint64_t held_back = 0;
  for (uint64_t i = 0; i < LogRate::kMostInPeriod + 3; ++i) {
    rate.Admit("c.cpp", 1, begin + seconds(i), &held_back);
  }
  for (const uint64_t told : {3, 0}) {
    EXPECT_TRUE(rate.Admit("c.cpp", 1, begin + LogRate::kPeriod, &held_back));
    EXPECT_EQ(held_back, told);
  }
}

}  // namespace
}  // namespace vexlo::daemon
