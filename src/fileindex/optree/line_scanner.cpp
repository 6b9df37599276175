#include "fileindex/optree/line_scanner.h"

#include <bit>
#include <cstring>
#include <limits>

namespace vexlo::fileindex {
namespace {

constexpr uint64_t kOnes = 0x0101010101010101;
constexpr uint64_t kHighBits = 0x8080808080808080;

// Non-zero when some byte of the word is below `limit` (at most 0x80), or equals `byte`. The lowest
// bit that is set stands in the first such byte of the word's value; higher ones may be wrong.
constexpr uint64_t AnyBelow(uint64_t word, uint64_t limit) {
  return (word - kOnes * limit) & ~word & kHighBits;
}
constexpr uint64_t AnyEqual(uint64_t word, uint64_t byte) {
  return AnyBelow(word ^ kOnes * byte, 1);
}

bool EndsPlainText(char c) { return c == '"' || c == '\\' || static_cast<unsigned char>(c) < 0x20; }

class Scanner {
 public:
  explicit Scanner(std::string_view line) : at_(line.data()), end_(line.data() + line.size()) {}

  bool AtEnd() const { return at_ == end_; }

  bool Take(char c) {
    if (at_ == end_ || *at_ != c) {
      return false;
    }
    ++at_;
    return true;
  }

  // A literal: its length is known to the compiler, which compares it in a few words.
  template <size_t kBytes>
  bool Take(const char (&text)[kBytes]) {
    constexpr size_t kLength = kBytes - 1;
    if (static_cast<size_t>(end_ - at_) < kLength || memcmp(at_, text, kLength) != 0) {
      return false;
    }
    at_ += kLength;
    return true;
  }

  void SkipBlanks() {
    while (at_ != end_ && *at_ == ' ') {
      ++at_;
    }
  }

  // A quoted text without escapes and control characters.
  bool TakeText(std::string_view& text) {
    if (!Take('"')) {
      return false;
    }
    const char* const begin = at_;
    while (end_ - at_ >= 8) {
      uint64_t word = 0;
      memcpy(&word, at_, sizeof(word));
      const uint64_t ends = AnyEqual(word, '"') | AnyEqual(word, '\\') | AnyBelow(word, 0x20);
      if (ends != 0) {
        if constexpr (std::endian::native == std::endian::little) {
          at_ += std::countr_zero(ends) / 8;
        }
        break;
      }
      at_ += sizeof(word);
    }
    while (at_ != end_ && !EndsPlainText(*at_)) {
      ++at_;
    }
    text = std::string_view(begin, static_cast<size_t>(at_ - begin));
    return Take('"');
  }

  // A number of digits alone, without leading zeros, that fits 32 bits.
  bool TakeNumber(uint32_t& number) {
    const char* const begin = at_;
    uint64_t value = 0;
    while (at_ != end_ && *at_ >= '0' && *at_ <= '9' && at_ - begin < 11) {
      value = value * 10 + static_cast<uint64_t>(*at_++ - '0');
    }
    number = static_cast<uint32_t>(value);
    return at_ != begin && value <= std::numeric_limits<uint32_t>::max() &&
           (*begin != '0' || at_ - begin == 1);
  }

  bool TakeBool(bool& value) {
    value = Take("true");
    return value || Take("false");
  }

 private:
  const char* at_;
  const char* end_;
};

enum Member : unsigned { kEvent = 1, kIsDir = 2, kPath = 4, kPathOld = 8, kData = 16, kNone = 0 };

Member MemberOf(std::string_view key) {
  switch (key.size()) {
    case 4:
      return key == "path" ? kPath : key == "data" ? kData : kNone;
    case 5:
      return key == "event" ? kEvent : kNone;
    case 6:
      return key == "is_dir" ? kIsDir : kNone;
    case 8:
      return key == "path_old" ? kPathOld : kNone;
    default:
      return kNone;
  }
}

bool TakeValue(Scanner& scanner, Member member, EventView& event) {
  switch (member) {
    case kEvent:
      return scanner.TakeNumber(event.event);
    case kIsDir:
      return scanner.TakeBool(event.is_dir);
    case kPath:
      return scanner.TakeText(event.path);
    case kPathOld:
      return scanner.TakeText(event.path_old);
    case kData:
      return scanner.Take("null");
    case kNone:
      return false;
  }
  return false;
}

// A line as the notify daemon writes it, member by member without a look at what else could stand
// there. `event` holds anything after false.
bool ScanUsualLine(std::string_view line, EventView& event) {
  Scanner scanner(line);
  return scanner.Take(R"({"event":)") && scanner.TakeNumber(event.event) &&
         scanner.Take(R"(,"is_dir":)") && scanner.TakeBool(event.is_dir) &&
         scanner.Take(R"(,"path":)") && scanner.TakeText(event.path) &&
         scanner.Take(R"(,"path_old":)") && scanner.TakeText(event.path_old) &&
         scanner.Take(R"(,"data":null})") && scanner.AtEnd();
}

}  // namespace

bool ScanLine(std::string_view line, EventView& event) {
  event = EventView();
  if (ScanUsualLine(line, event)) {
    return true;
  }
  event = EventView();
  Scanner scanner(line);
  if (!scanner.Take('{')) {
    return false;
  }
  unsigned seen = 0;
  do {
    scanner.SkipBlanks();
    std::string_view key;
    if (!scanner.TakeText(key) || !scanner.Take(':')) {
      return false;
    }
    scanner.SkipBlanks();
    const Member member = MemberOf(key);
    if ((seen & member) != 0 || !TakeValue(scanner, member, event)) {
      return false;
    }
    seen |= member;
  } while (scanner.Take(','));
  return scanner.Take('}') && scanner.AtEnd() && (seen & (kEvent | kPath)) == (kEvent | kPath);
}

}  // namespace vexlo::fileindex
