#include "daemons/fileindexd/missed_paths.h"

namespace vexlo::fileindexd {

void MissedPaths::Note(const std::string& path) {
  if (paths_.contains("")) {
    return;
  }
  paths_.insert(path);
  if (path.empty() || paths_.size() > kMost) {
    paths_.clear();
    paths_.insert("");
  }
}

bool MissedPaths::HaveBelow(const std::string& path) const {
  return paths_.contains("") || paths_.contains(path) ||
         paths_.lower_bound(path + "/") != paths_.lower_bound(path + "0");
}

void MissedPaths::Forget(const std::string& path) {
  if (!path.empty()) {
    paths_.erase(path);
    // What lies below stands together, from "/" on and up to the byte behind it.
    paths_.erase(paths_.lower_bound(path + "/"), paths_.lower_bound(path + "0"));
  }
}

void MissedPaths::Clear() { paths_.clear(); }

}  // namespace vexlo::fileindexd
