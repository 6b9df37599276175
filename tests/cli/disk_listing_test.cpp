#include "cli/disk_listing.h"

#include <gtest/gtest.h>

#include <algorithm>
#include <filesystem>
#include <random>

#include "fileindex/paths.h"
#include "support/private_root.h"

namespace vexlo::cli {
namespace {

namespace fs = std::filesystem;

const PrivateRoot kRoot;

// Few names, which stand around "/" in the order of bytes.
const char* const kNames[] = {"a", "a!", "a.b", "a0", "b", "\n", "\xFF", "\xFF!", ".git"};

class DiskListingTest : public testing::Test {
 protected:
  DiskListingTest() {
    fs::remove_all(kRoot / "vol");
    kRoot.MakeFolder("vol/docs/in");
    kRoot.SetShares(R"({"name":"docs","path":")" + (kRoot / "vol/docs") + "\"}");
    kRoot.MakeFolder("var/packages/Vexlo/etc");
    WriteText(fileindex::kFileIndexFoldersCfgPath.Get(),
              R"([{"path":"/docs/in","name":"x","document":true,"audio":true,"video":true,
                   "photo":true}])");
  }

  static std::vector<std::string> List(const std::string& root, size_t portion) {
    const AuditScope scope("docs");
    const auto fail = [](const std::string& path, int) { ADD_FAILURE() << path; };
    DiskListing listing(scope, root, fail, portion);
    std::vector<std::string> paths;
    while (auto file = listing.Next()) {
      paths.push_back(file->path);
    }
    return paths;
  }

  const std::string in_ = kRoot / "vol/docs/in";
};

// The same by collecting everything and sorting it.
std::vector<std::string> ListNaively(const std::string& root) {
  std::vector<std::string> paths = {root};
  for (const auto& entry : fs::recursive_directory_iterator(root)) {
    const std::string path = entry.path();
    if ((path + "/").find("/.git/") == std::string::npos && !entry.is_symlink()) {
      paths.push_back(path);
    }
  }
  std::sort(paths.begin(), paths.end());
  return paths;
}

TEST_F(DiskListingTest, GivesTheOrderOfBytesInPortionsOfAnySize) {
  for (unsigned seed = 1; seed <= 60; ++seed) {
    SCOPED_TRACE(seed);
    std::mt19937 random(seed);
    fs::remove_all(in_);
    std::vector<std::string> folders = {in_};
    fs::create_directory(in_);
    for (int i = 0; i < 40; ++i) {
      const std::string path =
          folders[random() % folders.size()] + "/" + kNames[random() % std::size(kNames)];
      if (fs::exists(fs::symlink_status(path))) {
        continue;
      }
      switch (random() % 5) {
        case 0:
          fs::create_symlink(in_, path);
          break;
        case 1:
        case 2:
          fs::create_directory(path);
          folders.push_back(path);
          break;
        default:
          WriteText(path, "x");
      }
    }
    const std::vector<std::string> want = ListNaively(in_);
    for (const size_t portion : {1, 2, 3, 5, 1000}) {
      EXPECT_EQ(List(kRoot / "vol/docs", portion), want) << portion;
    }
    for (const std::string& folder : folders) {
      const bool is_wanted = std::find(want.begin(), want.end(), folder) != want.end();
      EXPECT_EQ(List(folder, 2), is_wanted ? ListNaively(folder) : std::vector<std::string>())
          << folder;
    }
  }
}

}  // namespace
}  // namespace vexlo::cli
