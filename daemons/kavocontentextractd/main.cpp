#include <charconv>
#include <cstring>
#include <string>

#include "daemons/kavocontentextractd/service.h"
#include "daemons/kavocontentextractd/worker.h"

int main(int argc, char** argv) {
  // How the daemon starts itself; nobody else is told of it.
  if (argc == 5 && strcmp(argv[1], "--worker") == 0) {
    size_t memory = 0;
    vexlo::daemon::Account account;
    const auto read = [](const char* word, auto& number) {
      return std::from_chars(word, word + strlen(word), number).ec == std::errc();
    };
    return read(argv[2], memory) && read(argv[3], account.uid) && read(argv[4], account.gid)
               ? vexlo::extractd::RunWorker(memory, account)
               : vexlo::daemon::kUsage;
  }
  vexlo::extractd::Settings settings;
  return RunDaemon(vexlo::extractd::ExtractdOptions(&settings), argc, argv,
                   [&settings](vexlo::daemon::Daemon& daemon) {
                     // The very program that runs, even when another one is installed meanwhile.
                     vexlo::extractd::Serve(daemon, settings, "/proc/self/exe");
                   });
}
