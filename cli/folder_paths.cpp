#include "cli/folder_paths.h"

#include "cli/command.h"
#include "cli/shares.h"
#include "cli/text.h"
#include "common/error.h"
#include "common/sdk/share.h"
#include "fileindex/folder_mgr.h"
#include "fileindex/util/share_path.h"
#include "kavo/last_error.h"

namespace vexlo::cli {

std::string SharePathOf(const std::string& full_path) {
  CheckSharesFile();
  std::string share_name;
  std::string share_dir;
  try {
    fileindex::GetShareNamePathByFullPath(share_name, share_dir, full_path);
  } catch (const Error&) {
    if (KLIBCErrGet() != KAVO_ERR_NOT_FOUND) {
      throw;  // Nobody can tell at present; the folder must not be made a share of its own.
    }
    return "";
  }
  return "/" + share_name + full_path.substr(share_dir.size());
}

std::string ToSharePath(const std::string& named) {
  std::string path = AbsolutePath(named);
  std::string share_path = SharePathOf(path);
  if (!share_path.empty()) {
    return share_path;
  }
  // A folder may be of a share that is gone.
  if (named.starts_with('/') && (ShareNames().contains(fileindex::GetShareNameByPath(path)) ||
                                 fileindex::FolderMgr().HasFolder(path))) {
    return path;
  }
  throw Failure("'" + ForTerminal(named) + "' lies in no share; 'fileindex share list' lists them");
}

}  // namespace vexlo::cli
