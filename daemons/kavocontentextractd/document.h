// What a format's reader makes of a file.
#ifndef DAEMONS_KAVOCONTENTEXTRACTD_DOCUMENT_H_
#define DAEMONS_KAVOCONTENTEXTRACTD_DOCUMENT_H_

#include <json/value.h>

#include <cstddef>
#include <cstdint>
#include <string>
#include <string_view>

namespace vexlo::extractd {

// The text of a file, as UTF-8 without control characters but tabs and line ends. What is over
// kMaxTextBytes is cut off at a character.
class Text {
 public:
  // Takes any bytes; what is no UTF-8 becomes U+FFFD. The parts of a character must come together.
  void Append(std::string_view bytes);

  // A line end, unless one is there already.
  void EndLine();
  // A space, unless white space is there already.
  void EndWord();

  // What else is appended is lost, so reading on is of no use.
  bool IsFull() const { return is_truncated_; }
  void SetTruncated() { is_truncated_ = true; }

  const std::string& Get() const { return text_; }

 private:
  std::string text_;
  bool is_truncated_ = false;
};

class Document {
 public:
  Text text;

  // Each leaves the field alone when the value tells nothing: an empty text, a number that is not
  // positive, a date that cannot be read. Texts lose control characters and white space around
  // them, and end at 64 KiB.
  void SetText(const char* field, std::string_view value);
  void SetFirstText(const char* field, std::string_view value);  // Unless the field is there.
  void SetNumber(const char* field, int64_t value);
  void SetReal(const char* field, double value);
  void SetDate(const char* field, std::string_view iso_8601);
  // Degrees, north and east being positive.
  void SetPlace(double latitude, double longitude);
  // Adds to a list of different texts: the first 256, and of each 1 KiB.
  void AddText(const char* field, std::string_view value);

  // The fields with the text among them. `fault`, "REASON: what happened", says that something is
  // missing; "" when nothing is.
  Json::Value Take(const std::string& fault);
  bool IsEmpty() const { return fields_.empty() && text.Get().empty(); }

 private:
  Json::Value fields_{Json::objectValue};
};

// Seconds since the epoch of "2024-05-31", "2024-05-31T12:30:00", with "Z", "+02:00" or a fraction
// behind it, also with ":" between the parts of the date and a space before the time. A time
// without a zone counts as UTC. False for anything else.
bool ParseDate(std::string_view text, int64_t& seconds);

}  // namespace vexlo::extractd

#endif  // DAEMONS_KAVOCONTENTEXTRACTD_DOCUMENT_H_
