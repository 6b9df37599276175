// The fewest queue lines that bring an index up to date with the differences of an audit.
#ifndef CLI_REPAIR_H_
#define CLI_REPAIR_H_

#include <cstdint>
#include <map>
#include <set>
#include <string>

#include "cli/audit.h"
#include "cli/audit_scope.h"

namespace vexlo::cli {

// For one share; memory does not depend on the number of differences. For one thread.
class Repair {
 public:
  // `root` as in Audit(). `scope` outlives the object.
  Repair(const AuditScope& scope, const std::string& root);

  void Add(Difference difference, const std::string& path, bool is_there);

  // Appends the lines to the share's queue and returns how many. Throws as AddCustomEvent() does;
  // the lines before stay then.
  size_t Queue() const;

  // Documents that no line of this share's queue can remove: their paths lie in no share, or in
  // another one.
  uint64_t Strays() const { return strays_; }

 private:
  using Events = std::map<std::string, int>;  // By path.

  bool IsCovered(const std::string& path) const;
  void ReindexFolder(const std::string& folder);

  const AuditScope& scope_;
  const std::string root_;
  std::map<std::string, Events> events_;  // By the folder that holds them.
  size_t event_count_ = 0;
  std::set<std::string> folders_;  // To be indexed again with all below.
  uint64_t strays_ = 0;
};

}  // namespace vexlo::cli

#endif  // CLI_REPAIR_H_
