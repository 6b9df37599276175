// Which folders of a share the notify daemon watches. Any thread may call; a holder of SDKMutex()
// must not.
#ifndef FILEINDEX_INDEX_MGR_MONITOR_H_
#define FILEINDEX_INDEX_MGR_MONITOR_H_

#include <string>

#include "common/export.h"

namespace vexlo::fileindex {

class FolderMgr;

// Registers the share's queue with the notify daemon, or replaces its registration: the folders of
// `folder_mgr` that lie in the share, in their order, be they saved or not. Without any the queue
// is registered with nothing to watch.
//
// Throws Error 800 for an unknown share, and 502 when the platform refuses. Callers that change the
// list of folders hold its lock.
VEXLO_EXPORT void UpsertEVNotifydCfg(const std::string& share_name, FolderMgr& folder_mgr);

// Takes the registration of the share's queue back. Throws as UpsertEVNotifydCfg() does.
VEXLO_EXPORT void DeleteEVNotifydCfg(const std::string& share_name);

}  // namespace vexlo::fileindex

#endif  // FILEINDEX_INDEX_MGR_MONITOR_H_
