// Plain text in any encoding.
#ifndef DAEMONS_KAVOCONTENTEXTRACTD_PLAIN_TEXT_H_
#define DAEMONS_KAVOCONTENTEXTRACTD_PLAIN_TEXT_H_

#include <optional>
#include <string>
#include <string_view>

namespace vexlo::extractd {

// The text as UTF-8, without a byte-order mark. `bytes` are a file, or the beginning of one that
// has more. The encoding is that of the byte-order mark, or UTF-8 where that fits, or else what the
// letters look like most. Nothing for what is no text: a NUL within 64 KiB, or control characters
// that no text has. A NUL behind that ends the text.
std::optional<std::string> DecodeText(std::string_view bytes, bool has_more);

// The same bytes in UTF-8; nothing for an encoding that is not known. What is none of its
// characters becomes U+FFFD.
std::optional<std::string> Convert(std::string_view bytes, const std::string& encoding);

// Appends the character; U+FFFD for what is none.
void AppendUtf8(std::string& out, char32_t character);

// What Convert() reads that goes by a name which pages use; "" when nothing does. It may be a
// larger encoding than the name says, as what is called Latin-1 mostly is windows-1252.
std::string FindEncoding(const std::string& name);

// The encoding that the letters look like most, windows-1252 when they do not tell.
std::string GuessEncoding(std::string_view bytes);

// Whether all of it is UTF-8; when more would follow, the last character may be cut off.
bool IsUtf8(std::string_view bytes, bool has_more);

// Whether it is ASCII by its bytes, and shifts to other characters as ISO-2022-JP does.
bool HasShifts(std::string_view bytes);

// Whether there are control characters that no text has; white space, backspace and escape
// sequences are not among them.
bool HasBinaryControls(std::string_view bytes);

}  // namespace vexlo::extractd

#endif  // DAEMONS_KAVOCONTENTEXTRACTD_PLAIN_TEXT_H_
