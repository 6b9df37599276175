// Paths that were gone when their turn came.
#ifndef DAEMONS_FILEINDEXD_MISSED_PATHS_H_
#define DAEMONS_FILEINDEXD_MISSED_PATHS_H_

#include <cstddef>
#include <set>
#include <string>

namespace vexlo::fileindexd {

// What is gone was deleted, or was renamed with a folder above it: the line that tells which may
// only come in a later cycle. A rename that moved the folder's documents as they are would then
// leave behind for good what was missed. For one thread.
class MissedPaths {
 public:
  void Note(const std::string& path);
  // Whether one of them is the path or lies below it, or there were more than are kept.
  bool HaveBelow(const std::string& path) const;
  // Those at and below the path have been taken care of.
  void Forget(const std::string& path);
  // All of them have.
  void Clear();

  // As they are saved. The empty path, which is above all others, stands for too many.
  const std::set<std::string>& Paths() const { return paths_; }

  bool operator==(const MissedPaths&) const = default;

 private:
  static constexpr size_t kMost = 10000;

  std::set<std::string> paths_;
};

}  // namespace vexlo::fileindexd

#endif  // DAEMONS_FILEINDEXD_MISSED_PATHS_H_
