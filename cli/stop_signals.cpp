#include "cli/stop_signals.h"

namespace vexlo::cli {

sigset_t StopSignalSet() {
  sigset_t signals;
  sigemptyset(&signals);
  sigaddset(&signals, SIGINT);
  sigaddset(&signals, SIGTERM);
  struct sigaction hangup {};
  if (sigaction(SIGHUP, nullptr, &hangup) != 0 || hangup.sa_handler != SIG_IGN) {
    sigaddset(&signals, SIGHUP);
  }
  return signals;
}

}  // namespace vexlo::cli
