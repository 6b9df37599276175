// Reading and writing JSON, and typed access to its members.
//
// Texts are bytes: a string that is not valid UTF-8 (a file name need not be) is read and written
// back unchanged. No Json::Exception leaves these functions. Any thread may call.
#ifndef COMMON_JSON_H_
#define COMMON_JSON_H_

#include <json/value.h>

#include <string>
#include <string_view>
#include <vector>

#include "common/export.h"

namespace vexlo {

// Parses the whole of `text`; text behind the first value, a trailing comma, a byte-order mark or a
// nesting over 1,000 levels make it malformed. False then, and `value` holds nothing of use.
VEXLO_EXPORT bool JsonFromString(Json::Value& value, std::string_view text);

// What is wrong with a malformed text, and where: "line 3, column 9: Missing ',' or '}' ...", on
// one line. "" for a text that JsonFromString() takes.
VEXLO_EXPORT std::string JsonFault(std::string_view text);

// Parses a whole file; false when it cannot be read or is malformed.
VEXLO_EXPORT bool JsonFromFile(Json::Value& value, const std::string& path);

// One line without its newline: for queue lines and requests.
VEXLO_EXPORT std::string JsonToString(const Json::Value& value);

// Appends `text` as JSON, in quotes, for those who write many lines of a fixed form. It reads the
// same as what JsonToString() gives for a string value, with control characters by their numbers.
VEXLO_EXPORT void AppendJsonText(std::string& out, std::string_view text);

// Indented, with a newline at the end: for reasons, log lines and files.
VEXLO_EXPORT std::string JsonToStyledString(const Json::Value& value);

// Replaces the file with the styled text, whole; false when that fails (see ReplaceFile).
VEXLO_EXPORT bool JsonToFile(const Json::Value& value, const std::string& path);

// Whether a value may be read as T, and the reading. T is std::string, bool, int, unsigned int,
// long or double. All but long convert (null reads as "", false or 0; 3.7 as 3; 5 as "5"); long
// takes nothing but a whole number that fits it.
template <typename T>
bool isJsonType(const Json::Value& value);
template <typename T>
T asJsonType(const Json::Value& value);

// Reads `object[key]` into `out`. A member that is not required may be missing or of another type:
// `out` is left as it is. Throws Error 120 with the whole object in the reason when `object` is no
// object (required or not), or a required member is missing or mistyped. T is one of the six types
// above or Json::Value, which takes any member.
template <typename T>
void GetJsonValue(T& out, const Json::Value& object, const std::string& key, bool required);

// Merges `changes` into `target`: null removes the member, an object is merged into the member
// (which is made, or replaced when it is no object), anything else replaces it. A `target` that is
// null becomes an object. Throws Error 120 when either is something else than an object or null.
VEXLO_EXPORT void JsonApplyChanges(Json::Value& target, const Json::Value& changes);

// ", data=" and the styled text.
VEXLO_EXPORT std::string AppendData(const Json::Value& value);

// An array of the strings in order, [] for none. T is std::string.
template <typename T>
Json::Value Vec2JsonArr(const std::vector<T>& values);

// The elements as strings in order; null gives none. Throws Error 120 for anything that is no array
// or holds an element that does not convert. T is std::string.
template <typename T>
std::vector<T> JsonArr2Vec(const Json::Value& array);

// NOLINTBEGIN(bugprone-macro-parentheses): a type takes none.
// Declares what the library has for one of the types; gone again below.
#define VEXLO_JSON_TYPE(T)                                                              \
  template <>                                                                           \
  VEXLO_EXPORT bool isJsonType<T>(const Json::Value& value);                            \
  template <>                                                                           \
  VEXLO_EXPORT T asJsonType<T>(const Json::Value& value);                               \
  extern template VEXLO_EXPORT void GetJsonValue<T>(T & out, const Json::Value& object, \
                                                    const std::string& key, bool required)
// The types that the templates are there for.
VEXLO_JSON_TYPE(std::string);
VEXLO_JSON_TYPE(bool);
VEXLO_JSON_TYPE(int);
VEXLO_JSON_TYPE(unsigned int);
VEXLO_JSON_TYPE(long);
VEXLO_JSON_TYPE(double);
#undef VEXLO_JSON_TYPE
// NOLINTEND(bugprone-macro-parentheses)
// Besides these, a member as it is.
extern template VEXLO_EXPORT void GetJsonValue<Json::Value>(Json::Value& out,
                                                            const Json::Value& object,
                                                            const std::string& key, bool required);
// The one kind of list.
template <>
VEXLO_EXPORT Json::Value Vec2JsonArr<std::string>(const std::vector<std::string>& values);
template <>
VEXLO_EXPORT std::vector<std::string> JsonArr2Vec<std::string>(const Json::Value& array);

}  // namespace vexlo

#endif  // COMMON_JSON_H_
