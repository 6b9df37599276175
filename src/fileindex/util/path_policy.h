// Which paths may be indexed at all, before any folder's settings are asked.
//
// The policy is one ordered list of named rules, and a path may be indexed when no rule refuses it:
//
//   snapshot      the path does not lie in a snapshot
//   file_system   its file system is neither another machine's nor a mounted image
//   share         its share is neither locked by encryption nor read-only
//   recycle_bin   it does not lie in a recycle bin, the share's or a user's
//   mount_point   nothing is mounted on it, unless the share is encrypted: then that is its nature
//   name          no component is a preserved name
//   canonical     it exists, and realpath() leaves every byte as it is: no symbolic link, "." or
//                 "..", doubled or trailing "/"
//
// The cheap questions come first, the one that walks the disk last. What the platform cannot answer
// about a path counts as a refusal (for the snapshot, as none). Throws Error 502 when no share
// holds the path or the share cannot be asked, 800 when the share has just gone. Any thread may
// ask; a holder of SDKMutex() must not.
#ifndef FILEINDEX_UTIL_PATH_POLICY_H_
#define FILEINDEX_UTIL_PATH_POLICY_H_

#include <string>
#include <vector>

#include "common/export.h"

namespace vexlo::fileindex {

// Whether a file or folder of this name belongs to a system's housekeeping (".git", "Thumbs.db",
// the platform's hidden attribute directory, ...). Byte for byte: "thumbs.db" does not.
VEXLO_EXPORT bool IsSystemPreservedFileName(const std::string& name);

// Whether the path is a recycle bin, the share's or a user's, or lies in one. Throws Error 502 when
// no share holds the path.
VEXLO_EXPORT bool IsFullPathInRecycleBin(const std::string& full_path);

// Whether no rule refuses the path.
VEXLO_EXPORT bool CanFullPathBeIndexed(const std::string& full_path);

// The same of a share path; throws as GetFullPath() does, too.
VEXLO_EXPORT bool CanPathBeIndexed(const std::string& path);

// What one rule says of one path.
struct RuleVerdict {
  // Whether the rule holds the path up.
  enum Answer {
    kPasses,
    kRefuses,
    kCannotTell,  // CanFullPathBeIndexed() throws here.
  };

  const char* rule;    // Its name in the list above; lives as long as the program.
  Answer answer;       // What it says of the path.
  std::string reason;  // A sentence for people, without its full stop.
};

// Asks every rule, also those behind the first that refuses, and throws nothing. The first verdict
// that is not kPasses is what CanFullPathBeIndexed() comes to.
VEXLO_EXPORT std::vector<RuleVerdict> ExplainFullPath(const std::string& full_path);

}  // namespace vexlo::fileindex

#endif  // FILEINDEX_UTIL_PATH_POLICY_H_
