// What an index and a disk are compared by, a folder at a time and without a list of either. Pure.
#ifndef DAEMONS_COMMON_ENTRY_DIGEST_H_
#define DAEMONS_COMMON_ENTRY_DIGEST_H_

#include <cstdint>
#include <string_view>

namespace vexlo::daemon {

// Of a file, what a comparison looks at: the disk's as it is, or that of a document.
struct EntryFacts {
  int64_t size = 0;
  int64_t mtime_ns = 0;
  int64_t ctime_ns = 0;
  bool content = false;  // Whether what stands in the file is indexed.
  // Whether the document can be told to be current at all. A file on the disk always can.
  bool is_settled = true;
};

// What stands directly in a folder: how many, and the sum of their hashes modulo 2^64, so that the
// order does not matter and one entry is taken out as it was put in.
struct FolderDigest {
  uint64_t count = 0;
  uint64_t sum = 0;

  void Add(uint64_t entry_hash) {
    ++count;
    sum += entry_hash;
  }
  void Remove(uint64_t entry_hash) {
    --count;
    sum -= entry_hash;
  }
  void Add(const FolderDigest& other) {
    count += other.count;
    sum += other.sum;
  }
  bool operator==(const FolderDigest&) const = default;
};

// The hash of the entry `name`. Stored: it must give the same for ever. With a seed that nobody
// outside knows, nobody can make up names or dates that leave a sum as it is.
uint64_t EntryHash(uint64_t seed, std::string_view name, const EntryFacts& facts);

// The seed that belongs to an index with the token.
uint64_t EntrySeed(std::string_view token);

}  // namespace vexlo::daemon

#endif  // DAEMONS_COMMON_ENTRY_DIGEST_H_
