#include "daemons/kavoelasticd/pack.h"

#include <zstd.h>

#include <cstddef>
#include <memory>
#include <new>

#include "daemons/kavoelasticd/failure.h"

namespace vexlo::elasticd {
namespace {

// Stored: never renumber.
constexpr char kPlain = 0;
constexpr char kFrame = 1;

// Higher levels take several times as long for a tenth less.
constexpr int kLevel = 1;
// No request is as long.
constexpr unsigned long long kMaxTextBytes = 1ULL << 30;

struct ContextDelete {
  void operator()(ZSTD_CCtx* context) const { ZSTD_freeCCtx(context); }
  void operator()(ZSTD_DCtx* context) const { ZSTD_freeDCtx(context); }
};

[[noreturn]] void Damaged() { throw Failure(Code::kIndexDamaged, "a stored text is damaged"); }

// Made once a thread: that costs more than a short text.
ZSTD_CCtx* Compressor() {
  thread_local const std::unique_ptr<ZSTD_CCtx, ContextDelete> context(ZSTD_createCCtx());
  return context != nullptr ? context.get() : throw std::bad_alloc();
}

ZSTD_DCtx* Decompressor() {
  thread_local const std::unique_ptr<ZSTD_DCtx, ContextDelete> context(ZSTD_createDCtx());
  return context != nullptr ? context.get() : throw std::bad_alloc();
}

}  // namespace

std::string Pack(std::string_view text) {
  std::string packed(1 + ZSTD_compressBound(text.size()), kFrame);
  const size_t size = ZSTD_compressCCtx(Compressor(), packed.data() + 1, packed.size() - 1,
                                        text.data(), text.size(), kLevel);
  if (ZSTD_isError(size) != 0 || size >= text.size()) {
    packed = kPlain;
    packed += text;
    return packed;
  }
  packed.resize(1 + size);
  return packed;
}

std::string Unpack(std::string_view packed) {
  if (packed.empty()) {
    Damaged();
  }
  const std::string_view rest = packed.substr(1);
  if (packed[0] == kPlain) {
    return std::string(rest);
  }
  // Also more than the limit for a frame without its length, and for what is no frame.
  const unsigned long long size = ZSTD_getFrameContentSize(rest.data(), rest.size());
  if (packed[0] != kFrame || size > kMaxTextBytes) {
    Damaged();
  }
  std::string text(static_cast<size_t>(size), '\0');
  if (ZSTD_decompressDCtx(Decompressor(), text.data(), text.size(), rest.data(), rest.size()) !=
      size) {
    Damaged();
  }
  return text;
}

}  // namespace vexlo::elasticd
