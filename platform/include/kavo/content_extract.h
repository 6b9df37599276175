// What can be told of a file for a search index: its metadata and its text.
#ifndef KAVO_CONTENT_EXTRACT_H_
#define KAVO_CONTENT_EXTRACT_H_

#include <json/value.h>

#include <string>

// NOLINTNEXTLINE(readability-identifier-naming): these are the platform's names.
namespace KAVO::CONTENT_EXTRACT {

// Fills `metadata` with the fields of the file or folder at the full path. A symbolic link is
// itself the file. `options` is an object; a true "need_meta" asks for what stands in the content,
// too. Throws when the file cannot be read or parsed, an object of any type. Safe to call from
// several threads. The local platform throws only when there is no such file; a content that cannot
// be had is told by a field (kavo/local/content.h), and waited for: usually milliseconds, at worst
// 30 seconds, or what the daemon kavocontentextractd was allowed to take.
void ParseFile(const std::string& path, const Json::Value& options, Json::Value& metadata);

}  // namespace KAVO::CONTENT_EXTRACT

#endif  // KAVO_CONTENT_EXTRACT_H_
