// Opening without following links. Not installed.
#ifndef PLATFORM_LOCAL_OPEN_BENEATH_H_
#define PLATFORM_LOCAL_OPEN_BENEATH_H_

#include <string>

namespace kavo::local {

// Opens `path`, which has no ".." in it, from the folder that is open as `base` (from the root
// folder when the path begins with a slash). -1 with errno: ELOOP where a component is a symbolic
// link (the last one, with O_PATH and O_NOFOLLOW in `flags`, is opened itself).
int OpenWithoutLinks(int base, const std::string& path, int flags);

// The same by one component after another, for kernels that cannot do it at once.
int OpenStepwise(int base, const std::string& path, int flags);

}  // namespace kavo::local

#endif  // PLATFORM_LOCAL_OPEN_BENEATH_H_
