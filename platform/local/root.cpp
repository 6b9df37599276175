#include <cstdlib>
#include <string>
#include <string_view>

#include "kavo/local/shares.h"

namespace kavo::local {
namespace {

constexpr std::string_view kBuiltIn = FILEINDEX_ROOT;

// "" where there is none, and where it does not count.
std::string GivenRoot() {
  // NOLINTNEXTLINE(concurrency-mt-unsafe): nobody sets the environment.
  const char* const given = kBuiltIn.empty() ? nullptr : getenv("FILEINDEX_ROOT");
  return given == nullptr ? "" : given;
}

std::string FindRoot() {
  const std::string given = GivenRoot();
  return given.starts_with('/') ? given : std::string(kBuiltIn);
}

}  // namespace

const std::string& Root() {
  static const std::string root = FindRoot();
  return root;
}

std::string RootFault() {
  const std::string given = GivenRoot();
  return given.empty() || given.starts_with('/')
             ? ""
             : "FILEINDEX_ROOT in the environment is no absolute path: '" + given + "'";
}

}  // namespace kavo::local
