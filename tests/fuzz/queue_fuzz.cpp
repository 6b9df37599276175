// A whole queue file through the tree, beside the plain folding of tests/support where that comes
// to an end. The time that it takes is in proportion to its length, but for renames of folders into
// each other, which have a bound of their own.
#include <ctime>
#include <sstream>
#include <vector>

#include "fileindex/optree/optree.h"
#include "fuzz/target.h"
#include "support/naive_tree.h"

namespace {

using vexlo::fileindex::OP;
using vexlo::fileindex::OPTree;

// The plain folding takes time by the square of the lines, and recurses.
constexpr size_t kJudgedLines = 16;
constexpr size_t kJudgedBytes = 2048;
// With the sanitizers.
constexpr size_t kOverlappingSeconds = 5;
constexpr size_t kBytesASecond = size_t{64} << 10;

void Judge(std::string_view queue, OPTree& tree, const std::vector<std::string>& delivered,
           size_t count) {
  std::vector<std::string> lines;
  lines.reserve(kJudgedLines);
  for (std::string_view rest = queue; !rest.empty();) {
    lines.emplace_back(fuzz::TakeLine(rest));
    if (lines.size() > kJudgedLines) {
      return;
    }
  }
  const naive::Result want = naive::Fold(lines);
  if (want.endless) {
    return;
  }
  fuzz::Require(tree.GetLineCount() == lines.size(), "the lines are miscounted");
  fuzz::Require(tree.GetSkippedCount() == want.skipped.size(),
                "another number of lines is skipped");
  fuzz::Require(count == want.count && tree.crashed == want.crashed,
                "the tree comes to another end");
  fuzz::Require(delivered == want.delivered, "the operations are others");
}

}  // namespace

extern "C" int LLVMFuzzerTestOneInput(const uint8_t* data, size_t size) {
  const std::string_view queue = fuzz::TextOf(data, size);
  const std::string path = fuzz::Folder() + "/queue";
  fuzz::WriteFile(path, queue);
  const std::clock_t began = std::clock();
  OPTree tree(path);
  std::vector<std::string> delivered;
  const size_t count = tree.ProcessOP([&](const std::shared_ptr<OP>& op) {
    std::ostringstream out;
    out << op;
    delivered.push_back(naive::Show(out.str(), op->path_old, op->data));
  });
  const auto seconds = static_cast<size_t>((std::clock() - began) / CLOCKS_PER_SEC);
  fuzz::Require(seconds <= kOverlappingSeconds + size / kBytesASecond, "a queue takes too long");
  if (size <= kJudgedBytes) {
    Judge(queue, tree, delivered, count);
  }
  return 0;
}
