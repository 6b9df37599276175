// RTF: the text between its control words.
#include <algorithm>
#include <cstdint>
#include <iterator>
#include <map>
#include <optional>
#include <string>
#include <string_view>
#include <utility>
#include <vector>

#include "daemons/kavocontentextractd/fault.h"
#include "daemons/kavocontentextractd/formats.h"
#include "daemons/kavocontentextractd/plain_text.h"
#include "fileindex/elastic_control/schema.h"
#include "kavo/local/content.h"

namespace vexlo::extractd {
namespace {

namespace field = fileindex::elastic::field;
namespace reason = kavo::local::content_reason;

constexpr size_t kMostBytes = size_t{64} << 20;
constexpr size_t kMostDepth = 10000;
constexpr size_t kMostFonts = 4096;

// Groups that hold no text of the document, or once more what another one holds; so does each that
// begins with "\*".
constexpr std::string_view kHiddenGroups[] = {
    "colortbl", "datafield", "fonttbl", "listoverridetable", "listtable", "objdata", "pict",
    "revtbl",   "rsidtbl",   "shprslt", "stylesheet",        "themedata", "xmlnstbl"};

// What fonts tell by "\fcharset"; the other numbers are no encoding, or the document's.
struct Charset {
  int64_t number;
  const char* encoding;
};
constexpr Charset kCharsets[] = {
    {77, "macintosh"},     {128, "windows-932"},  {129, "windows-949"},  {134, "GB18030"},
    {136, "windows-950"},  {161, "windows-1253"}, {162, "windows-1254"}, {163, "windows-1258"},
    {177, "windows-1255"}, {178, "windows-1256"}, {186, "windows-1257"}, {204, "windows-1251"},
    {222, "windows-874"},  {238, "windows-1250"}, {254, "IBM437"},       {255, "IBM850"},
};
// Words that tell the document's encoding.
struct Encoding {
  std::string_view word;
  const char* encoding;
};
constexpr Encoding kEncodings[] = {{"mac", "macintosh"}, {"pc", "IBM437"}, {"pca", "IBM850"}};

struct InfoGroup {
  std::string_view word;
  const char* field;
};
constexpr InfoGroup kInfoGroups[] = {
    {"author", field::KAVOMDAuthors},        {"category", field::KAVOMDCategory},
    {"company", field::KAVOMDOrganizations}, {"doccomm", field::KAVOMDComment},
    {"keywords", field::KAVOMDKeywords},     {"manager", field::KAVOMDManager},
    {"subject", field::KAVOMDSubject},       {"title", field::KAVOMDTitle},
};

struct Symbol {
  std::string_view word;
  std::string_view text;
};
constexpr Symbol kSymbols[] = {
    {"bullet", "\xE2\x80\xA2"},
    {"cell", "\t"},
    {"emdash", "\xE2\x80\x94"},
    {"endash", "\xE2\x80\x93"},
    {"ldblquote", "\xE2\x80\x9C"},
    {"line", "\n"},
    {"lquote", "\xE2\x80\x98"},
    {"page", "\n"},
    {"par", "\n"},
    {"rdblquote", "\xE2\x80\x9D"},
    {"row", "\n"},
    {"rquote", "\xE2\x80\x99"},
    {"sect", "\n"},
    {"tab", "\t"},
};

template <typename Row, size_t N>
const Row* Find(const Row (&rows)[N], std::string_view word) {
  const Row* const found = std::find_if(std::begin(rows), std::end(rows),
                                        [word](const Row& row) { return row.word == word; });
  return found == std::end(rows) ? nullptr : found;
}

class RtfReader {
 public:
  RtfReader(std::string_view rtf, Document& document) : rtf_(rtf), document_(document) {}

  // False when it ends within a group.
  bool Read() {
    while (at_ < rtf_.size() && !document_.text.IsFull()) {
      const char c = rtf_[at_++];
      if (c == '\\') {
        ReadControl();
      } else if (c == '{') {
        FlushBytes();
        if (groups_.size() > kMostDepth) {
          throw Fault(reason::kDamaged, "the groups of the RTF are nested too deep");
        }
        groups_.push_back(group_);
      } else if (c == '}') {
        EndGroup();
      } else if (c != '\r' && c != '\n') {
        Byte(c);
      }
    }
    FlushBytes();
    return groups_.empty() || document_.text.IsFull();
  }

