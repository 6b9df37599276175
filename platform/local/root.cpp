#include <cstdlib>

#include "kavo/local/shares.h"

namespace kavo::local {
namespace {

std::string FindRoot() {
  const std::string built_in = FILEINDEX_ROOT;
  // NOLINTNEXTLINE(concurrency-mt-unsafe): read once, by whoever comes first.
  const char* const given = built_in.empty() ? nullptr : getenv("FILEINDEX_ROOT");
  return given == nullptr || *given != '/' ? built_in : given;
}

}  // namespace

const std::string& Root() {
  static const std::string root = FindRoot();
  return root;
}

}  // namespace kavo::local
