// Administration of the indexed folders: the list, and everything else that has to follow it.
//
// - FolderAdd(), FolderSet() and FolderDelete() hold the folders' lock file throughout, so they
//   never overlap, across processes too. They wait for it up to a minute and then throw Error
//   506. What they wait for under it has no limit: a busy engine, and a daemon that takes a command
//   and does not answer. Callers that serve people run them where waiting does no harm.
// - A whole list is checked before anything is changed. Then the services, the engine's index of
//   the share and the notify daemon's registration are brought into line, and only then the list is
//   saved; the index daemon is told last. When a step fails, the Error goes to the caller, what was
//   done stays done, and nothing after it happens: before the save, the list is the old one. Doing
//   the same again is the remedy.
// - Every operation loads what it needs and keeps nothing. For any thread.
#ifndef FILEINDEX_INDEX_MGR_FOLDER_OPS_H_
#define FILEINDEX_INDEX_MGR_FOLDER_OPS_H_

#include <json/value.h>

#include <string>

#include "common/export.h"

namespace vexlo::fileindex {

// Adds folders: an array of records as Folder::GetData() gives them. A share that had no folder
// gets its index. Then, for each folder in order, an event is queued that has all four groups of
// files indexed. With `updater_mode`, for records that come from an earlier version, the path
// policy is not asked and no event is queued.
//
// Throws Error 120 for a malformed list or record, 901 for a path that is in the list already, 903
// for one that the policy refuses, 800 for an unknown share, 1003 for one without room: then
// nothing has changed. And the Errors of the steps: 502, 503, 504, 505, 506 and the engine's.
VEXLO_EXPORT void FolderAdd(const Json::Value& folder_list, bool updater_mode);

// Adds or replaces folders. As FolderAdd(), but for paths that may be in the list, and the events
// ask for those groups only whose setting changes. The index of a share is taken to be there: a
// folder in a share without any is for FolderAdd().
VEXLO_EXPORT void FolderSet(const Json::Value& folder_list, bool updater_mode);

// Deletes folders: an array of their paths. A share that keeps others has events queued for what is
// indexed otherwise now; one that does not loses its index, its registration, its queue and its
// status. A path that is no folder's counts for its share all the same.
//
// Throws Error 120 for a malformed list or path, 800 for an unknown share (FolderMgr::DeleteByShare
// is the way out), and the Errors of the steps.
VEXLO_EXPORT void FolderDelete(const Json::Value& path_list);

// Deletes all folders of a share.
VEXLO_EXPORT void FolderDelete(const std::string& share_name);

// Has folders, or any paths of indexed shares, indexed anew: an array of paths. Others are passed
// over. A share whose status asks for a rebuild (SS_NEED_REBUILD) gets a new index and is crawled
// as a whole. The status bits of a share that was marked for a reindex are cleared. Takes no lock
// of the list. Throws Error 120 for a malformed list, and as the index, StatusMgr and
// AddCustomEvent() do.
VEXLO_EXPORT void FolderReindex(const Json::Value& path_list);

// `result` becomes Folder::GetData() of the folder with this path. Throws Error 902 when there is
// none.
VEXLO_EXPORT void FolderGet(Json::Value& result, const std::string& path);

// One page of the list: {"folder": [Folder::GetDataWithAdditional(additional), ...], "total":
// folders that pass the filters, "offset": offset}. The arguments are those of FolderMgr::List().
// Throws as these two do.
VEXLO_EXPORT void FolderList(Json::Value& result, unsigned long offset, unsigned long limit,
                             const std::string& sort_by, const std::string& sort_direction,
                             const std::string& group, const std::string& keyword,
                             const Json::Value& additional);

// The names of the groups, an array in order.
VEXLO_EXPORT void FolderListGroups(Json::Value& result);

}  // namespace vexlo::fileindex

#endif  // FILEINDEX_INDEX_MGR_FOLDER_OPS_H_
