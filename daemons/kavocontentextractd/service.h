// The daemon's requests: contents of files, and what there is to tell of the daemon itself. Their
// form is described in docs/extract.md.
#ifndef DAEMONS_KAVOCONTENTEXTRACTD_SERVICE_H_
#define DAEMONS_KAVOCONTENTEXTRACTD_SERVICE_H_

#include <json/value.h>

#include <atomic>
#include <cstddef>
#include <string>
#include <vector>

#include "daemons/common/run_daemon.h"
#include "daemons/common/unique_fd.h"
#include "daemons/kavocontentextractd/pool.h"
#include "daemons/kavocontentextractd/quarantine.h"

namespace vexlo::extractd {

// Any thread may call.
class Service {
 public:
  // `quarantine_file` as in Quarantine.
  Service(const PoolOptions& options, const std::string& quarantine_file);

  // The reply to a request and the file that came with it. Takes up to twice the pool's deadline
  // and its wait limit.
  std::string Answer(const std::string& request, daemon::UniqueFd file);

  // Cuts all requests short, those in work and those to come.
  void Stop() { pool_.Stop(); }

 private:
  std::string Extract(const std::string& path, int file);
  Json::Value Stats();

  const PoolOptions options_;
  Pool pool_;
  Quarantine quarantine_;
  std::atomic<size_t> files_ = 0;
};

// What the command line may set.
struct Settings {
  unsigned deadline = 10;        // Seconds for a file.
  size_t memory = kUsualMemory;  // MiB of address space for a worker; 0 for no limit.
  size_t workers = 0;            // 0 for as many as there are processors, 2 to 8.
};

// The daemon's name, pid file and command line, which goes into `settings`.
daemon::DaemonOptions ExtractdOptions(Settings* settings);

// The daemon's work: serves "/var/run/kavocontentextractd.sock" below the root until the daemon is
// to end. `program` is this one's own path.
void Serve(daemon::Daemon& daemon, const Settings& settings, const std::string& program);

}  // namespace vexlo::extractd

#endif  // DAEMONS_KAVOCONTENTEXTRACTD_SERVICE_H_
