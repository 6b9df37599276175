// What a node with many children knows of them. Not installed.
#ifndef FILEINDEX_OPTREE_CHILD_INDEX_H_
#define FILEINDEX_OPTREE_CHILD_INDEX_H_

#include <array>
#include <bit>
#include <cstddef>
#include <cstdint>
#include <string_view>
#include <vector>

#include "fileindex/optree/name_hash.h"

namespace vexlo::fileindex {

// Names of children to their positions: open addressing over 8-byte slots that hold a position and
// half a hash. The names stay with the children; `name_at(position)` gives them. The list of
// children is public, so the index follows it: what was appended behind its back is taken in at the
// next look-up, and when something was removed it starts over.
class ChildIndex {
 public:
  // Below this many children a linear search is as fast, and most folders need no index.
  static constexpr size_t kFewestChildren = 8;

  // The position of the first child of that name, whose NameHash() is `hash`, or `count`, the
  // number of children.
  template <typename NameAt>
  size_t Find(size_t count, NameAt name_at, std::string_view name, uint64_t hash) {
    if (indexed_ != count) {
      Follow(count, name_at);
    }
    const Slot& slot = Probe(name_at, name, hash);
    return slot.position_plus_one == 0 ? count : slot.position_plus_one - 1;
  }

  // A look-up in steps, for those who make several at once and would wait for memory at each:
  // prefetch the hash's slot; take the position that stands there, or kNone; see for themselves
  // whether it is the right one. A child that is not found so may be there all the same.
  static constexpr size_t kNone = SIZE_MAX;
  void Prefetch(uint64_t hash) const {
    if (!slots_.empty()) {
      __builtin_prefetch(&slots_[hash & (slots_.size() - 1)]);
    }
  }
  size_t Guess(uint64_t hash) const {
    const size_t mask = slots_.size() - 1;
    for (size_t at = hash & mask; !slots_.empty() && slots_[at].position_plus_one != 0;
         at = (at + 1) & mask) {
      if (slots_[at].tag == Tag(hash)) {
        return slots_[at].position_plus_one - 1;
      }
    }
    return kNone;
  }

  // For each mark that a node may carry, the positions of the children that carry it (some may not
  // any more), so that a walk finds a few marked ones among a million without looking at each.
  std::array<std::vector<uint32_t>, 3> marked;

 private:
  struct Slot {
    uint32_t tag;
    uint32_t position_plus_one;  // 0: empty.
  };

  static uint32_t Tag(uint64_t hash) { return static_cast<uint32_t>(hash >> 32); }

  // The slot of that name, or the empty one where it belongs.
  template <typename NameAt>
  Slot& Probe(NameAt name_at, std::string_view name, uint64_t hash) {
    const size_t mask = slots_.size() - 1;
    for (size_t at = hash & mask;; at = (at + 1) & mask) {
      Slot& slot = slots_[at];
      if (slot.position_plus_one == 0 ||
          (slot.tag == Tag(hash) && name_at(slot.position_plus_one - 1) == name)) {
        return slot;
      }
    }
  }

  template <typename NameAt>
  void Follow(size_t count, NameAt name_at) {
    const size_t wanted_slots = std::bit_ceil(count * 4 / 3 + 1);
    if (count < indexed_ || wanted_slots > slots_.size()) {
      slots_.assign(wanted_slots, Slot{});
      indexed_ = 0;
    }
    for (; indexed_ < count; ++indexed_) {
      const std::string_view name = name_at(indexed_);
      const uint64_t hash = NameHash(name);
      Slot& slot = Probe(name_at, name, hash);
      if (slot.position_plus_one == 0) {  // Of equal names the first wins.
        slot = {Tag(hash), static_cast<uint32_t>(indexed_ + 1)};
      }
    }
  }

  std::vector<Slot> slots_;  // A power of two, at most three quarters full.
  size_t indexed_ = 0;       // So many children from the first one on are in.
};

}  // namespace vexlo::fileindex

#endif  // FILEINDEX_OPTREE_CHILD_INDEX_H_
