// What a node with many children knows of them. Not installed.
#ifndef FILEINDEX_OPTREE_CHILD_INDEX_H_
#define FILEINDEX_OPTREE_CHILD_INDEX_H_

#include <algorithm>
#include <array>
#include <bit>
#include <cstddef>
#include <cstdint>
#include <string_view>
#include <utility>
#include <vector>

#include "fileindex/optree/name_hash.h"

namespace vexlo::fileindex {

// The children of a node that carry one mark, by position: a bit for each. Some may not carry it
// any more. A walk finds a few marked ones among a million without looking at each child.
class MarkedChildren {
 public:
  void Add(size_t position) {
    const size_t word = position / 64;
    if (word >= words_.size()) {
      words_.resize(std::max(word + 1, words_.size() + words_.size() / 2));
    }
    words_[word] |= uint64_t{1} << position % 64;
    first_ = std::min(first_, word);
    behind_ = std::max(behind_, word + 1);
  }

  // Takes all out and calls `visit(position)` on each, in order. `visit` adds none to this list.
  template <typename Visit>
  void TakeAll(Visit visit) {
    const size_t behind = std::exchange(behind_, 0);
    for (size_t word = std::exchange(first_, SIZE_MAX); word < behind; ++word) {
      for (uint64_t bits = std::exchange(words_[word], 0); bits != 0; bits &= bits - 1) {
        visit(word * 64 + static_cast<size_t>(std::countr_zero(bits)));
      }
    }
  }

 private:
  std::vector<uint64_t> words_;
  size_t first_ = SIZE_MAX;  // All others outside [first_, behind_) are zero.
  size_t behind_ = 0;
};

// Names of children to their positions: open addressing over 4-byte slots that hold a position and,
// in the bits that are left, a piece of the hash. The names stay with the children.
// Their list is public, so the index follows it: what was appended behind its back is taken in at
// the next look-up, and when something was removed it starts over.
class ChildIndex {
 public:
  // Below this many children a linear search is as fast, and most folders need no index.
  static constexpr size_t kFewestChildren = 8;

  // The first child of that name, whose NameHash() is `hash`, or null. `children` is a list of
  // pointers to what has a `name`.
  template <typename Children>
  auto* Find(const Children& children, std::string_view name, uint64_t hash) {
    if (indexed_ != children.size()) {
      Follow(children);
    }
    const uint32_t slot = Probe(children, name, hash);
    return slot == 0 ? nullptr : &*children[Position(slot)];
  }

  // Takes in the child behind the `count` that there were, of which none has that name. Without
  // this the next look-up does so, with a hash and a probe of its own.
  void Append(size_t count, uint64_t hash) {
    if (indexed_ == count && WantedSlots(count + 1) <= slots_.size()) {
      const size_t mask = slots_.size() - 1;
      size_t at = hash & mask;
      while (slots_[at] != 0) {
        at = (at + 1) & mask;
      }
      slots_[at] = Entry(hash, count);
      indexed_ = count + 1;
    }
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
    for (size_t at = hash & mask; !slots_.empty() && slots_[at] != 0; at = (at + 1) & mask) {
      if (slots_[at] >> tag_shift_ == Tag(hash)) {
        return Position(slots_[at]);
      }
    }
    return kNone;
  }

  std::array<MarkedChildren, 3> marked;  // For each mark that a node may carry.

 private:
  // Of the hash the bits that do not choose the slot, as many as there is room for.
  uint32_t Tag(uint64_t hash) const { return static_cast<uint32_t>(hash >> 32) >> tag_shift_; }
  size_t Position(uint32_t slot) const { return (slot & ((uint32_t{1} << tag_shift_) - 1)) - 1; }

  uint32_t Entry(uint64_t hash, size_t position) const {
    return Tag(hash) << tag_shift_ | static_cast<uint32_t>(position + 1);
  }
  static size_t WantedSlots(size_t count) { return std::bit_ceil(count * 4 / 3 + 1); }

  // The slot of that name, or the empty one where it belongs.
  template <typename Children>
  uint32_t& Probe(const Children& children, std::string_view name, uint64_t hash) {
    const size_t mask = slots_.size() - 1;
    for (size_t at = hash & mask;; at = (at + 1) & mask) {
      uint32_t& slot = slots_[at];
      if (slot == 0 ||
          (slot >> tag_shift_ == Tag(hash) && children[Position(slot)]->name == name)) {
        return slot;
      }
    }
  }

  template <typename Children>
  void Follow(const Children& children) {
    constexpr size_t kAhead = 8;  // So many names are fetched before they are needed.
    const size_t wanted_slots = WantedSlots(children.size());
    if (children.size() < indexed_ || wanted_slots > slots_.size()) {
      slots_.assign(wanted_slots, 0);
      tag_shift_ = static_cast<unsigned>(std::countr_zero(wanted_slots));
      indexed_ = 0;
    }
    for (; indexed_ < children.size(); ++indexed_) {
      if (indexed_ + kAhead < children.size()) {
        __builtin_prefetch(&children[indexed_ + kAhead]->name);
      }
      const std::string_view name = children[indexed_]->name;
      const uint64_t hash = NameHash(name);
      uint32_t& slot = Probe(children, name, hash);
      if (slot == 0) {  // Of equal names the first wins.
        slot = Entry(hash, indexed_);
      }
    }
  }

  // A power of two, at most three quarters full; so a position and one fits the low bits, as many
  // as it takes to number the slots, and 0 is an empty slot.
  std::vector<uint32_t> slots_;
  unsigned tag_shift_ = 0;  // So many bits.
  size_t indexed_ = 0;      // So many children from the first one on are in.
};

}  // namespace vexlo::fileindex

#endif  // FILEINDEX_OPTREE_CHILD_INDEX_H_
