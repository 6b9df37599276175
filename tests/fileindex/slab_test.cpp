#include "fileindex/optree/slab.h"

#include <gtest/gtest.h>
#include <malloc.h>

#include <algorithm>
#include <cerrno>
#include <cstdint>
#include <cstdlib>
#include <cstring>
#include <memory>
#include <new>
#include <random>
#include <thread>
#include <vector>

#include "fileindex/optree/optree.h"
#include "support/faults.h"
#include "support/queue_file.h"
#include "support/temp_folder.h"

namespace {

bool no_memory = false;

}  // namespace

INTERPOSED int posix_memalign(void** memory, size_t alignment, size_t size) noexcept {
  *memory = no_memory ? nullptr : memalign(alignment, size);
  return *memory == nullptr ? ENOMEM : 0;
}

namespace vexlo::fileindex {
namespace {

size_t HeapInUse() {
  const struct mallinfo2 info = mallinfo2();
  return info.uordblks + info.hblkhd;
}

struct Piece {
  unsigned char* memory;
  size_t bytes;
};

// Pieces that overlap, or a slab that is freed too early, show in what the pieces hold; one that is
// never freed shows in the heap.
TEST(Slab, GivesEachPieceItsOwnMemoryAndAllOfItBack) {
  constexpr size_t kPieces = 20000;
  const size_t before = HeapInUse();
  std::vector<Piece> pieces;
  pieces.reserve(kPieces);
  std::thread([&pieces] {
    for (size_t i = 0; i < kPieces; ++i) {
      const size_t bytes = 1 + i * 7919 % 300;
      pieces.push_back({static_cast<unsigned char*>(TakeFromSlab(bytes)), bytes});
      ASSERT_EQ(reinterpret_cast<uintptr_t>(pieces.back().memory) % 8, 0U);
      memset(pieces.back().memory, static_cast<int>(i % 251), bytes);
    }
  }).join();
  std::vector<size_t> order(kPieces);
  for (size_t i = 0; i < kPieces; ++i) {
    order[i] = i;
  }
  std::shuffle(order.begin(), order.end(), std::mt19937(7));
  const auto give = [&](size_t from, size_t to) {
    for (size_t i = from; i < to; ++i) {
      const auto& [memory, bytes] = pieces[order[i]];
      const auto holds = static_cast<unsigned char>(order[i] % 251);
      EXPECT_TRUE(std::all_of(memory, memory + bytes,
                              [holds](unsigned char byte) { return byte == holds; }));
      GiveToSlab(memory);
    }
  };
  std::thread half([&] { give(0, kPieces / 2); });
  give(kPieces / 2, kPieces);
  half.join();
  pieces = std::vector<Piece>();
  order = std::vector<size_t>();
  EXPECT_LT(HeapInUse(), before + 64 * 1024);
}

TEST(Slab, ThrowsWithoutMemoryAndGoesOnWithIt) {
  no_memory = true;
  std::vector<void*> taken;
  EXPECT_THROW(
      for (int i = 0; i < 100000; ++i) { taken.push_back(TakeFromSlab(100)); }, std::bad_alloc);
  no_memory = false;
  taken.push_back(TakeFromSlab(100));
  for (void* const memory : taken) {
    GiveToSlab(memory);
  }
}

TEST(Slab, KeepsAnOperationThatOutlivesItsTree) {
  const TempFolder folder;
  WriteText(folder / "queue", Join({Line(EV_CREATE, "/a/b"), Line(EV_RENAME, "/a/d", "/a/c")}));
  std::vector<std::shared_ptr<OP>> kept;
  std::thread([&] {
    OPTree(folder / "queue").ProcessOP([&kept](std::shared_ptr<OP> op) { kept.push_back(op); });
  }).join();
  ASSERT_EQ(kept.size(), 2U);
  EXPECT_EQ(kept[0]->op, OP_UPSERT);
  EXPECT_EQ(kept[1]->path_old, "/a/c");
  EXPECT_TRUE(kept[0]->node.expired() && kept[1]->node.expired());
}

}  // namespace
}  // namespace vexlo::fileindex
