#include <unistd.h>

#include <iostream>
#include <iterator>

#include "cli/command.h"

int main(int argc, char** argv) {
  std::ios::sync_with_stdio(false);
  std::vector<vexlo::cli::Command> commands = vexlo::cli::QueueCommands();
  for (vexlo::cli::Command& command : vexlo::cli::WatchCommands()) {
    commands.push_back(std::move(command));
  }
  const vexlo::cli::Console console = {std::cout, std::cerr, isatty(STDOUT_FILENO) == 1,
                                       isatty(STDERR_FILENO) == 1};
  return vexlo::cli::Run(commands, std::vector<std::string>(argv + 1, argv + argc), console);
}
