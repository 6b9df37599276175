#include "fileindex/paths.h"

#include <cstdlib>

namespace vexlo::fileindex {
namespace {

std::string FindRoot() {
  const std::string built_in = FILEINDEX_ROOT;
  // NOLINTNEXTLINE(concurrency-mt-unsafe): read once, by whoever comes first.
  const char* const given = built_in.empty() ? nullptr : getenv("FILEINDEX_ROOT");
  return given == nullptr || *given != '/' ? built_in : given;
}

}  // namespace

const std::string& GetFileIndexRoot() {
  static const std::string root = FindRoot();
  return root;
}

}  // namespace vexlo::fileindex
