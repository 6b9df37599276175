// How the local platform names the queue and the index of a share. Not installed.
#ifndef PLATFORM_LOCAL_INDEX_PATH_H_
#define PLATFORM_LOCAL_INDEX_PATH_H_

#include <cstddef>
#include <string_view>

namespace kavo::local {

// Both lie below this folder of the root.
inline constexpr char kIndexFolder[] = "/var/lib/kavo/fileindex";

// The limit for EncodedBytes(): room is left in a file name for ".tmp" and for what makes a
// temporary name unique.
inline constexpr size_t kMaxEncodedBytes = 240;

// The length of the file name that a share's path becomes: '%', '/', control bytes and the "." of a
// ".tmp" at its end are written as "%XX", all others stand as they are.
size_t EncodedBytes(std::string_view share_path);

}  // namespace kavo::local

#endif  // PLATFORM_LOCAL_INDEX_PATH_H_
