// Opening what users have in shares.
#ifndef KAVO_LOCAL_OPEN_H_
#define KAVO_LOCAL_OPEN_H_

#include <string>

namespace kavo::local {

// open() for a path that its users may change at any moment: no symbolic link is followed that lies
// below the outermost share that holds the path, whatever stood there when the path was found. The
// share's own directory may be reached by links, which are the administrator's, and so may what no
// share holds. `flags` as open() takes them, without O_CREAT; O_NOFOLLOW and O_CLOEXEC are added.
//
// A new descriptor, or -1 with errno: ENOTDIR when a folder on the way is a link, ELOOP when the
// last component is one (not with O_PATH, which opens the link itself). Any thread may call.
int OpenInShare(const std::string& full_path, int flags) noexcept;

}  // namespace kavo::local

#endif  // KAVO_LOCAL_OPEN_H_
