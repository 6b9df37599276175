#include "daemons/kavocontentextractd/document.h"

#include <unicode/utf8.h>

#include <algorithm>
#include <chrono>
#include <cmath>
#include <utility>

#include "fileindex/elastic_control/schema.h"
#include "kavo/local/content.h"

namespace vexlo::extractd {
namespace {

namespace field = fileindex::elastic::field;

constexpr size_t kMaxFieldBytes = size_t{64} << 10;
// Of a list.
constexpr size_t kMaxElementBytes = 1024;
constexpr Json::ArrayIndex kMaxElements = 256;
// The two that the library's list of fields does not have.
constexpr char kLatitude[] = "KAVOMDLatitude";
constexpr char kLongitude[] = "KAVOMDLongitude";
constexpr std::string_view kReplacement = "\xEF\xBF\xBD";

bool IsSpace(char c) { return c == ' ' || (c >= '\t' && c <= '\r'); }

bool IsWhite(std::string_view text) { return std::all_of(text.begin(), text.end(), IsSpace); }

// Appends one character to `out`, and takes it off `bytes`.
void TakeCharacter(std::string_view& bytes, std::string& out) {
  const auto* const start = reinterpret_cast<const uint8_t*>(bytes.data());
  const auto length = static_cast<int32_t>(std::min<size_t>(bytes.size(), U8_MAX_LENGTH));
  int32_t used = 0;
  UChar32 character = 0;
  U8_NEXT(start, used, length, character);
  if (character < 0) {
    out += kReplacement;
  } else if (character < 0x20 ? !IsSpace(static_cast<char>(character))
                              : character >= 0x7F && character < 0xA0) {
    out += ' ';
  } else {
    out += bytes.substr(0, static_cast<size_t>(used));
  }
  bytes.remove_prefix(static_cast<size_t>(used));
}

// The text without what is no character, at most `most` bytes of it, without white space around it.
std::string Cleaned(std::string_view bytes, size_t most) {
  while (!bytes.empty() && (IsSpace(bytes.front()) || bytes.front() == '\0')) {
    bytes.remove_prefix(1);
  }
  while (!bytes.empty() && (IsSpace(bytes.back()) || bytes.back() == '\0')) {
    bytes.remove_suffix(1);
  }
  std::string cleaned;
  std::string character;
  while (!bytes.empty()) {
    character.clear();
    TakeCharacter(bytes, character);
    if (cleaned.size() + character.size() > most) {
      break;
    }
    cleaned += character;
  }
  return cleaned;
}

// The number at the beginning of the text, of just `digits` digits, taken off it; -1 without one.
int TakeDigits(std::string_view& text, size_t digits) {
  int number = 0;
  for (size_t i = 0; i < digits; ++i) {
    if (i >= text.size() || text[i] < '0' || text[i] > '9') {
      return -1;
    }
    number = number * 10 + (text[i] - '0');
  }
  text.remove_prefix(digits);
  return number;
}

bool TakeOneOf(std::string_view& text, std::string_view characters) {
  if (text.empty() || characters.find(text.front()) == std::string_view::npos) {
    return false;
  }
  text.remove_prefix(1);
  return true;
}

// "12:30:00.5" with the zone behind it, in seconds; false when it is none.
bool ParseTime(std::string_view text, int64_t& seconds) {
  const int hour = TakeDigits(text, 2);
  const int minute = TakeOneOf(text, ":") ? TakeDigits(text, 2) : -1;
  if (hour < 0 || hour > 23 || minute < 0 || minute > 59) {
    return false;
  }
  const int second = TakeOneOf(text, ":") ? TakeDigits(text, 2) : 0;
  if (second < 0 || second > 60) {
    return false;
  }
  if (TakeOneOf(text, ".,")) {
    while (TakeOneOf(text, "0123456789")) {
    }
  }
  int64_t zone = 0;
  if (const bool is_east = text.starts_with('+'); TakeOneOf(text, "+-")) {
    const int hours = TakeDigits(text, 2);
    TakeOneOf(text, ":");
    const int minutes = text.empty() ? 0 : TakeDigits(text, 2);
    if (hours < 0 || minutes < 0) {
      return false;
    }
    zone = int64_t{is_east ? 60 : -60} * (hours * 60 + minutes);
  } else {
    TakeOneOf(text, "Z");
  }
  seconds = int64_t{60} * (hour * 60 + minute) + second - zone;
  return text.empty();
}

}  // namespace

void Text::Append(std::string_view bytes) {
  while (!bytes.empty() && !is_truncated_) {
    // Mostly it is this.
    const auto is_plain = [](char c) { return c >= ' ' && c < 0x7F; };
    const auto* const end = std::find_if_not(bytes.begin(), bytes.end(), is_plain);
    const size_t plain = static_cast<size_t>(end - bytes.begin());
    const size_t room = kavo::local::kMaxTextBytes - text_.size();
    text_ += bytes.substr(0, std::min(plain, room));
    is_truncated_ = plain > room;
    bytes.remove_prefix(plain);
    if (!bytes.empty() && !is_truncated_) {
      const size_t before = text_.size();
      TakeCharacter(bytes, text_);
      if (text_.size() > kavo::local::kMaxTextBytes) {
        text_.resize(before);
        is_truncated_ = true;
      }
    }
  }
}

void Text::EndLine() {
  if (!text_.empty() && text_.back() != '\n') {
    Append("\n");
  }
}

void Text::EndWord() {
  if (!text_.empty() && !IsSpace(text_.back())) {
    Append(" ");
  }
}

void Document::SetText(const char* field, std::string_view value) {
  const std::string cleaned = Cleaned(value, kMaxFieldBytes);
  if (!cleaned.empty()) {
    fields_[field] = cleaned;
  }
}

void Document::SetFirstText(const char* field, std::string_view value) {
  if (!fields_.isMember(field)) {
    SetText(field, value);
  }
}

void Document::SetNumber(const char* field, int64_t value) {
  if (value > 0) {
    fields_[field] = static_cast<Json::Int64>(value);
  }
}

void Document::SetReal(const char* field, double value) {
  if (std::isfinite(value) && value > 0) {
    fields_[field] = value;
  }
}

void Document::SetDate(const char* field, std::string_view iso_8601) {
  int64_t seconds = 0;
  if (ParseDate(iso_8601, seconds)) {
    fields_[field] = static_cast<Json::Int64>(seconds);
  }
}

void Document::SetPlace(double latitude, double longitude) {
  fields_[kLatitude] = latitude;
  fields_[kLongitude] = longitude;
}

void Document::AddText(const char* field, std::string_view value) {
  const std::string cleaned = Cleaned(value, kMaxElementBytes);
  if (cleaned.empty()) {
    return;
  }
  Json::Value& list = fields_[field];
  if (!list.isArray()) {
    list = Json::Value(Json::arrayValue);
  }
  if (list.size() < kMaxElements &&
      std::find(list.begin(), list.end(), Json::Value(cleaned)) == list.end()) {
    list.append(cleaned);
  }
}

Json::Value Document::Take(const std::string& fault) {
  if (!IsWhite(text.Get())) {
    fields_[field::KAVOMDTextContent] = text.Get();
  }
  if (text.IsFull()) {
    fields_[kavo::local::kTextTruncatedField] = true;
  }
  if (!fault.empty()) {
    fields_[kavo::local::kContentErrorField] = fault;
  }
  return std::exchange(fields_, Json::Value(Json::objectValue));
}

bool ParseDate(std::string_view text, int64_t& seconds) {
  const int year = TakeDigits(text, 4);
  const int month = TakeOneOf(text, "-:") ? TakeDigits(text, 2) : -1;
  const int day = TakeOneOf(text, "-:") ? TakeDigits(text, 2) : -1;
  const auto date = std::chrono::year(year) / month / day;
  if (year < 1 || month < 1 || day < 1 || !date.ok()) {
    return false;
  }
  int64_t time = 0;
  if (!text.empty() && (!TakeOneOf(text, "T ") || !ParseTime(text, time))) {
    return false;
  }
  seconds = std::chrono::sys_days(date).time_since_epoch() / std::chrono::seconds(1) + time;
  return true;
}

}  // namespace vexlo::extractd
