// How the whole local stack stands.
#ifndef CLI_STACK_REPORT_H_
#define CLI_STACK_REPORT_H_

#include <json/value.h>

namespace vexlo::cli {

// {"status": WORD, "resume_time": as StatusMgr::GetPauseInfo() gives it,
//  "daemons": [{"name","running","socket","stats"}, ...] in the order of LocalDaemons(), "stats"
//  being
//    what it answered,
//  "shares": the index daemon's, each with "watch", the notify daemon's word on its queue or null}
//
// "running" is null where the daemon's socket is closed to this user, as it cannot be told then. A
// daemon that does not answer in time runs no more than one that is not there. Throws as
// GetIndexProcessingStatus() and StatusMgr do.
Json::Value AskWholeStack();

}  // namespace vexlo::cli

#endif  // CLI_STACK_REPORT_H_
