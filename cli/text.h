// Texts for people.
#ifndef CLI_TEXT_H_
#define CLI_TEXT_H_

#include <cstdint>
#include <string>
#include <string_view>
#include <vector>

#include "common/error.h"

namespace vexlo::cli {

std::vector<std::string> Split(std::string_view text, char separator);

// 1234567 as "1,234,567".
std::string Grouped(uint64_t number);

// "1 line", "2,000 lines".
std::string Counted(uint64_t number, std::string_view noun);

// Control characters and those that turn the direction of writing byte by byte as "\012", so that a
// file name can neither drive the terminal nor look like another; the rest as it is.
std::string ForTerminal(std::string_view text);

// A word as a shell takes it: as it is, or in single quotes where that is wanted.
std::string ForShell(const std::string& word);

// What a library reason says of the system's error: the text behind its last "reason=", or all.
std::string CauseOf(std::string_view reason);

// An error of the library for people: its reason and number. The one that comes without a reason,
// for want of root's rights, gets one.
std::string TextOf(const Error& error);

// The argument as an absolute path without ".", ".." and doubled or trailing slashes. Works on the
// text alone: nothing needs to exist.
std::string AbsolutePath(const std::string& path);

// Rows of cells as lines, the columns two spaces apart; the last cell of a row is not padded. Bytes
// are counted but for those that continue a UTF-8 character.
std::string Table(const std::vector<std::vector<std::string>>& rows);

}  // namespace vexlo::cli

#endif  // CLI_TEXT_H_
