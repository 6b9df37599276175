// Compares the index of a share with what is on the disk.
#ifndef CLI_AUDIT_H_
#define CLI_AUDIT_H_

#include <cstdint>
#include <functional>
#include <string>

#include "cli/audit_scope.h"

namespace vexlo::cli {

enum class Difference {
  kMissing,  // On the disk and wanted; no document.
  kGhost,    // A document; nothing on the disk, or nothing that is wanted.
  kStale,    // The document is of another state of the file.
};

// "missing", "ghost", "stale": printed, and so never renamed.
const char* NameOf(Difference difference);

struct AuditCounts {
  uint64_t files = 0;      // Wanted files and folders on the disk.
  uint64_t documents = 0;  // In the index.
  uint64_t missing = 0;
  uint64_t ghost = 0;
  uint64_t stale = 0;
  uint64_t unknown = 0;  // Folders and files that could not be looked at.

  uint64_t Differences() const { return missing + ghost + stale; }
  AuditCounts& operator+=(const AuditCounts& other);
};

struct AuditDeeds {
  // `is_there`: whether something is at the path.
  std::function<void(Difference difference, const std::string& path, bool is_there)> report;
  std::function<void(const std::string& path, int error)> unknown;
};

// Compares what is at and below `root`; all of the share and of its index when that is "". What
// has changed within the last `grace_seconds` is not stale. A difference is looked at once more
// before it is reported, up to some thousands of them, as files and index may change meanwhile.
//
// Below what cannot be looked at no document is a ghost. Throws Failure when the share cannot be
// indexed at present, and what IndexListing and the path policy throw.
AuditCounts Audit(const AuditScope& scope, const std::string& root, int64_t grace_seconds,
                  const AuditDeeds& deeds);

}  // namespace vexlo::cli

#endif  // CLI_AUDIT_H_
