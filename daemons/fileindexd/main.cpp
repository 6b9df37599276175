#include "daemons/fileindexd/service.h"

int main(int argc, char** argv) {
  vexlo::fileindexd::ServiceOptions options;
  return RunDaemon(
      vexlo::fileindexd::FileindexdOptions(&options), argc, argv,
      [&options](vexlo::daemon::Daemon& daemon) { vexlo::fileindexd::Serve(daemon, options); });
}
