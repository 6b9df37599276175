// What commands share that pause and resume indexing.
#ifndef CLI_PAUSE_H_
#define CLI_PAUSE_H_

#include <functional>
#include <string>

#include "fileindex/status_mgr.h"

namespace vexlo::cli {

// A number of hours up to a year. Throws UsageError for anything else.
int ReadPauseHours(const std::string& text);

// Runs a change of the pause on the state as it is on disk. False when it is saved and no index
// daemon runs to be told: it goes by the file when it starts. Throws as StatusMgr does.
bool ChangePause(const std::function<void(fileindex::StatusMgr&)>& change);

}  // namespace vexlo::cli

#endif  // CLI_PAUSE_H_
