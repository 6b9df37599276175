// How a queue line fails that is not JSON. Not installed.
#ifndef FILEINDEX_OPTREE_MALFORMED_LINE_H_
#define FILEINDEX_OPTREE_MALFORMED_LINE_H_

#include <cstddef>
#include <cstdint>
#include <string>
#include <string_view>

namespace vexlo::fileindex {

// So much is shown of a line that is too long.
inline constexpr size_t kShownOfTooLong = 256;

// A line of `length` bytes for a log: whole, or what there is of it and its length.
std::string Excerpt(std::string_view start, uint64_t length);

// Logs, and throws Error 906.
[[noreturn]] void FailMalformed(std::string_view start, uint64_t length);

}  // namespace vexlo::fileindex

#endif  // FILEINDEX_OPTREE_MALFORMED_LINE_H_
