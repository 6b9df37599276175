// Events that nobody watched: administrative changes to which the index has to react.
#ifndef FILEINDEX_UTIL_CUSTOM_EVENT_H_
#define FILEINDEX_UTIL_CUSTOM_EVENT_H_

#include <json/value.h>

#include <string>

#include "common/export.h"

namespace vexlo::fileindex {

// Queues an event for a path as the notify daemon would, to be folded with all that is pending.
// `event` is an EventMask, `path_old` the path before a rename or "", `data` the payload or null. A
// path that it makes or deletes is taken for a file.
//
// Nothing is written, and no queue file made, when the path's share cannot be indexed at present,
// or when a reindex of the path or of a folder above it is pending: that covers every event.
//
// A failure must not lose the event for good: it is logged, the share (when it could be told) is
// marked SS_NEED_REINDEX in the status file, and the Error goes on to the caller. It is 502 when no
// share holds the path or a queue cannot be read or written, 800 when the share has just gone, 506
// from the queue's lock, 906 or 120 when a line of the queue is bad, or this one would be (a
// negative mask, a payload that makes it longer than kMaxQueueLineBytes). A failure to mark is
// logged.
//
// Reads the whole queue and its snapshot first, without their lock. Then holds the queue's lock,
// and waits for it up to a minute; when marking, the same goes for the status lock. The calling
// process stays root once a share was marked, see SDKCredentials. Any thread may call.
VEXLO_EXPORT void AddCustomEvent(int event, const std::string& full_path,
                                 const std::string& path_old, const Json::Value& data);

}  // namespace vexlo::fileindex

#endif  // FILEINDEX_UTIL_CUSTOM_EVENT_H_
