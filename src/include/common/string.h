// Helpers on path and file-name texts. All of them work on bytes and know nothing of the file
// system or of an encoding. None fails, and any thread may call.
#ifndef COMMON_STRING_H_
#define COMMON_STRING_H_

#include <string>
#include <string_view>

#include "common/export.h"

namespace vexlo {

// True when `str` begins with `prefix`; an empty prefix always matches. To ask whether a path lies
// inside a folder, see IsSameOrBelow().
VEXLO_EXPORT bool StringStartWith(const std::string& str, const std::string& prefix);

// True when `path` is `folder` or lies below it: with "/" behind both, `folder` is a prefix.
VEXLO_EXPORT bool IsSameOrBelow(std::string_view path, std::string_view folder);

// What follows the last "/"; the whole path when it holds none. "/a/b/" gives "".
VEXLO_EXPORT std::string Basename(const std::string& path);

// What precedes the last "/"; the whole path when it holds none ("abc" gives "abc", not ".").
VEXLO_EXPORT std::string Dirname(const std::string& path);

// What follows the last "." of the base name, "" without one; ".profile" has the extension
// "profile". `lower` lower-cases ASCII letters and leaves every other byte alone.
VEXLO_EXPORT std::string GetFileExtension(const std::string& path, bool lower);

// Copies without leading and/or trailing white space (isspace of the C locale).
VEXLO_EXPORT std::string Trim(const std::string& text);
VEXLO_EXPORT std::string LTrim(const std::string& text);
VEXLO_EXPORT std::string RTrim(const std::string& text);

// A copy with ASCII letters lower-cased. Bytes from 0x80 on stay whatever the locale, so that a
// name in any encoding keeps its bytes.
VEXLO_EXPORT std::string ToLower(const std::string& text);

namespace fileindex {

// The four that callers of this namespace know by these names; they call the ones above.
VEXLO_EXPORT bool StringStartWith(const std::string& str, const std::string& prefix);
VEXLO_EXPORT std::string Basename(const std::string& path);
VEXLO_EXPORT std::string Dirname(const std::string& path);
VEXLO_EXPORT std::string GetFileExtension(const std::string& path, bool lower);

}  // namespace fileindex
}  // namespace vexlo

#endif  // COMMON_STRING_H_
