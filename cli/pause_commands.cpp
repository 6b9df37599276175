// "fileindex pause" and "fileindex resume".
#include <charconv>
#include <ctime>

#include "cli/command.h"
#include "cli/service.h"
#include "cli/text.h"
#include "common/error.h"
#include "fileindex/paths.h"
#include "fileindex/status_mgr.h"

namespace vexlo::cli {
namespace {

using fileindex::StatusMgr;

// The library counts the hours in seconds of 32 bits; a year is well within.
constexpr int kMostHours = 366 * 24;

int ReadHours(const std::string& text) {
  int hours = 0;
  const auto [end, error] = std::from_chars(text.data(), text.data() + text.size(), hours);
  if (error != std::errc() || end != text.data() + text.size() || hours < 1 || hours > kMostHours) {
    throw UsageError("'" + text + "' is no number of hours from 1 to " +
                     std::to_string(kMostHours));
  }
  return hours;
}

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

// The state is saved before the daemon is told, so a failure to tell leaves it there.
template <typename Work>
ExitStatus Change(const Console& console, Work change) {
  try {
    StatusMgr status;
    change(status);
  } catch (const Error& error) {
    if (error.GetErrorCode() != ERR_SYSTEM || IsIndexDaemonRunning()) {
      throw;
    }
    console.err << NoIndexDaemon() << "; it will go by the status file when it starts\n";
  }
  console.out << "indexing is " << StateOnDisk() << "\n";
  return kDone;
}

ExitStatus Pause(const Arguments& arguments, const Console& console) {
  const int hours = arguments.positional.empty() ? 0 : ReadHours(arguments.positional[0]);
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
       "The pause is saved before the daemon is told. Exit status 3 when no daemon runs: the "
       "pause\n"
       "holds all the same when one starts.\n"
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
