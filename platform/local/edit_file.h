// Files that several processes read, and replace whole in turns. Not installed.
#ifndef PLATFORM_LOCAL_EDIT_FILE_H_
#define PLATFORM_LOCAL_EDIT_FILE_H_

#include <exception>
#include <stdexcept>
#include <string>
#include <string_view>

#include "platform/local/fd.h"

namespace kavo::local {

inline constexpr size_t kMaxFileBytes = size_t{64} << 20;  // A longer one is not read.

// "PATH: DEED failed: REASON", or "PATH: ..." in other words.
class FileError : public std::runtime_error {
  using std::runtime_error::runtime_error;
};

// True when the path is absolute and each component is a name. A NUL is one of a name's bytes here.
bool IsNormalised(std::string_view path);

// For what JSON's reader throws, which is the same for a text that is nested too deep and for want
// of memory: throws std::bad_alloc for the latter, which says nothing about the text.
void RethrowNoMemory(const std::exception& error);

// Without the slash that ends it; "." for the working directory.
std::string FolderOf(const std::string& file);

// Makes the folder and those above it, as far as they are missing. Throws FileError.
void MakeFolders(const std::string& folder);

// Appends what can be read of the descriptor, and stops at one byte over kMaxFileBytes. `expected`
// is how much is likely to come. False with errno.
bool ReadAll(int fd, size_t expected, std::string& text);

// The flock on "FILE.lock" by which editors of a file take turns. Blocks while another one holds
// it. The lock file stays: one that comes and goes would be two for two editors.
class EditLock {
 public:
  explicit EditLock(const std::string& file);  // Throws FileError.

 private:
  const ScopedFd fd_;
};

// Replaces the file whole, by way of "FILE.tmp": mode 0644, and the owner that the file had where
// that is permitted. For the holder of the EditLock alone. Throws FileError and leaves the file as
// it was; only when the folder cannot be synced at last, the change is there but may not outlive a
// power failure.
void ReplaceWhole(const std::string& file, std::string_view text);

}  // namespace kavo::local

#endif  // PLATFORM_LOCAL_EDIT_FILE_H_
