#include "daemons/kavocontentextractd/plain_text.h"

#include <uchardet.h>
#include <unicode/ucnv.h>
#include <unicode/utf8.h>

#include <algorithm>
#include <cstdint>
#include <iterator>
#include <memory>
#include <utility>

#include "daemons/kavocontentextractd/formats.h"
#include "kavo/local/content.h"

namespace vexlo::extractd {
namespace {

constexpr size_t kProbeBytes = size_t{64} << 10;
constexpr size_t kGuessBytes = size_t{256} << 10;
constexpr char kFallback[] = "windows-1252";
constexpr std::string_view kReplacement = "\xEF\xBF\xBD";

struct Mark {
  std::string_view bytes;
  const char* encoding;
};
// UTF-32 before UTF-16: the little-endian marks begin alike.
constexpr Mark kMarks[] = {
    {"\xEF\xBB\xBF", "UTF-8"}, {{"\xFF\xFE\0\0", 4}, "UTF-32LE"}, {{"\0\0\xFE\xFF", 4}, "UTF-32BE"},
    {"\xFF\xFE", "UTF-16LE"},  {"\xFE\xFF", "UTF-16BE"},
};

// Names that are not taken for what they say: encodings whose larger ones are what is written under
// their name, and those that ICU has by another name, or only all but a few letters of.
struct Alias {
  const char* name;
  const char* encoding;
};
constexpr Alias kAliases[] = {
    {"cn-big5", "Big5"},
    {"EUC-KR", "windows-949"},
    {"GB2312", "GB18030"},
    {"GB_2312-80", "GB18030"},
    {"GBK", "GB18030"},
    {"ISO-8859-1", "windows-1252"},
    {"ISO-8859-11", "TIS-620"},
    {"ISO-8859-16", "ISO-8859-2"},
    {"ISO-8859-9", "windows-1254"},
    {"koi", "KOI8-R"},
    {"koi8-ru", "KOI8-U"},
    {"logical", "ISO-8859-8"},
    {"UHC", "windows-949"},
    {"US-ASCII", "windows-1252"},
    {"visual", "ISO-8859-8"},
};

// ICU's own name of an encoding that it knows, else the one that it is given.
const char* CanonicalName(const char* name) {
  UErrorCode error = U_ZERO_ERROR;
  const char* const known = ucnv_getAlias(name, 0, &error);
  return known == nullptr ? name : known;
}

}  // namespace

void AppendUtf8(std::string& out, char32_t character) {
  uint8_t bytes[U8_MAX_LENGTH];
  int32_t size = 0;
  UBool is_error = 0;
  U8_APPEND(bytes, size, U8_MAX_LENGTH, static_cast<UChar32>(character), is_error);
  if (is_error != 0) {
    out += kReplacement;
  } else {
    out.append(reinterpret_cast<const char*>(bytes), static_cast<size_t>(size));
  }
}

bool HasBinaryControls(std::string_view bytes) {
  return std::any_of(bytes.begin(), bytes.end(), [](char c) {
    const auto byte = static_cast<unsigned char>(c);
    return byte < 0x20 && (byte < '\b' || byte > '\r') && byte != 0x1B;
  });
}

bool HasShifts(std::string_view bytes) {
  const bool has_escape = bytes.find("\x1B$") != std::string_view::npos ||
                          bytes.find("\x1B(") != std::string_view::npos;
  return has_escape && std::none_of(bytes.begin(), bytes.end(),
                                    [](char c) { return static_cast<unsigned char>(c) >= 0x80; });
}

bool IsUtf8(std::string_view bytes, bool has_more) {
  const auto* const start = reinterpret_cast<const uint8_t*>(bytes.data());
  size_t at = 0;
  while (at < bytes.size()) {
    const auto length = static_cast<int32_t>(std::min<size_t>(bytes.size() - at, U8_MAX_LENGTH));
    int32_t used = 0;
    UChar32 character = 0;
    U8_NEXT(start + at, used, length, character);
    if (character < 0) {
      // The bytes of a character that is cut off are all that is left.
      return has_more && at + static_cast<size_t>(used) == bytes.size() &&
             used <= U8_COUNT_TRAIL_BYTES(start[at]);
    }
    at += static_cast<size_t>(used);
  }
  return true;
}

std::string FindEncoding(const std::string& name) {
  const char* const wanted = CanonicalName(name.c_str());
  const auto* const row =
      std::find_if(std::begin(kAliases), std::end(kAliases), [wanted](const Alias& alias) {
        return ucnv_compareNames(wanted, CanonicalName(alias.name)) == 0;
      });
  std::string encoding = row == std::end(kAliases) ? name : row->encoding;
  return name.empty() || !Convert("", encoding) ? "" : encoding;
}

std::string GuessEncoding(std::string_view bytes) {
  const std::unique_ptr<struct uchardet, decltype(&uchardet_delete)> detector(uchardet_new(),
                                                                              uchardet_delete);
  if (uchardet_handle_data(detector.get(), bytes.data(), std::min(bytes.size(), kGuessBytes)) !=
      0) {
    return kFallback;
  }
  uchardet_data_end(detector.get());
  std::string guess = FindEncoding(uchardet_get_charset(detector.get()));
  return guess.empty() ? kFallback : guess;
}

std::optional<std::string> Convert(std::string_view bytes, const std::string& encoding) {
  UErrorCode error = U_ZERO_ERROR;
  const std::unique_ptr<UConverter, decltype(&ucnv_close)> from(ucnv_open(encoding.c_str(), &error),
                                                                ucnv_close);
  const std::unique_ptr<UConverter, decltype(&ucnv_close)> to(ucnv_open("UTF-8", &error),
                                                              ucnv_close);
  if (U_FAILURE(error)) {
    return std::nullopt;
  }
  std::string text;
  text.reserve(bytes.size() + bytes.size() / 2);
  UChar pivot[1024];
  UChar* pivot_source = pivot;
  UChar* pivot_target = pivot;
  const char* source = bytes.data();
  bool reset = true;
  do {
    char buffer[8192];
    char* target = buffer;
    error = U_ZERO_ERROR;
    ucnv_convertEx(to.get(), from.get(), &target, buffer + sizeof(buffer), &source,
                   bytes.data() + bytes.size(), pivot, &pivot_source, &pivot_target,
                   pivot + std::size(pivot), static_cast<UBool>(reset), /*flush=*/1, &error);
    text.append(buffer, target);
    reset = false;
  } while (error == U_BUFFER_OVERFLOW_ERROR);
  return text;
}

std::optional<std::string> DecodeText(std::string_view bytes, bool has_more) {
  const auto* const mark = std::find_if(std::begin(kMarks), std::end(kMarks), [&](const Mark& row) {
    return bytes.starts_with(row.bytes);
  });
  if (mark != std::end(kMarks)) {
    bytes.remove_prefix(mark->bytes.size());
    return Convert(bytes, mark->encoding);
  }
  const size_t nul = bytes.find('\0');
  if (nul < kProbeBytes) {
    return std::nullopt;
  }
  if (nul != std::string_view::npos) {  // Text with something else behind it.
    bytes = bytes.substr(0, nul);
    has_more = true;
  }
  if (HasBinaryControls(bytes)) {
    return std::nullopt;
  }
  const std::string encoding =
      IsUtf8(bytes, has_more) && !HasShifts(bytes) ? "UTF-8" : GuessEncoding(bytes);
  std::optional<std::string> text = Convert(bytes, encoding);
  while (has_more && text && text->ends_with(kReplacement)) {  // A character that is cut off.
    text->resize(text->size() - kReplacement.size());
  }
  return text;
}

bool ReadPlainText(const Source& source, Document& document) {
  // As much as ends at the same place whatever the encoding takes for a letter: one or two bytes.
  constexpr size_t kMostBytes = 2 * kavo::local::kMaxTextBytes;
  const bool has_more = source.Size() > kMostBytes;
  const std::optional<std::string> text = DecodeText(source.Read(kMostBytes), has_more);
  if (!text) {
    return false;
  }
  document.text.Append(*text);
  if (has_more) {
    document.text.SetTruncated();
  }
  return true;
}

}  // namespace vexlo::extractd
