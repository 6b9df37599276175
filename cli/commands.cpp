#include "cli/command.h"

#include <algorithm>
#include <iterator>

namespace vexlo::cli {

std::vector<Command> AllCommands() {
  std::vector<Command> commands;
  for (auto* const family :
       {WatchCommands, QueueCommands, ExplainCommands, ShareCommands, IndexCommands, SearchCommands,
        PauseCommands, ConfigCommands, FolderCommands, StatusCommands, ExtractCommands,
        AuditCommands, DoctorCommands, FailedCommands, MetricsCommands, UpCommands, WebCommands}) {
    std::vector<Command> more = family();
    std::move(more.begin(), more.end(), std::back_inserter(commands));
  }
  return commands;
}

}  // namespace vexlo::cli
