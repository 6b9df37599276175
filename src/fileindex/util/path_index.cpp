#include "fileindex/util/path_index.h"

#include <algorithm>
#include <bit>
#include <cstring>
#include <utility>

namespace vexlo::fileindex {
namespace {

constexpr size_t kDeepest = 63;

uint64_t Mix(uint64_t hash, uint64_t word) {
  // The golden ratio's bits; the folded product of 128 bits spreads every bit of the word.
  const auto product = static_cast<unsigned __int128>(hash ^ word) * 0x9E3779B97F4A7C15U;
  return static_cast<uint64_t>(product) ^ static_cast<uint64_t>(product >> 64U);
}

uint64_t HashComponent(uint64_t hash, std::string_view name) {
  hash = Mix(hash, name.size() + 1);
  for (; name.size() > sizeof(uint64_t); name.remove_prefix(sizeof(uint64_t))) {
    uint64_t word = 0;
    memcpy(&word, name.data(), sizeof(word));
    hash = Mix(hash, word);
  }
  uint64_t word = 0;
  memcpy(&word, name.data(), name.size());
  return Mix(hash, word);
}

// Calls visit(depth, hash, prefix) for the path and every folder above it, from the shallowest on,
// until it returns false. The depth of a path is the number of its slashes.
template <typename Visit>
void WalkDown(std::string_view path, Visit visit) {
  uint64_t hash = 0;
  size_t begin = 0;
  for (size_t depth = 0;; ++depth) {
    const size_t end = std::min(path.find('/', begin), path.size());
    hash = HashComponent(hash, path.substr(begin, end - begin));
    if (!visit(depth, hash, path.substr(0, end)) || end == path.size()) {
      return;
    }
    begin = end + 1;
  }
}

uint64_t HashPath(std::string_view path) {
  uint64_t whole = 0;
  WalkDown(path, [&whole](size_t, uint64_t hash, std::string_view) {
    whole = hash;
    return true;
  });
  return whole;
}

}  // namespace

PathIndex::PathIndex(std::vector<std::string> paths)
    : paths_(std::move(paths)), slots_(std::bit_ceil(paths_.size() * 2 + 1)) {
  for (size_t i = 0; i < paths_.size(); ++i) {
    const std::string& path = paths_[i];
    const uint64_t hash = HashPath(path);
    if (Find(hash, path) != kNone) {
      continue;
    }
    const auto depth = static_cast<size_t>(std::count(path.begin(), path.end(), '/'));
    depths_ |= uint64_t{1} << std::min(depth, kDeepest);
    size_t slot = hash & (slots_.size() - 1);
    while (slots_[slot].at != kNone) {
      slot = (slot + 1) & (slots_.size() - 1);
    }
    slots_[slot] = {hash, i};
  }
}

size_t PathIndex::FindCovering(std::string_view path) const {
  size_t deepest = kNone;
  WalkDown(path, [&](size_t depth, uint64_t hash, std::string_view prefix) {
    const uint64_t from_here = depths_ >> std::min(depth, kDeepest);
    if ((from_here & 1U) != 0) {
      const size_t found = Find(hash, prefix);
      deepest = found != kNone ? found : deepest;
    }
    return from_here > 1 || (depth >= kDeepest && from_here != 0);
  });
  return deepest;
}

size_t PathIndex::FindExactly(std::string_view path) const { return Find(HashPath(path), path); }

size_t PathIndex::Find(uint64_t hash, std::string_view path) const {
  for (size_t slot = hash & (slots_.size() - 1); slots_[slot].at != kNone;
       slot = (slot + 1) & (slots_.size() - 1)) {
    if (slots_[slot].hash == hash && paths_[slots_[slot].at] == path) {
      return slots_[slot].at;
    }
  }
  return kNone;
}

}  // namespace vexlo::fileindex
