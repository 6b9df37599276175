// The group of a file, by the extension of its name. None of these fails, and any thread may call.
#ifndef FILEINDEX_UTIL_FILE_TYPE_H_
#define FILEINDEX_UTIL_FILE_TYPE_H_

#include <cstdint>
#include <span>
#include <string>
#include <string_view>

#include "common/export.h"

namespace vexlo::fileindex {

// Callers test "above FILE_TYPE_PHOTO" for other: never renumber.
enum FileType : int32_t {
  FILE_TYPE_DOCUMENT = 0,
  FILE_TYPE_AUDIO = 1,
  FILE_TYPE_VIDEO = 2,
  FILE_TYPE_PHOTO = 3,
  FILE_TYPE_OTHER = 4,
};

// The group of a file's extension, ASCII letters in either case. A name without a dot and one that
// ends in a dot are documents; what is in no group is FILE_TYPE_OTHER. Looks at the text of the
// path alone and allocates nothing.
VEXLO_EXPORT FileType GetFileTypeByFullPath(const std::string& full_path);

// The extensions of a group, in lower case and without the dot; "" among those of documents. None
// for FILE_TYPE_OTHER.
VEXLO_EXPORT std::span<const std::string_view> GetFileTypeExtensions(FileType type);

// "document", "audio", "video", "photo" or "other".
VEXLO_EXPORT std::string_view GetFileTypeName(FileType type);

}  // namespace vexlo::fileindex

#endif  // FILEINDEX_UTIL_FILE_TYPE_H_
