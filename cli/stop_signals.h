// The signals that end a command which runs until it is asked to.
#ifndef CLI_STOP_SIGNALS_H_
#define CLI_STOP_SIGNALS_H_

#include <csignal>

namespace vexlo::cli {

// SIGINT, SIGTERM, and SIGHUP unless it is ignored: who starts the tool so, as nohup does, wants it
// to outlive the terminal. To be blocked and waited for.
sigset_t StopSignalSet();

}  // namespace vexlo::cli

#endif  // CLI_STOP_SIGNALS_H_
