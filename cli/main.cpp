#include <unistd.h>

#include <iostream>
#include <iterator>

#include "cli/command.h"

int main(int argc, char** argv) {
  std::ios::sync_with_stdio(false);
  using vexlo::cli::Command;
  std::vector<Command> commands;
  for (auto* const family :
       {vexlo::cli::WatchCommands, vexlo::cli::QueueCommands, vexlo::cli::ExplainCommands,
        vexlo::cli::ShareCommands, vexlo::cli::IndexCommands, vexlo::cli::SearchCommands,
        vexlo::cli::PauseCommands, vexlo::cli::ConfigCommands, vexlo::cli::FolderCommands,
        vexlo::cli::StatusCommands, vexlo::cli::ExtractCommands, vexlo::cli::AuditCommands,
        vexlo::cli::DoctorCommands, vexlo::cli::FailedCommands, vexlo::cli::UpCommands,
        vexlo::cli::WebCommands}) {
    const std::vector<Command> more = family();
    commands.insert(commands.end(), more.begin(), more.end());
  }
  const vexlo::cli::Console console = {std::cout, std::cerr, isatty(STDOUT_FILENO) == 1,
                                       isatty(STDERR_FILENO) == 1};
  return vexlo::cli::Run(commands, std::vector<std::string>(argv + 1, argv + argc), console);
}
