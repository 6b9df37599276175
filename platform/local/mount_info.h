// The kernel's list of mounts. Not installed.
#ifndef PLATFORM_LOCAL_MOUNT_INFO_H_
#define PLATFORM_LOCAL_MOUNT_INFO_H_

#include <sys/types.h>

#include <cstdint>
#include <optional>
#include <string>
#include <string_view>

namespace kavo::local {

struct Mount {
  std::string type;    // "ext4"; "fuse.NAME" for what FUSE serves under a name.
  std::string source;  // What is mounted: a device, "host:/path", or any text.
};

// The mount with this id in a text like /proc/self/mountinfo, or without an id the first on this
// device. Lines of another form are passed over.
std::optional<Mount> FindMount(std::string_view text, std::optional<uint64_t> id, dev_t device);

// The mount that the path lies on; a symbolic link is followed. None with errno when the path or
// the list cannot be looked at, and with errno 0 when the list does not have it, as happens below
// a changed root. Asks the file system for nothing, so it answers, too, where only another user is
// let in. Throws std::bad_alloc.
std::optional<Mount> FindMountOf(const char* path);

}  // namespace kavo::local

#endif  // PLATFORM_LOCAL_MOUNT_INFO_H_
