// A whole queue file through the tree, beside the plain folding of tests/support where that comes
// to an end. A queue that takes over a second for each 64 KiB fails.
#include <chrono>
#include <sstream>
#include <vector>

#include "fileindex/optree/optree.h"
#include "fuzz/target.h"
#include "support/naive_tree.h"

namespace {

using vexlo::fileindex::OP;
using vexlo::fileindex::OPTree;
using Clock = std::chrono::steady_clock;

// The plain folding takes time by the square of the lines, and recurses.
constexpr size_t kJudgedLines = 16;
constexpr size_t kJudgedBytes = 2048;

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
  fuzz::Require(delivered.size() == want.delivered.size(), "another number of operations");
  for (size_t i = 0; i < delivered.size(); ++i) {
    fuzz::RequireEqual(delivered[i], want.delivered[i], "an operation is another one");
  }
}

}  // namespace

extern "C" int LLVMFuzzerTestOneInput(const uint8_t* data, size_t size) {
  const std::string_view queue = fuzz::TextOf(data, size);
  const std::string path = fuzz::Folder() + "/queue";
  fuzz::WriteFile(path, queue);
  const Clock::time_point began = Clock::now();
  OPTree tree(path);
  std::vector<std::string> delivered;
  const size_t count = tree.ProcessOP([&](const std::shared_ptr<OP>& op) {
    std::ostringstream out;
    out << op;
    delivered.push_back(naive::Show(out.str(), op->path_old, op->data));
  });
  fuzz::Require(Clock::now() - began < std::chrono::seconds(2 + size / 65536),
                "a queue takes too long");
  if (size <= kJudgedBytes) {
    Judge(queue, tree, delivered, count);
  }
  return 0;
}
