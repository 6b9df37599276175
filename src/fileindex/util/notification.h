// Notices on the NAS's desktop for its administrators. Each runs the platform's notification tool,
// waits for it and returns its result (its exit status, or -1 when it cannot be started); nothing
// is logged or thrown. Any thread may call.
#ifndef FILEINDEX_UTIL_NOTIFICATION_H_
#define FILEINDEX_UTIL_NOTIFICATION_H_

#include "common/export.h"

namespace vexlo::fileindex {

// The index's volume has no space left. Sent by the index daemon.
VEXLO_EXPORT int SendQPXNotify();

// The search engine lacks memory. Sent by the library itself while it waits for a busy engine, and
// not exported.
int NotifyLackOfMemory();

}  // namespace vexlo::fileindex

#endif  // FILEINDEX_UTIL_NOTIFICATION_H_
