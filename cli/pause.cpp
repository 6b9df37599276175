#include "cli/pause.h"

#include <charconv>

#include "cli/command.h"
#include "cli/service.h"
#include "common/error.h"

namespace vexlo::cli {
namespace {

// The library counts the hours in seconds of 32 bits; a year is well within.
constexpr int kMostHours = 366 * 24;

}  // namespace

int ReadPauseHours(const std::string& text) {
  int hours = 0;
  const auto [end, error] = std::from_chars(text.data(), text.data() + text.size(), hours);
  if (error != std::errc() || end != text.data() + text.size() || hours < 1 || hours > kMostHours) {
    throw UsageError("'" + text + "' is no number of hours from 1 to " +
                     std::to_string(kMostHours));
  }
  return hours;
}

bool ChangePause(const std::function<void(fileindex::StatusMgr&)>& change) {
  try {
    fileindex::StatusMgr status;
    change(status);
    return true;
  } catch (const Error& error) {
    // The state is saved before the daemon is told, so a failure to tell leaves it there.
    if (error.GetErrorCode() != ERR_SYSTEM || IsIndexDaemonListening()) {
      throw;
    }
    return false;
  }
}

}  // namespace vexlo::cli
