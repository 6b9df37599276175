#include <sys/eventfd.h>
#include <unistd.h>

#include <chrono>
#include <condition_variable>
#include <functional>
#include <mutex>
#include <optional>
#include <stop_token>
#include <string>
#include <thread>
#include <vector>

#include "daemons/kavoelasticd/engine.h"
#include "daemons/kavoelasticd/judge.h"
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

// Without the judge the searches of most users fail for good, and only a start makes another.
void EndWithJudge(const std::stop_token& stop, const vexlo::elasticd::Judge& judge,
                  vexlo::daemon::Daemon& daemon) {
  const vexlo::daemon::UniqueFd quit(eventfd(0, EFD_CLOEXEC));
  const std::stop_callback wake(stop, [&quit] { eventfd_write(quit.Get(), 1); });
  if (judge.IsThere() && judge.AwaitEnd(quit.Get())) {
    daemon.EndAtOnce("the process that judges who may read what was killed",
                     vexlo::daemon::kFailed);
  }
}

}  // namespace

int main(int argc, char** argv) {
  std::optional<vexlo::elasticd::Judge> judge;
  vexlo::daemon::DaemonOptions options = vexlo::elasticd::ElasticdOptions();
  options.prepare = [&judge] { judge.emplace(); };
  return RunDaemon(options, argc, argv, [&judge](vexlo::daemon::Daemon& daemon) {
    vexlo::elasticd::Engine engine(kavo::local::Root() + "/var/lib/kavo/elastic/indexes.json");
    const std::jthread committer(CommitIdle, std::ref(engine));
    const std::jthread ending(EndWithJudge, std::cref(*judge), std::ref(daemon));
    vexlo::elasticd::RequestStats stats;
    const auto search = [&](const Json::Value& request, const vexlo::daemon::Peer& peer) {
      const bool sees_all = peer.uid == 0 || peer.uid == geteuid();
      const auto ask = [&](const std::vector<std::string>& paths) {
        return judge->Ask(peer, paths);
      };
      return stats.Measure(request, [&](const Json::Value& asked) {
        return engine.HandleSearch(
            asked, sees_all ? vexlo::elasticd::JudgePaths() : vexlo::elasticd::JudgePaths(ask));
      });
    };
    const auto answer = [&](const Json::Value& request) {
      return stats.Answer(request, [&](const Json::Value& asked) { return engine.Handle(asked); });
    };
    vexlo::elasticd::Serve(daemon, answer, search, judge->IsThere());
  });
}
