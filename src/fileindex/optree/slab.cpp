#include "fileindex/optree/slab.h"

#include <atomic>
#include <cstdint>
#include <cstdlib>

namespace vexlo::fileindex {
namespace {

// Slabs are aligned to this, so that an object's address tells its slab. Somewhat smaller, so that
// the heap's own words fit between two of them. Small enough that the heap does not map each on its
// own, with as much again for the alignment.
constexpr size_t kAlignment = size_t{32} * 1024;
constexpr size_t kSlabBytes = kAlignment - 64;
// Stands for the thread that fills the slab, which so need not count what it takes one by one.
constexpr uint32_t kOpen = uint32_t{1} << 31;

struct Slab {
  std::atomic<uint32_t> used{kOpen};  // Objects that are in use, once the slab is closed.
};
constexpr size_t kFirst = 16;
static_assert(sizeof(Slab) <= kFirst);

void Release(Slab* slab, uint32_t count) noexcept {
  if (slab->used.fetch_sub(count, std::memory_order_acq_rel) == count) {
    slab->~Slab();
    free(slab);
  }
}

class OpenSlab {
 public:
  OpenSlab() = default;
  ~OpenSlab() { Close(); }
  OpenSlab(const OpenSlab&) = delete;
  OpenSlab& operator=(const OpenSlab&) = delete;

  void* Take(size_t bytes) {
    bytes = (bytes + 7) & ~size_t{7};
    if (slab_ == nullptr || at_ + bytes > kSlabBytes) {
      Open();
    }
    void* const memory = reinterpret_cast<char*>(slab_) + at_;
    at_ += bytes;
    ++taken_;
    return memory;
  }

 private:
  void Open() {
    void* memory = nullptr;  // aligned_alloc() takes no size that the alignment does not divide.
    if (posix_memalign(&memory, kAlignment, kSlabBytes) != 0) {
      throw std::bad_alloc();
    }
    Close();
    slab_ = new (memory) Slab;
    at_ = kFirst;
    taken_ = 0;
  }

  void Close() noexcept {
    if (slab_ != nullptr) {
      Release(slab_, kOpen - taken_);
      slab_ = nullptr;
    }
  }

  Slab* slab_ = nullptr;
  size_t at_ = 0;
  uint32_t taken_ = 0;
};

thread_local OpenSlab open_slab;

}  // namespace

void* TakeFromSlab(size_t bytes) { return open_slab.Take(bytes); }

void GiveToSlab(void* memory) noexcept {
  const uintptr_t at = reinterpret_cast<uintptr_t>(memory) & (kAlignment - 1);
  Release(reinterpret_cast<Slab*>(static_cast<char*>(memory) - at), 1);
}

}  // namespace vexlo::fileindex
