#include "daemons/evnotifyd/monitor.h"

#include <gtest/gtest.h>
#include <sys/eventfd.h>

#include <algorithm>
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

// Waits until there are so many queues, and so many of them live.
void AwaitQueues(const Monitor& monitor, size_t want, size_t want_live) {
  Json::Value queues;
  size_t live = 0;
  for (int i = 0; i < 1000 && (queues.size() != want || live != want_live); ++i) {
    std::this_thread::sleep_for(std::chrono::milliseconds(10));
    queues = monitor.Stats()["queues"];
    live = static_cast<size_t>(std::count_if(
        queues.begin(), queues.end(), [](const auto& queue) { return queue["state"] == "live"; }));
  }
  EXPECT_EQ(queues.size(), want);
  EXPECT_EQ(live, want_live);
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
    AwaitQueues(*monitor, 6, 1);
    Register("g");
    AwaitQueues(*monitor, 7, 1);
  }
  AwaitQueues(*monitor, 7, 7);
}

}  // namespace
}  // namespace vexlo::evnotifyd
