#include "daemons/kavoelasticd/fold.h"

#include <unicode/normalizer2.h>
#include <unicode/uchar.h>
#include <unicode/unistr.h>
#include <unicode/uscript.h>
#include <unicode/utf8.h>

#include <algorithm>
#include <new>

namespace vexlo::elasticd {
namespace {

struct Normalizers {
  Normalizers() {
    UErrorCode status = U_ZERO_ERROR;
    casefold = icu::Normalizer2::getNFKCCasefoldInstance(status);
    decompose = icu::Normalizer2::getNFDInstance(status);
    compose = icu::Normalizer2::getNFCInstance(status);
    if (U_FAILURE(status) != 0) {
      throw std::bad_alloc();  // The data is built into the library.
    }
  }
  const icu::Normalizer2* casefold;
  const icu::Normalizer2* decompose;
  const icu::Normalizer2* compose;
};

bool IsAccent(UChar32 c) {
  if (c == 0x3099 || c == 0x309A || u_charType(c) != U_NON_SPACING_MARK) {
    return false;
  }
  return u_getIntPropertyValue(c, UCHAR_SCRIPT) == USCRIPT_INHERITED;
}

void FoldUnicode(std::string_view text, std::string* out) {
  static const Normalizers normalizers;
  UErrorCode status = U_ZERO_ERROR;
  const icu::UnicodeString folded =
      normalizers.casefold->normalize(icu::UnicodeString::fromUTF8(icu::StringPiece(
                                          text.data(), static_cast<int32_t>(text.size()))),
                                      status);
  const icu::UnicodeString apart = normalizers.decompose->normalize(folded, status);
  icu::UnicodeString bare;
  for (int32_t i = 0; i < apart.length(); i = apart.moveIndex32(i, 1)) {
    if (const UChar32 c = apart.char32At(i); !IsAccent(c)) {
      bare.append(c);
    }
  }
  const icu::UnicodeString whole = normalizers.compose->normalize(bare, status);
  if (U_FAILURE(status) != 0) {
    throw std::bad_alloc();
  }
  whole.toUTF8String(*out);
}

}  // namespace

int32_t NextWideCodePoint(std::string_view text, size_t* at) {
  const auto* bytes = reinterpret_cast<const uint8_t*>(text.data());
  size_t behind = *at;
  UChar32 c = 0;
  U8_NEXT(bytes, behind, text.size(), c);
  // ICU skips a whole malformed sequence; one byte at a time keeps every byte.
  *at = c < 0 ? *at + 1 : behind;
  return c;
}

std::string Fold(std::string_view text) {
  std::string out(text);
  if (std::all_of(text.begin(), text.end(), [](char c) { return (c & 0x80) == 0; })) {
    for (char& c : out) {
      c = c >= 'A' && c <= 'Z' ? static_cast<char>(c - 'A' + 'a') : c;
    }
    return out;
  }
  out.clear();
  size_t begin = 0;
  for (size_t i = 0; i < text.size();) {
    const size_t from = i;
    if (NextCodePoint(text, &i) < 0) {
      FoldUnicode(text.substr(begin, from - begin), &out);
      out += text[from];
      begin = i;
    }
  }
  FoldUnicode(text.substr(begin), &out);
  return out;
}

}  // namespace vexlo::elasticd
