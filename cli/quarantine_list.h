// The list of files that the extraction daemon leaves alone.
#ifndef CLI_QUARANTINE_LIST_H_
#define CLI_QUARANTINE_LIST_H_

#include <map>
#include <string>

namespace vexlo::cli {

using Quarantined = std::map<std::string, std::string>;  // "REASON: what happened", by path.

struct QuarantineList {
  // Those that stand at their path as they were; one that has changed is read again.
  Quarantined files;
  // Why the list is not known; "" when it is. A missing list is an empty one.
  std::string fault;
};

// Reads the daemon's file, "var/lib/kavo/extract/quarantine.json" below the root, which is replaced
// whole.
QuarantineList ReadQuarantine();

}  // namespace vexlo::cli

#endif  // CLI_QUARANTINE_LIST_H_
