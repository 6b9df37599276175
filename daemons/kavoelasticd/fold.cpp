#include "daemons/kavoelasticd/fold.h"

#include <unicode/normalizer2.h>
#include <unicode/uchar.h>
#include <unicode/unistr.h>
#include <unicode/uscript.h>
#include <unicode/utf8.h>

#include <algorithm>
#include <cstddef>
#include <new>
#include <vector>

namespace vexlo::elasticd {
namespace {

// In UTF-16 units.
constexpr int32_t kLongRun = 30;

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

// What a normalizer does to marks behind one another: takes each apart, and puts those of one
// stretch in the order of their classes.
void AppendInOrder(const icu::Normalizer2& form, const icu::UnicodeString& run,
                   icu::UnicodeString* out) {
  icu::UnicodeString apart;
  for (int32_t i = 0; i < run.length(); i = run.moveIndex32(i, 1)) {
    const UChar32 c = run.char32At(i);
    if (icu::UnicodeString parts; form.getDecomposition(c, parts) != 0) {
      apart.append(parts);
    } else {
      apart.append(c);
    }
  }
  std::vector<UChar32> marks(static_cast<size_t>(apart.countChar32()));
  UErrorCode status = U_ZERO_ERROR;
  apart.toUTF32(marks.data(), static_cast<int32_t>(marks.size()), status);
  const auto is_starter = [](UChar32 c) { return u_getCombiningClass(c) == 0; };
  for (auto begin = marks.begin(); begin != marks.end();) {
    begin = std::find_if_not(begin, marks.end(), is_starter);
    const auto end = std::find_if(begin, marks.end(), is_starter);
    std::stable_sort(begin, end, [](UChar32 a, UChar32 b) {
      return u_getCombiningClass(a) < u_getCombiningClass(b);
    });
    begin = end;
  }
  for (const UChar32 c : marks) {
    out->append(c);
  }
}

// ICU orders marks by insertion, which for a megabyte of them takes a minute. No language has as
// many as this behind a letter; where they are in order already, ICU has nothing to move.
icu::UnicodeString LongRunsInOrder(const icu::Normalizer2& form, const icu::UnicodeString& text) {
  icu::UnicodeString ordered;
  for (int32_t begin = 0; begin < text.length();) {
    int32_t end = text.moveIndex32(begin, 1);
    if (form.hasBoundaryBefore(text.char32At(begin)) != 0) {
      ordered.append(text, begin, end - begin);
      begin = end;
      continue;
    }
    while (end < text.length() && form.hasBoundaryBefore(text.char32At(end)) == 0) {
      end = text.moveIndex32(end, 1);
    }
    if (end - begin > kLongRun) {
      AppendInOrder(form, text.tempSubStringBetween(begin, end), &ordered);
    } else {
      ordered.append(text, begin, end - begin);
    }
    begin = end;
  }
  return ordered;
}

// Letters with a stroke through them are accented to whoever has no key for them, but Unicode takes
// none of them apart.
UChar32 WithoutStroke(UChar32 c) {
  switch (c) {
    case 0x00F8:
      return 'o';
    case 0x0111:
      return 'd';
    case 0x0142:
      return 'l';
    default:
      return c;
  }
}

void FoldUnicode(std::string_view text, std::string* out) {
  static const Normalizers normalizers;
  UErrorCode status = U_ZERO_ERROR;
  icu::UnicodeString wide = icu::UnicodeString::fromUTF8(
      icu::StringPiece(text.data(), static_cast<int32_t>(text.size())));
  if (wide.length() > kLongRun) {
    wide = LongRunsInOrder(*normalizers.casefold, wide);
  }
  const icu::UnicodeString folded = normalizers.casefold->normalize(wide, status);
  const icu::UnicodeString apart = normalizers.decompose->normalize(folded, status);
  icu::UnicodeString bare;
  for (int32_t i = 0; i < apart.length(); i = apart.moveIndex32(i, 1)) {
    if (const UChar32 c = apart.char32At(i); !IsAccent(c)) {
      bare.append(WithoutStroke(c));
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
