#include <charconv>
#include <cstring>
#include <string>

#include "daemons/kavocontentextractd/service.h"
#include "daemons/kavocontentextractd/worker.h"

int main(int argc, char** argv) {
  // How the daemon starts itself; nobody else is told of it.
  if (argc == 3 && strcmp(argv[1], "--worker") == 0) {
    size_t memory = 0;
    std::from_chars(argv[2], argv[2] + strlen(argv[2]), memory);
    return vexlo::extractd::RunWorker(memory);
  }
  vexlo::extractd::Settings settings;
  return RunDaemon(vexlo::extractd::ExtractdOptions(&settings), argc, argv,
                   [&settings](vexlo::daemon::Daemon& daemon) {
                     // The very program that runs, even when another one is installed meanwhile.
                     vexlo::extractd::Serve(daemon, settings, "/proc/self/exe");
                   });
}
