#include <unistd.h>

#include <iostream>

#include "cli/command.h"

int main(int argc, char** argv) {
  std::ios::sync_with_stdio(false);
  const vexlo::cli::Console console = {std::cout, std::cerr, isatty(STDOUT_FILENO) == 1,
                                       isatty(STDERR_FILENO) == 1};
  return vexlo::cli::Run(vexlo::cli::AllCommands(), std::vector<std::string>(argv + 1, argv + argc),
                         console);
}
