// A hash for names and paths. Not installed.
#ifndef FILEINDEX_OPTREE_NAME_HASH_H_
#define FILEINDEX_OPTREE_NAME_HASH_H_

#include <sys/auxv.h>

#include <cstddef>
#include <cstdint>
#include <cstring>
#include <string_view>

namespace vexlo::fileindex {

// Different in each process, so that nobody can choose file names that collide.
inline const uint64_t kNameHashSeed = [] {
  uint64_t seed = 0xA0761D6478BD642F;
  // NOLINTNEXTLINE(performance-no-int-to-ptr): 16 random bytes that the kernel put there.
  if (const auto* const random = reinterpret_cast<const char*>(getauxval(AT_RANDOM))) {
    memcpy(&seed, random + sizeof(seed), sizeof(seed));
  }
  return seed;
}();

// A 64-bit hash all of whose bits are usable: two words of the text at a time are multiplied to 128
// bits and folded. For a short name it costs a few nanoseconds.
inline uint64_t NameHash(std::string_view text) {
  constexpr uint64_t kOdd = 0xE7037ED1A0B428DB;
  __extension__ using Wide = unsigned __int128;
  const auto fold = [](uint64_t a, uint64_t b) {
    const Wide product = static_cast<Wide>(a) * b;
    return static_cast<uint64_t>(product) ^ static_cast<uint64_t>(product >> 64);
  };
  const auto word = [](const char* at, size_t bytes) {
    uint64_t value = 0;
    memcpy(&value, at, bytes);
    return value;
  };
  const char* at = text.data();
  size_t left = text.size();
  uint64_t hash = kOdd ^ left;
  while (left > 16) {
    hash = fold(word(at, 8) ^ kNameHashSeed, word(at + 8, 8) ^ hash);
    at += 16;
    left -= 16;
  }
  uint64_t low = 0;
  uint64_t high = 0;
  if (left >= 8) {  // The two words overlap, unless there are 16 bytes.
    low = word(at, 8);
    high = word(at + left - 8, 8);
  } else if (left >= 4) {
    low = word(at, 4);
    high = word(at + left - 4, 4);
  } else if (left > 0) {
    low = word(at, 1) | word(at + left / 2, 1) << 8 | word(at + left - 1, 1) << 16;
  }
  return fold(kOdd, fold(low ^ kNameHashSeed, high ^ hash));
}

}  // namespace vexlo::fileindex

#endif  // FILEINDEX_OPTREE_NAME_HASH_H_
