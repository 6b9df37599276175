// A folder has two names: its share path, "/music/live", which begins with the share, and its full
// path on the volume, "/volume1/music/live". These functions go from one to the other. Any
// thread may call; a holder of SDKMutex() must not.
#ifndef FILEINDEX_UTIL_SHARE_PATH_H_
#define FILEINDEX_UTIL_SHARE_PATH_H_

#include <string>

#include "common/export.h"

namespace vexlo::fileindex {

// The first component of a share path ("/photo/2019" is in "photo"), "" for "/". Throws Error 120
// with the path when it does not begin with "/".
VEXLO_EXPORT void GetShareNameByPath(std::string& share_name, const std::string& share_path);
VEXLO_EXPORT std::string GetShareNameByPath(const std::string& share_path);

// The share path behind the volume of its share. A share's directory is taken to bear the share's
// name, so only the volume is looked up; nothing below needs to exist. Throws Error 120 as above,
// 800 for an unknown share.
VEXLO_EXPORT void GetFullPath(std::string& full_path, const std::string& share_path);
VEXLO_EXPORT std::string GetFullPath(const std::string& share_path);

// The share that holds a full path, and the share's directory ("/volume1/music"). Throws Error 502
// when no share does.
VEXLO_EXPORT void GetShareNamePathByFullPath(std::string& share_name, std::string& share_dir,
                                             const std::string& full_path);

// `path` with the component `old_share` made `new_share`: the first that is equal, wherever it
// stands, so it fits share paths and full paths alike. Throws Error 120 when there is none.
VEXLO_EXPORT std::string ReplacePathShare(const std::string& path, const std::string& new_share,
                                          const std::string& old_share);

}  // namespace vexlo::fileindex

#endif  // FILEINDEX_UTIL_SHARE_PATH_H_
