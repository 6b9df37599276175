// The folders that a tree looked up lately. Not installed.
#ifndef FILEINDEX_OPTREE_FOLDER_CACHE_H_
#define FILEINDEX_OPTREE_FOLDER_CACHE_H_

#include <cstddef>
#include <cstdint>
#include <string>
#include <string_view>
#include <vector>

#include "fileindex/optree/op.h"

namespace vexlo::fileindex {

// Paths to nodes, each in the one slot that its hash names; whoever comes later takes the slot
// over. Queues come back to a few hundred folders again and again, and the way down from the root
// is most of a look-up there. The nodes are not owned: whoever moves or removes one calls Forget().
class FolderCache {
 public:
  // Null when the path is not there. `hash` is its NameHash().
  OPNode* Find(std::string_view path, uint64_t hash) const {
    if (slots_.empty()) {
      return nullptr;
    }
    const Slot& slot = slots_[At(hash)];
    return slot.hash == hash && slot.age == age_ && slot.path == path ? slot.node : nullptr;
  }

  void Prefetch(uint64_t hash) const {
    if (!slots_.empty()) {
      __builtin_prefetch(&slots_[At(hash)]);
    }
  }

  void Put(std::string_view path, uint64_t hash, OPNode* node) {
    if (path.size() > kLongestPath) {
      return;
    }
    if (++put_ > slots_.size() / 2 && slots_.size() < kMostSlots) {
      slots_ = std::vector<Slot>(slots_.empty() ? kFewestSlots : slots_.size() * 8);
      put_ = 0;
    }
    Slot& slot = slots_[At(hash)];
    slot.hash = hash;
    slot.age = age_;
    slot.node = node;
    slot.path = path;
  }

  // Takes the same whatever the cache holds.
  void Forget() { ++age_; }

 private:
  // The cache holds at most 16 MiB of paths.
  static constexpr size_t kFewestSlots = 64;
  static constexpr size_t kMostSlots = 4096;
  static constexpr size_t kLongestPath = 4095;

  struct Slot {
    uint64_t hash = 0;
    uint64_t age = 0;  // Of the cache when the slot was filled; 0: never.
    OPNode* node = nullptr;
    std::string path;
  };

  size_t At(uint64_t hash) const { return hash & (slots_.size() - 1); }

  std::vector<Slot> slots_;  // A power of two.
  size_t put_ = 0;           // Since the slots were made.
  uint64_t age_ = 1;
};

}  // namespace vexlo::fileindex

#endif  // FILEINDEX_OPTREE_FOLDER_CACHE_H_
