// How many requests there were, how long they took and how they failed.
#ifndef DAEMONS_KAVOELASTICD_REQUEST_STATS_H_
#define DAEMONS_KAVOELASTICD_REQUEST_STATS_H_

#include <json/value.h>

#include <array>
#include <chrono>
#include <cstdint>
#include <functional>
#include <map>
#include <mutex>
#include <string>

namespace vexlo::elasticd {

// Any thread. The lock is held for moments.
class RequestStats {
 public:
  // Upper bounds of the histogram's steps, in seconds; what took longer is in none.
  static constexpr std::array<double, 10> kBounds = {0.0005, 0.001, 0.005, 0.01, 0.05,
                                                     0.1,    0.5,   1,     5,    30};

  // As Measure(), but "stats" is answered here.
  Json::Value Answer(const Json::Value& request,
                     const std::function<Json::Value(const Json::Value&)>& handle);

  // Has `handle` answer the request, and counts it.
  Json::Value Measure(const Json::Value& request,
                      const std::function<Json::Value(const Json::Value&)>& handle);

 private:
  // A request that was answered with `reply` after `time`. Commands that the engine does not know
  // are counted together.
  void Count(const Json::Value& request, const Json::Value& reply, std::chrono::nanoseconds time);

  // {"success":true,"bounds":[SECONDS..],"commands":{NAME:{"count","seconds","steps":[COUNT..]}},
  // "errors":{CODE:COUNT}}. A step counts what took no longer than its bound, and longer than the
  // one before; items of compounds are counted in "errors" alone.
  Json::Value ToJson() const;

  struct Command {
    uint64_t count = 0;
    double seconds = 0;
    std::array<uint64_t, kBounds.size()> steps{};
  };

  void CountError(const Json::Value& reply);

  mutable std::mutex mutex_;
  std::map<std::string, Command> commands_;
  std::map<int, uint64_t> errors_;
};

}  // namespace vexlo::elasticd

#endif  // DAEMONS_KAVOELASTICD_REQUEST_STATS_H_
