#include "daemons/common/entry_digest.h"

#define XXH_INLINE_ALL  // Few bytes are hashed many times.
#include <xxhash.h>

namespace vexlo::daemon {

uint64_t EntryHash(uint64_t seed, std::string_view name, const EntryFacts& facts) {
  const int64_t numbers[] = {facts.size, facts.mtime_ns, facts.ctime_ns,
                             (facts.content ? 1 : 0) + (facts.is_settled ? 2 : 0)};
  return XXH3_64bits_withSeed(name.data(), name.size(),
                              XXH3_64bits_withSeed(numbers, sizeof(numbers), seed));
}

uint64_t EntrySeed(std::string_view token) { return XXH3_64bits(token.data(), token.size()); }

}  // namespace vexlo::daemon
