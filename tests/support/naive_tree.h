// The folding of queue lines written as plainly as can be, to judge the real tree by: linear
// search, recursion, a path built for every comparison. Shares the JSON readers with the library,
// no more.
#ifndef SUPPORT_NAIVE_TREE_H_
#define SUPPORT_NAIVE_TREE_H_

#include <json/value.h>

#include <cstddef>
#include <string>
#include <vector>

namespace naive {

struct Result {
  std::vector<std::string> delivered;  // As Show() has them.
  std::vector<std::string> skipped;    // "event_raw=LINE, code=CODE, reason=REASON", up to a NUL.
  size_t count = 0;                    // What ProcessOP() returns.
  bool crashed = false;
  // The rules never come to an end, or not within kMaxSteps: a rename into a folder's own subtree
  // may for ever find what it has just moved. Nothing else here counts then.
  bool endless = false;
};

constexpr size_t kMaxSteps = 50000;  // Down the tree, by one component.

// Folds the lines of a queue, given without their newlines.
Result Fold(const std::vector<std::string>& lines);

// An operation as it prints, with the source and the payload behind it where that does not show
// them.
std::string Show(std::string printed, const std::string& path_old, const Json::Value& data);

}  // namespace naive

#endif  // SUPPORT_NAIVE_TREE_H_
