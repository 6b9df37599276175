// Watches what leads to the roots.
#ifndef DAEMONS_EVNOTIFYD_ROOT_PATHS_H_
#define DAEMONS_EVNOTIFYD_ROOT_PATHS_H_

#include <cstdint>
#include <map>
#include <set>
#include <string>

#include "daemons/common/unique_fd.h"

namespace vexlo::evnotifyd {

// The kernel tells a watched folder nothing when a folder above it is moved, and of one that is
// gone nobody tells when it is back. So each folder above a root is watched for its own move, and
// the one that holds the root, or the place of what is missing above it, for that one name in it;
// in the latter case, the one above that, too.
// Where links lead to a root, they and the way behind them are watched, too. What else happens in
// these folders, which may be much, goes unheard but in the one.
class RootPaths {
 public:
  // Watches what leads to these, and forgets what led to others.
  void Set(const std::set<std::string>& roots);

  // Readable when something has changed; another one after each Set(), -1 for none.
  int fd() const { return fd_.Get(); }

  // Reads what there is. True when a name on a way to a root has come, gone or become something
  // else: then call Set() again, and after it see which roots stand.
  bool HasChanged();

  // False when not all could be watched, so that there are changes that nobody hears of.
  bool IsComplete() const { return complete_; }

 private:
  void WatchWay(const std::string& root, int links);
  int Watch(const std::string& path, uint32_t mask);

  daemon::UniqueFd fd_;
  std::map<int, std::set<std::string>> names_;  // That matter, by watch.
  bool complete_ = true;
  int error_ = 0;  // Why not.
};

}  // namespace vexlo::evnotifyd

#endif  // DAEMONS_EVNOTIFYD_ROOT_PATHS_H_
