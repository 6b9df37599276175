// "fileindex pause" and "fileindex resume".
#include <ctime>
#include <functional>

#include "cli/command.h"
#include "cli/pause.h"
#include "cli/service.h"
#include "fileindex/status_mgr.h"

namespace vexlo::cli {
namespace {

using fileindex::StatusMgr;

std::string StateOnDisk() {
  const long resume_time = StatusMgr().GetPauseInfo();
  if (resume_time == 0) {
    return "paused until 'fileindex resume'";
  }
  if (resume_time <= time(nullptr)) {
    return "not paused";
  }
  const time_t instant = resume_time;
  tm local{};
  char text[64];
  const size_t length =
      strftime(text, sizeof(text), "%Y-%m-%d %H:%M %Z", localtime_r(&instant, &local));
  return "paused until " + std::string(text, length);
}

ExitStatus Change(const Console& console, const std::function<void(StatusMgr&)>& change) {
  if (!ChangePause(change)) {
    console.err << NoIndexDaemon() << "; it will go by the status file when it starts\n";
  }
  console.out << "indexing is " << StateOnDisk() << "\n";
  return kDone;
}

ExitStatus Pause(const Arguments& arguments, const Console& console) {
  const int hours = arguments.positional.empty() ? 0 : ReadPauseHours(arguments.positional[0]);
  return Change(console, [hours](StatusMgr& status) { status.Pause(hours); });
}

ExitStatus Resume(const Arguments& /*arguments*/, const Console& console) {
  return Change(console, [](StatusMgr& status) { status.Resume(); });
}

}  // namespace

std::vector<Command> PauseCommands() {
  return {
      {"pause",
       "[HOURS]",
       "stops indexing for some hours, or until 'resume'",
       "Changes go on being collected, and are indexed when the pause ends. Searching goes on.\n"
       "The pause is saved before the daemon is told: when none runs, that is said, and the pause\n"
       "holds for the next one.\n"
       "\n"
       "  fileindex pause 2\n",
       {},
       {},
       0,
       1,
       Pause},
      {"resume",
       "",
       "ends a pause",
       "Ends a pause at once, also on disk.\n"
       "\n"
       "  fileindex resume\n",
       {},
       {},
       0,
       0,
       Resume},
  };
}

}  // namespace vexlo::cli
