// Folders that outlive a power cut.
#ifndef DAEMONS_COMMON_FOLDERS_H_
#define DAEMONS_COMMON_FOLDERS_H_

#include <string>

namespace vexlo::daemon {

// Makes the folder and those above it, as far as they are missing, with mode 0755, and syncs the
// entry of each: what is synced in a folder is lost with a folder that is not. False, with the
// cause in errno, when one is not there or not synced. `path` is a full path. Any thread.
bool MakeFolders(const std::string& path);

// Syncs what entries the folder has. False, with the cause in errno.
bool SyncFolder(const std::string& path);

}  // namespace vexlo::daemon

#endif  // DAEMONS_COMMON_FOLDERS_H_
