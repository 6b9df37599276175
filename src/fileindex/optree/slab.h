// Memory for the many small objects of a tree. Not installed.
#ifndef FILEINDEX_OPTREE_SLAB_H_
#define FILEINDEX_OPTREE_SLAB_H_

#include <cstddef>
#include <new>

namespace vexlo::fileindex {

// Takes `bytes`, aligned to 8, off the calling thread's open slab; std::bad_alloc when there is no
// memory. Objects that are made one after the other stand one after the other, without the
// allocator's own words between them.
void* TakeFromSlab(size_t bytes);

// Gives it back, on any thread. A slab goes back to the heap as a whole, when nothing in it is used
// any more: so one object that outlives its tree keeps 32 KiB.
void GiveToSlab(void* memory) noexcept;

// The allocator over these, for std::allocate_shared.
template <typename T>
struct SlabAllocator {
  using value_type = T;

  SlabAllocator() = default;
  // NOLINTBEGIN(google-explicit-constructor,readability-identifier-naming): as the library asks.
  template <typename Other>
  SlabAllocator(const SlabAllocator<Other>& /*other*/) {}

  T* allocate(size_t count) {
    static_assert(alignof(T) <= 8);
    if (count != 1) {
      throw std::bad_alloc();  // Single objects only.
    }
    return static_cast<T*>(TakeFromSlab(sizeof(T)));
  }
  void deallocate(T* memory, size_t /*count*/) noexcept { GiveToSlab(memory); }
  // NOLINTEND(google-explicit-constructor,readability-identifier-naming)

  template <typename Other>
  bool operator==(const SlabAllocator<Other>& /*other*/) const {
    return true;
  }
};

}  // namespace vexlo::fileindex

#endif  // FILEINDEX_OPTREE_SLAB_H_