 private:
  struct Group {
    bool is_hidden = false;
    bool is_font_table = false;
    const char* info = nullptr;  // The field that its text goes to.
    unsigned replacements = 1;   // Bytes that stand behind "\u" for those who do not know it.
    int64_t font = -1;           // -1 for the document's own.
  };

  void ReadControl() {
    if (at_ == rtf_.size()) {
      return;
    }
    const char c = rtf_[at_];
    const auto is_letter = [](char byte) {
      return (byte >= 'a' && byte <= 'z') || (byte >= 'A' && byte <= 'Z');
    };
    if (!is_letter(c)) {
      ++at_;
      ReadSymbol(c);
      return;
    }
    const size_t start = at_;
    while (at_ < rtf_.size() && is_letter(rtf_[at_])) {
      ++at_;
    }
    const std::string_view word = rtf_.substr(start, at_ - start);
    const bool is_negative = at_ < rtf_.size() && rtf_[at_] == '-';
    at_ += is_negative ? 1 : 0;
    int64_t number = 0;
    bool has_number = false;
    for (; at_ < rtf_.size() && rtf_[at_] >= '0' && rtf_[at_] <= '9'; ++at_) {
      number = std::min<int64_t>(number * 10 + (rtf_[at_] - '0'), INT32_MAX);
      has_number = true;
    }
    at_ += at_ < rtf_.size() && rtf_[at_] == ' ' ? 1 : 0;
    Word(word, is_negative ? -number : number, has_number);
  }

  void ReadSymbol(char c) {
    switch (c) {
      case '\'': {
        const int high = Digit();
        const int low = Digit();
        if (high >= 0 && low >= 0) {
          Byte(static_cast<char>(high * 16 + low));
        }
        break;
      }
      case '*':
        group_.is_hidden = true;
        break;
      case '~':
        Put(" ");
        break;
      case '_':
        Put("-");
        break;
      case '\r':
      case '\n':
        Put("\n");
        break;
      case '\\':
      case '{':
      case '}':
        Byte(c);
        break;
      default:
        break;
    }
  }

  int Digit() {
    if (at_ == rtf_.size()) {
      return -1;
    }
    const char c = rtf_[at_++];
    return c >= '0' && c <= '9'   ? c - '0'
           : c >= 'a' && c <= 'f' ? c - 'a' + 10
           : c >= 'A' && c <= 'F' ? c - 'A' + 10
                                  : -1;
  }

  void Word(std::string_view word, int64_t number, bool has_number) {
    if (word == "u" && has_number) {
      Unicode(static_cast<uint32_t>(number) & 0xFFFFU);
    } else if (word == "uc") {
      group_.replacements = static_cast<unsigned>(std::clamp<int64_t>(number, 0, 16));
    } else if (word == "f" || word == "plain") {
      FlushBytes();
      group_.font = word == "f" ? number : -1;
    } else if (word == "deff") {
      font_ = number;
    } else if (group_.is_font_table && (word == "fcharset" || word == "cpg")) {
      SetFontEncoding(word == "cpg" ? PageEncoding(number) : CharsetEncoding(number));
    } else if (word == "ansicpg") {
      const std::string encoding = PageEncoding(number);
      encoding_ = encoding.empty() ? encoding_ : encoding;
    } else if (const Encoding* const encoding = Find(kEncodings, word)) {
      encoding_ = encoding->encoding;
    } else if (word == "bin") {
      at_ += static_cast<size_t>(
          std::clamp<int64_t>(number, 0, static_cast<int64_t>(rtf_.size() - at_)));
    } else if (std::find(std::begin(kHiddenGroups), std::end(kHiddenGroups), word) !=
               std::end(kHiddenGroups)) {
      group_.is_hidden = true;
      group_.is_font_table = word == "fonttbl";
    } else if (word == "shptxt") {  // Text in a box, within the hidden group that describes it.
      group_.is_hidden = false;
      document_.text.EndLine();
    } else if (const InfoGroup* const info = Find(kInfoGroups, word)) {
      group_.info = in_info_ ? info->field : nullptr;
    } else if (const Symbol* const symbol = Find(kSymbols, word)) {
      Put(symbol->text);
    } else if (word == "info") {
      in_info_ = true;
      info_depth_ = groups_.size();
    }
  }

