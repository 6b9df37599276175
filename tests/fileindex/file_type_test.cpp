#include "fileindex/util/file_type.h"

#include <gtest/gtest.h>

#include <map>
#include <random>

#include "common/string.h"

namespace vexlo::fileindex {
namespace {

TEST(FileType, Names) {
  struct Row {
    std::string path;
    FileType want;
  };
  for (const Row& row : {
           Row{"/volume1/docs.mp3/a-name-without-a-dot", FILE_TYPE_DOCUMENT},
           Row{"", FILE_TYPE_DOCUMENT},
           Row{"/volume1/video/movie.DVR-MS", FILE_TYPE_VIDEO},
           Row{"/volume1/a/odd.tx?", FILE_TYPE_DOCUMENT},
           Row{"/v/x.emulecollection", FILE_TYPE_DOCUMENT},
           Row{"/v/x.emulecollections", FILE_TYPE_OTHER},
           Row{std::string("/volume1/photo.jpg\0", 19), FILE_TYPE_OTHER},
           Row{"/volume1/photo/.DS_Store", FILE_TYPE_OTHER},
       }) {
    EXPECT_EQ(GetFileTypeByFullPath(row.path), row.want) << row.path;
  }
  EXPECT_EQ(GetFileTypeName(FILE_TYPE_OTHER), "other");
  EXPECT_EQ(GetFileTypeName(GetFileTypeByFullPath("a.MTS")), "video");
}

// Beside a map that is asked with the extension as text.
TEST(FileType, AgreesWithAMap) {
  std::map<std::string, FileType> map;
  for (const FileType type :
       {FILE_TYPE_DOCUMENT, FILE_TYPE_AUDIO, FILE_TYPE_VIDEO, FILE_TYPE_PHOTO}) {
    for (const std::string_view extension : GetFileTypeExtensions(type)) {
      map.emplace(extension, type);
    }
  }
  ASSERT_EQ(map.size(), 738U);
  std::vector<std::string> known;
  known.reserve(map.size());
  for (const auto& [extension, type] : map) {
    known.push_back(extension);
  }
  std::mt19937_64 random(1);
  for (int i = 0; i < 200000; ++i) {
    SCOPED_TRACE(i);
    std::string path;
    for (uint64_t length = random() % 30; length > 0; --length) {
      path += "/.aB\xC3"[random() % 5];
    }
    path += "." + known[random() % known.size()];
    for (uint64_t changes = random() % 3; changes > 0; --changes) {
      char& byte = path[random() % path.size()];
      byte = random() % 2 == 0 ? static_cast<char>(byte ^ 0x20) : static_cast<char>(random());
    }
    const auto found = map.find(vexlo::GetFileExtension(path, /*lower=*/true));
    ASSERT_EQ(GetFileTypeByFullPath(path), found == map.end() ? FILE_TYPE_OTHER : found->second)
        << path;
  }
}

}  // namespace
}  // namespace vexlo::fileindex
