// Which of many paths covers a given one. Not installed.
#ifndef FILEINDEX_UTIL_PATH_INDEX_H_
#define FILEINDEX_UTIL_PATH_INDEX_H_

#include <cstddef>
#include <cstdint>
#include <string>
#include <string_view>
#include <vector>

namespace vexlo::fileindex {

// A hash table over paths, made once and never changed. A path *covers* itself and everything below
// it. The path in question is hashed from its start, component by component, and looked up at those
// depths only at which there are paths. So a question costs one pass over the part that is no
// deeper than the deepest path, and about as many look-ups as depths are in use.
class PathIndex {
 public:
  static constexpr size_t kNone = SIZE_MAX;

  explicit PathIndex(std::vector<std::string> paths);

  // The place in the list of the deepest path that covers this one, and of exactly this one; of
  // equal ones the first. kNone when there is none.
  size_t FindCovering(std::string_view path) const;
  size_t FindExactly(std::string_view path) const;

 private:
  struct Slot {
    uint64_t hash = 0;
    size_t at = kNone;  // In paths_.
  };

  size_t Find(uint64_t hash, std::string_view path) const;

  std::vector<std::string> paths_;
  std::vector<Slot> slots_;  // A power of two of them, at most half of them taken.
  uint64_t depths_ = 0;      // Bit n: there is a path of n slashes; bit 63: of 63 or more.
};

}  // namespace vexlo::fileindex

#endif  // FILEINDEX_UTIL_PATH_INDEX_H_