  // The encoding by the number of a code page, or of a font's character set; "" for none.
  static std::string PageEncoding(int64_t number) {
    const std::string encoding = FindEncoding("windows-" + std::to_string(number));
    return encoding.empty() ? FindEncoding("cp" + std::to_string(number)) : encoding;
  }
  static std::string CharsetEncoding(int64_t number) {
    const Charset* const row =
        std::find_if(std::begin(kCharsets), std::end(kCharsets),
                     [number](const Charset& charset) { return charset.number == number; });
    return row == std::end(kCharsets) ? "" : row->encoding;
  }

  // Of the font that is described.
  void SetFontEncoding(const std::string& encoding) {
    if (!encoding.empty() && font_encodings_.size() < kMostFonts) {
      font_encodings_[group_.font] = encoding;
    }
  }

  // Of the bytes at this place. What is told of a document has no font.
  [[nodiscard]] const std::string& CurrentEncoding() const {
    const auto font = font_encodings_.find(group_.font < 0 ? font_ : group_.font);
    return in_info_ || font == font_encodings_.end() ? encoding_ : font->second;
  }

  // A UTF-16 unit, and behind it what others show instead.
  void Unicode(uint32_t unit) {
    skip_ = group_.replacements;
    if (unit >= 0xD800 && unit < 0xDC00) {
      FlushBytes();
      high_ = unit;
      return;
    }
    if (unit >= 0xDC00 && unit < 0xE000) {
      if (high_ == 0) {
        return;
      }
      unit = 0x10000 + ((std::exchange(high_, 0) - 0xD800) << 10U) + (unit - 0xDC00);
    }
    std::string utf8;
    AppendUtf8(utf8, unit);
    Put(utf8);
  }

  // Of the encoding at this place; several may be one character.
  void Byte(char c) {
    if (skip_ > 0) {
      --skip_;
    } else if (!group_.is_hidden) {  // Pictures are in hidden groups, and long.
      bytes_ += c;
    }
  }

  void FlushBytes() {
    if (!bytes_.empty()) {
      const std::string bytes = std::exchange(bytes_, "");
      const std::optional<std::string> utf8 = Convert(bytes, CurrentEncoding());
      Put(utf8 ? *utf8 : bytes);
    }
  }

  void Put(std::string_view utf8) {
    FlushBytes();
    if (group_.is_hidden) {
      return;
    }
    if (group_.info != nullptr) {
      info_ += utf8;
    } else if (!in_info_) {
      document_.text.Append(utf8);
    }
  }

  void EndGroup() {
    FlushBytes();
    skip_ = 0;
    if (groups_.empty()) {
      return;
    }
    if (group_.info != nullptr && groups_.back().info == nullptr) {
      document_.SetText(group_.info, info_);
      info_.clear();
    }
    if (in_info_ && groups_.size() == info_depth_) {
      in_info_ = false;
    }
    group_ = groups_.back();
    groups_.pop_back();
  }

  const std::string_view rtf_;
  Document& document_;
  size_t at_ = 0;
  Group group_;
  std::vector<Group> groups_;  // Those around it.
  std::string encoding_ = "windows-1252";
  int64_t font_ = 0;
  std::map<int64_t, std::string> font_encodings_;
  std::string bytes_;
  std::string info_;
  bool in_info_ = false;
  size_t info_depth_ = 0;
  uint32_t high_ = 0;
  unsigned skip_ = 0;
};

}  // namespace

void ReadRtf(const Source& source, const std::string& /*type*/, Document& document) {
  const std::string rtf = source.Read(kMostBytes);
  const bool is_whole = RtfReader(rtf, document).Read();
  if (source.Size() > kMostBytes) {
    document.text.SetTruncated();
  } else if (!is_whole) {
    throw Fault(reason::kDamaged, "the RTF ends within a group");
  }
}

}  // namespace vexlo::extractd
