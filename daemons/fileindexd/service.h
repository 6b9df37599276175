// The daemon's workers, and the commands that come to it.
#ifndef DAEMONS_FILEINDEXD_SERVICE_H_
#define DAEMONS_FILEINDEXD_SERVICE_H_

#include <json/value.h>

#include <chrono>
#include <deque>
#include <functional>
#include <map>
#include <memory>
#include <optional>
#include <set>
#include <string>
#include <thread>

#include "daemons/common/run_daemon.h"
#include "daemons/fileindexd/lock_watch.h"
#include "daemons/fileindexd/worker.h"
#include "kavo/local/mutex.h"

namespace vexlo::fileindexd {

struct ServiceOptions {
  // From the first new line of a queue to the cycle that takes it.
  std::chrono::milliseconds coalescing{1000};
};

// Reads the command line; false when it is wrong.
bool ReadArguments(const std::vector<std::string>& arguments, ServiceOptions* options);

// One thread starts and ends workers, so that whoever takes a command never waits for one.
class Service {
 public:
  // Starts a worker for each share with an indexed folder, now and whenever the folders change.
  explicit Service(ServiceOptions options);
  ~Service();
  Service(const Service&) = delete;
  Service& operator=(const Service&) = delete;

  // Answers a command, a JSON text that a NUL may follow, at once: what it brings about begins when
  // this has returned. Any thread.
  std::string Answer(const std::string& request);

  // Ends the workers; false when one of them is still under way then.
  bool Stop(std::chrono::milliseconds time);

 private:
  using Task = std::function<void()>;
  using Workers = std::map<std::string, std::shared_ptr<Worker>>;

  Json::Value Carry(const std::string& type, const Json::Value& data);
  Json::Value Describe();
  void Post(Task task);
  void Run();
  // Completes what was left of a change of the folders, and gives each indexed share its worker.
  void Settle();
  void SettleLater();
  void StartWorkers();
  void Create(const std::string& share);
  // With `unless_indexed` a share that has folders keeps its worker, which looks at everything
  // anew.
  void Delete(const std::string& share, bool unless_indexed);
  void KickAll();
  std::set<std::string> WorkingShares();
  std::shared_ptr<Worker> Find(const std::string& share);

  const ServiceOptions options_;
  Pause pause_;
  kavo::local::Mutex mutex_;  // Held for moments.
  kavo::local::Condition changed_;
  Workers workers_ KAVO_GUARDED_BY(mutex_);
  std::shared_ptr<Worker> leaving_ KAVO_GUARDED_BY(mutex_);  // Told to end, and not at its end yet.
  std::deque<Task> tasks_ KAVO_GUARDED_BY(mutex_);
  bool ending_ KAVO_GUARDED_BY(mutex_) = false;

  // The thread's own: the list of folders that was looked at last, and when to do it again where
  // that failed.
  std::string folders_stamp_;
  std::optional<std::chrono::steady_clock::time_point> settle_again_;
  std::chrono::seconds settle_wait_{0};

  std::thread thread_;
  std::optional<LockWatch> folders_watch_;  // Last, as it posts.
};

// The daemon's work: serves the command socket until the daemon is to end. What a worker has not
// finished within two seconds is cut short, and done again by the next start.
void Serve(daemon::Daemon& daemon, const ServiceOptions& options);

// The daemon's name, pid file and usage.
daemon::DaemonOptions FileindexdOptions(ServiceOptions* options);

}  // namespace vexlo::fileindexd

#endif  // DAEMONS_FILEINDEXD_SERVICE_H_
