// What commands share that change the service's state or ask its daemons.
#ifndef CLI_SERVICE_H_
#define CLI_SERVICE_H_

#include <string>

namespace vexlo::cli {

// Whether somebody takes connections on the Unix socket at `path`.
bool IsListening(const std::string& path);
bool IsIndexDaemonRunning();

// "the index daemon fileindexd does not run (nobody answers on '...')".
std::string NoIndexDaemon();

}  // namespace vexlo::cli

#endif  // CLI_SERVICE_H_
