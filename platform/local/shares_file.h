// The text of the shares file. Not installed.
#ifndef PLATFORM_LOCAL_SHARES_FILE_H_
#define PLATFORM_LOCAL_SHARES_FILE_H_

#include <sys/stat.h>

#include <cstdint>
#include <string>
#include <vector>

#include "kavo/local/shares.h"

namespace kavo::local {

// What tells one state of a file from another without reading it. A file that is missing is like a
// file of no device.
struct FileVersion {
  dev_t device = 0;
  ino_t inode = 0;
  off_t bytes = 0;
  int64_t modified_ns = 0;
  int64_t changed_ns = 0;

  bool operator==(const FileVersion&) const = default;
};

FileVersion VersionOf(const struct stat& info);

// The file as it was read, and its version from before that.
struct SharesText {
  FileVersion version;
  bool exists = false;
  std::string text;
};

// 0, or the errno that tells why the file cannot be read. A missing file is no error.
int ReadSharesText(const std::string& file, SharesText& read);

// What a SharesError says about a file that cannot be read.
std::string UnreadableMessage(const std::string& file, int error);

// The shares in order. Throws SharesError, which names `file`.
std::vector<Share> ParseShares(const std::string& file, const SharesText& read);

}  // namespace kavo::local

#endif  // PLATFORM_LOCAL_SHARES_FILE_H_
