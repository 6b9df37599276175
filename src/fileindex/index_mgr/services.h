// What the administrative operations do to the services around the library. Not installed.
#ifndef FILEINDEX_INDEX_MGR_SERVICES_H_
#define FILEINDEX_INDEX_MGR_SERVICES_H_

#include <set>
#include <string>

namespace vexlo::fileindex {

class FolderMgr;

// Tells the index daemon ("notify_setting_changed") that the folders of a share have changed.
// Blocks and throws as SendCommandToDaemon() does.
void NotifyShareSettingChanged(const std::string& share_name, bool is_upsert);

// Removes the queue, its snapshot and the database of a share whose directory is `share_path`, and
// drops the share's status. Throws Error 502 when a path cannot be told; that something could not
// be removed is passed over. Throws as StatusMgr::ClearShareStatus() does.
void CleanShareIndexData(const std::string& share_name, const std::string& share_path);

// Brings the services that indexing relies on into line with `folders`, the list as it is saved or
// about to be: while there is a folder, the content extraction and the index daemon run (with
// `starts` they are started; those that run stay as they are); after the last one is gone, they are
// stopped (without `starts`). Clients may search those of `touched_shares` over SMB that are
// indexed. Failures are logged and nothing is thrown, as callers are in the middle of a change.
void SetupRelatedServices(bool starts, const FolderMgr& folders,
                          const std::set<std::string>& touched_shares);

}  // namespace vexlo::fileindex

#endif  // FILEINDEX_INDEX_MGR_SERVICES_H_
