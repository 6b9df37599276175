#include "daemons/evnotifyd/monitor.h"

#include <gtest/gtest.h>
#include <sys/eventfd.h>

#include <optional>
#include <thread>

#include "common/json.h"
#include "kavo/monitor_queue.h"
#include "support/faults.h"
#include "support/private_root.h"

FAULTABLE(int, eventfd, (unsigned int count, int flags) noexcept, (count, flags))

namespace vexlo::evnotifyd {
namespace {

const PrivateRoot kRoot;

void Register(const std::string& queue) {
  Json::Value description;
  description["queue"] = kRoot / queue;
  description["config"][0]["path"] = kRoot.MakeFolder("share");
  description["config"][0]["mask"] = 0xFFCC;
  ASSERT_TRUE(EVNOTIFYD::MonitorQueue::Upsert(EVNOTIFYD::MonitorQueue(description), "app",
                                              EVNOTIFYD::MONITOR_QUEUE_TYPE_APPLICATION));
}

// Waits until the queues, by their names, are this.
void AwaitStates(const Monitor& monitor, const std::string& want) {
  std::string text;
  for (int i = 0; i < 1000 && text != want; ++i) {
    std::this_thread::sleep_for(std::chrono::milliseconds(i == 0 ? 0 : 10));
    std::map<std::string, std::string> states;
    const Json::Value stats = monitor.Stats();
    for (const Json::Value& queue : stats["queues"]) {
      states[queue["queue"].asString()] = queue["state"].asString() + " ";
    }
    text.clear();
    for (const auto& [queue, state] : states) {
      text += state;
    }
  }
  EXPECT_EQ(text, want);
}

TEST(MonitorTest, QueuesThatCannotBeStartedAreToldOfAndTriedAgain) {
  std::optional<Monitor> monitor;
  for (const char* const queue : {"a", "b", "c", "d", "e", "f"}) {
    Register(queue);
  }
  {
    // The first is the monitor's own; three of the four queues behind it give way to what follows.
    const ScopedFault fault("eventfd", EMFILE, 6, /*lasting=*/true);
    monitor.emplace(FeederOptions{});
    AwaitStates(*monitor, "live degraded degraded degraded degraded degraded ");
    Register("g");
    AwaitStates(*monitor, "live degraded degraded degraded degraded degraded degraded ");
  }
  AwaitStates(*monitor, "live live live live live live live ");
}

}  // namespace
}  // namespace vexlo::evnotifyd
