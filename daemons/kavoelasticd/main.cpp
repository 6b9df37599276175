#include <chrono>
#include <condition_variable>
#include <functional>
#include <mutex>
#include <stop_token>
#include <thread>

#include "daemons/kavoelasticd/engine.h"
#include "daemons/kavoelasticd/request_stats.h"
#include "daemons/kavoelasticd/server.h"
#include "kavo/local/shares.h"

namespace {

using namespace std::chrono_literals;

// Commits what clients write and forget to commit, and tidies up behind them, until it is stopped.
// Waits for nothing but a change once that is done.
void CommitIdle(const std::stop_token& stop, vexlo::elasticd::Engine& engine) {
  std::mutex mutex;
  std::condition_variable_any stopped;
  std::unique_lock lock(mutex);
  while (!stop.stop_requested()) {
    engine.AwaitChange(stop);
    do {
      stopped.wait_for(lock, stop, 1s, [&stop] { return stop.stop_requested(); });
    } while (!stop.stop_requested() && engine.CommitIdle(5s));
  }
}

}  // namespace

int main(int argc, char** argv) {
  return RunDaemon(
      vexlo::elasticd::ElasticdOptions(), argc, argv, [](vexlo::daemon::Daemon& daemon) {
        vexlo::elasticd::Engine engine(kavo::local::Root() + "/var/lib/kavo/elastic/indexes.json");
        const std::jthread committer(CommitIdle, std::ref(engine));
        vexlo::elasticd::RequestStats stats;
        vexlo::elasticd::Serve(daemon, [&](const Json::Value& request) {
          return stats.Answer(request,
                              [&](const Json::Value& asked) { return engine.Handle(asked); });
        });
      });
}
