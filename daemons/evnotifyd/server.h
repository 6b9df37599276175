// The notify daemon's socket.
#ifndef DAEMONS_EVNOTIFYD_SERVER_H_
#define DAEMONS_EVNOTIFYD_SERVER_H_

#include "daemons/common/run_daemon.h"
#include "daemons/evnotifyd/feeder.h"

namespace vexlo::evnotifyd {

// The daemon's work: watches what is registered, and answers on "/var/run/evnotifyd.sock" below the
// root, until the daemon is to end.
void Serve(daemon::Daemon& daemon, const FeederOptions& options);

}  // namespace vexlo::evnotifyd

#endif  // DAEMONS_EVNOTIFYD_SERVER_H_
