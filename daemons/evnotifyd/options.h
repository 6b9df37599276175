// The notify daemon's command line.
#ifndef DAEMONS_EVNOTIFYD_OPTIONS_H_
#define DAEMONS_EVNOTIFYD_OPTIONS_H_

#include "daemons/common/run_daemon.h"
#include "daemons/evnotifyd/feeder.h"

namespace vexlo::evnotifyd {

// The daemon's name, pid file and usage; its command line is read into `options`, which outlives
// the result.
daemon::DaemonOptions EvnotifydOptions(FeederOptions& options);

}  // namespace vexlo::evnotifyd

#endif  // DAEMONS_EVNOTIFYD_OPTIONS_H_
