// What a document remembers of its file, so that a later look tells whether the file has changed.
// Pure.
#ifndef DAEMONS_FILEINDEXD_STAMP_H_
#define DAEMONS_FILEINDEXD_STAMP_H_

#include <json/value.h>
#include <sys/stat.h>

#include <cstdint>
#include <ctime>
#include <optional>

namespace vexlo::fileindexd {

// The document's field. Its value is an object, which the engine stores and does not search.
inline constexpr char kStampField[] = "FileIndexStamp";

// The file as it was right before it was read. Dates have nanoseconds: `cp -p`, `mv` and `tar x`
// give an old modification date, and the date of the attributes is what gives them away.
struct Stamp {
  int64_t size = 0;
  int64_t mtime_ns = 0;
  int64_t ctime_ns = 0;
  uint64_t inode = 0;
  bool content = false;  // Whether what stands in the file was asked for.
  // The file had changed so shortly before that another change may bear the same dates.
  bool is_young = false;

  bool operator==(const Stamp&) const = default;
};

Stamp StampOf(const struct stat& info, bool content, const timespec& now);

// Null for what is no stamp: a document that somebody else made.
std::optional<Stamp> StampFrom(const Json::Value& value);
Json::Value ToJson(const Stamp& stamp);

// Whether a document with the stamp `indexed` says what a new one of the file would.
bool IsCurrent(const std::optional<Stamp>& indexed, const Stamp& file);

// Whether the file has the content that it was indexed with, whatever became of its name, owner or
// mode.
bool HasSameContent(const Stamp& indexed, const Stamp& file);

}  // namespace vexlo::fileindexd

#endif  // DAEMONS_FILEINDEXD_STAMP_H_
