// What a user may do with a file, as the kernel would decide it. Not installed.
#ifndef PLATFORM_LOCAL_ACCESS_H_
#define PLATFORM_LOCAL_ACCESS_H_

#include <sys/stat.h>

#include <vector>

namespace kavo::local {

// Sets `perm` to the KAVO_ACL_* bits of a user in these groups (all of them, the primary one too)
// for the file at `path`, whose stat() is `info`: by its mode and POSIX access ACL, and root's
// privileges for user 0. False with errno when the ACL cannot be read.
bool GetAccess(const char* path, const struct stat& info, uid_t user,
               const std::vector<gid_t>& groups, unsigned& perm);

}  // namespace kavo::local

#endif  // PLATFORM_LOCAL_ACCESS_H_
