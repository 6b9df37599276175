#include "daemons/evnotifyd/options.h"
#include "daemons/evnotifyd/server.h"

int main(int argc, char** argv) {
  vexlo::evnotifyd::FeederOptions options;
  return RunDaemon(
      vexlo::evnotifyd::EvnotifydOptions(options), argc, argv,
      [&options](vexlo::daemon::Daemon& daemon) { vexlo::evnotifyd::Serve(daemon, options); });
}
