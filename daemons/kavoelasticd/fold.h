// One spelling for texts that people hold for the same: case, accents, composed and decomposed
// forms, full and half width. Pure.
#ifndef DAEMONS_KAVOELASTICD_FOLD_H_
#define DAEMONS_KAVOELASTICD_FOLD_H_

#include <cstddef>
#include <cstdint>
#include <string>
#include <string_view>

namespace vexlo::elasticd {

// The next one for a byte that is not ASCII.
int32_t NextWideCodePoint(std::string_view text, size_t* at);

// What stands at `*at`, which is moved behind it: a code point, or -1 for one byte that is no
// UTF-8.
inline int32_t NextCodePoint(std::string_view text, size_t* at) {
  const auto byte = static_cast<unsigned char>(text[*at]);
  if (byte < 0x80) {
    ++*at;
    return byte;
  }
  return NextWideCodePoint(text, at);
}

// NFKC with case folding, without the accents of Latin, Greek, Cyrillic and Arabic letters, and
// without the strokes of d, l and o. The voice marks of kana and the vowel signs of Indic scripts
// tell words apart and stay. Bytes that are no UTF-8 stay as they are.
std::string Fold(std::string_view text);

}  // namespace vexlo::elasticd

#endif  // DAEMONS_KAVOELASTICD_FOLD_H_
