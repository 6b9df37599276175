// How indexing stands, in the words that user interfaces show. FolderSummary() reads the queues,
// and so takes as long as these are. Any thread may call; a holder of SDKMutex() must not.
#ifndef FILEINDEX_INDEX_MGR_STATUS_REPORT_H_
#define FILEINDEX_INDEX_MGR_STATUS_REPORT_H_

#include <json/value.h>

#include <string>

#include "common/export.h"

namespace vexlo::fileindex {

// "finished" when no indexed share that can be indexed at present has a queue or a snapshot, else
// "paused" or "processing". A share that cannot be asked is logged and passed over. Throws as
// FolderMgr and StatusMgr do when their files cannot be loaded.
VEXLO_EXPORT std::string GetIndexProcessingStatus();

// `result` becomes {"items": [...], "status": WORD}: an item for each folder without group, in the
// order of the list, then one for each group by name.
//
//   a folder   {"name", "text": WORD} and "desc" where Folder::GetStatus() gives it
//   a group    {"name", "text": WORD of its folders, "group": true}
//
// A word is "error", "need_reindex", "paused", "processing" or "finished". Several come to one in
// their order: "error" stays for good, "need_reindex" and then "paused" prevail over what came
// before them, and "processing" over anything but "error". The last one merged into "status" is
// GetIndexProcessingStatus(). Throws as that and Folder::GetStatus() do.
VEXLO_EXPORT void FolderSummary(Json::Value& result);

}  // namespace vexlo::fileindex

#endif  // FILEINDEX_INDEX_MGR_STATUS_REPORT_H_
