#include "watch/kernel_event.h"

#include <gtest/gtest.h>
#include <sys/inotify.h>

#include <map>
#include <vector>

namespace vexlo::watch {
namespace {

struct Step {
  int at;  // Milliseconds; the queue is asked for changes after each step.
  std::vector<KernelEvent> events;
  std::string want;  // The changes by their initials, "!" where one reverses another.
};

TEST(ChangeQueueTest, PairsMovesAndKeepsTheOrder) {
  const KernelEvent from{1, IN_MOVED_FROM, 7, "a"}, to{2, IN_MOVED_TO, 7, "b"};
  const KernelEvent other{1, IN_MOVED_FROM, 8, "c"}, other_to{2, IN_MOVED_TO, 8, "d"};
  const KernelEvent made{1, IN_CREATE, 0, "a"}, gone{1, IN_DELETE, 0, "a"};
  const KernelEvent back{2, IN_MOVED_FROM, 9, "b"}, back_to{1, IN_MOVED_TO, 9, "a"};
  const KernelEvent moved{5, IN_MOVE_SELF, 0, ""};
  const std::map<std::string, std::vector<Step>> cases = {
      {"AfterTheWait", {{0, {from}, ""}, {80, {to}, "r1a2b "}}},
      {"TooLate", {{0, {from}, ""}, {49, {}, ""}, {50, {}, "d1a "}, {60, {to}, "c2b "}}},
      {"NoneOvertakes", {{0, {made, from, made}, "c1a "}, {9, {gone, to}, "r1a2b c1a !d1a "}}},
      {"Crossed", {{0, {from, other, other_to}, ""}, {10, {to}, "r1a2b r1c2d "}}},
      {"Exchanged", {{0, {from, to, moved, back, back_to}, "r1a2b M5 !r2b1a "}}},
      {"ExchangedAmongOthers",
       {{0, {from, to, other, other_to, made, back, back_to}, "r1a2b r1c2d c1a !r2b1a "}}},
  };
  for (const auto& [name, steps] : cases) {
    SCOPED_TRACE(name);
    ChangeQueue queue(std::chrono::milliseconds(50));
    for (const Step& step : steps) {
      const TimePoint now = TimePoint(std::chrono::milliseconds(step.at));
      for (const KernelEvent& event : step.events) {
        queue.Push(event, now);
      }
      std::string got;
      while (const auto change = queue.Next(now)) {
        got += change->reverses ? "!" : "";
        got += "cwadrADM"[static_cast<int>(change->kind)];
        got += change->wd_old < 0 ? "" : std::to_string(change->wd_old) + change->name_old;
        got += std::to_string(change->wd) + change->name + " ";
      }
      EXPECT_EQ(got, step.want) << "at " << step.at;
      EXPECT_EQ(queue.NextDeadline().has_value(), !queue.empty());
      EXPECT_GT(queue.NextDeadline().value_or(TimePoint::max()), now);
    }
  }
}

}  // namespace
}  // namespace vexlo::watch
