// The walk over a disk, and its comparison with what an index lists.
#include "daemons/fileindexd/crawl.h"

#include <gtest/gtest.h>
#include <sys/stat.h>

#include <algorithm>
#include <filesystem>
#include <map>
#include <random>
#include <set>

#include "fileindex/util/file_type.h"
#include "support/faults.h"
#include "support/temp_folder.h"

FAULTABLE(ssize_t, getdents64, (int fd, void* buffer, size_t size), (fd, buffer, size))
FAULTABLE(int, fstatat, (int fd, const char* path, struct stat* info, int flags),
          (fd, path, info, flags))

namespace vexlo::fileindexd {
namespace {

namespace fs = std::filesystem;

WalkRules Everything() {
  const auto yes = [](const std::string&) { return true; };
  return {yes, yes, yes};
}

std::vector<std::string> PathsOf(DiskWalk& walk) {
  std::vector<std::string> paths;
  while (const auto entry = walk.Next()) {
    paths.push_back(entry->path);
  }
  return paths;
}

// What is at and below a folder, by the library and in the order of bytes.
std::vector<std::string> Listed(const std::string& root) {
  std::vector<std::string> paths = {root};
  for (const auto& entry : fs::recursive_directory_iterator(root)) {
    if (!entry.is_symlink()) {
      paths.push_back(entry.path());
    }
  }
  std::sort(paths.begin(), paths.end());
  return paths;
}

// Names that sort before and behind "/", and are each other's beginnings.
void MakeRandomTree(const std::string& root, std::mt19937& random) {
  const std::string names[] = {"a",  "a!",    "a.txt", "a0", "b",
                               "b-", "b\xE9", "\xFF",  " ",  "#recycle"};
  std::vector<std::string> folders = {root};
  for (int i = 0; i < 40; ++i) {
    const std::string path = folders[random() % folders.size()] + "/" + names[random() % 10];
    if (fs::exists(path)) {
      continue;
    }
    if (random() % 2 == 0) {
      fs::create_directory(path);
      folders.push_back(path);
    } else {
      WriteText(path, "");
    }
  }
}

TEST(DiskWalk, GivesWhatIsThereInOrderFromAnywhereInAnyPortion) {
  for (unsigned seed = 0; seed < 60; ++seed) {
    SCOPED_TRACE(seed);
    std::mt19937 random(seed);
    const TempFolder folder;
    MakeRandomTree(folder.Path(), random);
    const std::vector<std::string> all = Listed(folder.Path());
    const size_t portion = 1 + random() % 4;
    DiskWalk walk(folder.Path(), "", Everything(), portion);
    EXPECT_EQ(PathsOf(walk), all);
    for (size_t i = 0; i < all.size(); ++i) {
      DiskWalk rest(folder.Path(), all[i], Everything(), portion);
      EXPECT_EQ(PathsOf(rest), std::vector(all.begin() + static_cast<ptrdiff_t>(i) + 1, all.end()))
          << all[i];
    }
  }
}

TEST(DiskWalk, LeavesOutWhatTheRulesRefuse) {
  const TempFolder folder;
  for (const char* const path :
       {"in/deep/x", "in/@eaDir/x", "in/refused/x", "out/x", "way/in/x", "elsewhere"}) {
    fs::create_directories(folder / path);
  }
  for (const char* const file : {"in/Thumbs.db", "in/#recycle", "in/a#snapshot"}) {
    WriteText(folder / file, "");
  }
  fs::create_directory_symlink(folder / "elsewhere", folder / "in/link");
  const WalkRules rules = {
      [&](const std::string& path) {
        return path.starts_with(folder / "in") || path.starts_with(folder / "way/in");
      },
      [&](const std::string& path) { return path == folder.Path() || path == folder / "way"; },
      [&](const std::string& path) {
        return path != folder / "in/refused" && path != folder / "in/#recycle";
      }};
  DiskWalk walk(folder.Path(), "", rules);
  EXPECT_EQ(PathsOf(walk), (std::vector<std::string>{folder / "in", folder / "in/a#snapshot",
                                                     folder / "in/deep", folder / "in/deep/x",
                                                     folder / "way/in", folder / "way/in/x"}));
}

TEST(DiskWalk, WhatIsNoFolderOrMissingIsNoFailure) {
  const TempFolder folder;
  WriteText(folder / "file", "");
  const std::pair<std::string, std::vector<std::string>> cases[] = {
      {folder / "file", {folder / "file"}}, {folder / "none", {}}, {folder / "file/below", {}}};
  for (const auto& [root, want] : cases) {
    DiskWalk walk(root, "", Everything());
    EXPECT_EQ(PathsOf(walk), want) << root;
    EXPECT_FALSE(walk.IsUnknown(root)) << root;
  }
}

// What the two give of one tree must add up to the same, or a comparison of the two never ends.
TEST(DiskScan, AddsUpWhatTheWalkGives) {
  const ContentByType by_type = {true, false, true, false, true};
  for (unsigned seed = 0; seed < 60; ++seed) {
    SCOPED_TRACE(seed);
    std::mt19937 random(seed);
    const TempFolder folder;
    MakeRandomTree(folder.Path(), random);
    for (int i = 0; i < 3000 && seed == 0; ++i) {  // More than are looked at at once.
      WriteText(folder / ("many" + std::to_string(i)), "");
    }
    fs::create_symlink("a", folder / "link");
    fs::create_directory(folder / ".git");
    const std::set<std::string> refused = {folder / "a", folder / "#recycle"};
    const auto covers = [&](const std::string& path) { return path != folder / "b"; };
    const WalkRules rules = {covers, [](const std::string&) { return true; },
                             [&](const std::string& path) { return !refused.contains(path); }};
    const auto wants = [&](const std::string& path) {
      return by_type.at(static_cast<size_t>(fileindex::GetFileTypeByFullPath(path)));
    };
    std::map<std::string, daemon::FolderDigest> want;
    DiskWalk walk(folder.Path(), "", rules);
    while (const auto entry = walk.Next()) {
      const std::string key = entry->path.substr(0, entry->path.rfind('/') + 1);
      if (entry->path != folder.Path()) {
        want[key].Add(daemon::EntryHash(
            seed, entry->path.substr(key.size()),
            {entry->info.st_size,
             entry->info.st_mtim.tv_sec * 1'000'000'000 + entry->info.st_mtim.tv_nsec,
             entry->info.st_ctim.tv_sec * 1'000'000'000 + entry->info.st_ctim.tv_nsec,
             wants(entry->path)}));
      }
    }
    const auto in = [&](const std::string&) { return std::optional(by_type); };
    DiskScan scan(folder.Path(), rules, {wants, in}, seed, [] {});
    std::map<std::string, daemon::FolderDigest> got;
    std::string last;
    while (const auto each = scan.Next()) {
      EXPECT_GT(each->path, last);
      last = each->path;
      EXPECT_EQ(each->error, 0);
      // Of a folder that is not covered itself nobody knows what is.
      EXPECT_EQ(each->is_whole, covers(each->path.substr(0, each->path.size() - 1))) << each->path;
      if (each->digest.count > 0 && each->is_whole) {
        got[each->path] = each->digest;
      }
    }
    std::erase_if(want, [&](const auto& each) { return each.first == folder / "b/"; });
    EXPECT_EQ(got, want);
  }
}

TEST(DiskScan, TellsWhatCouldNotBeLookedAt) {
  const TempFolder folder;
  fs::create_directory(folder / "a");
  fs::create_directory(folder / "b");
  const struct {
    const char* function;
    int nth;
    std::string want;  // Each folder, with "?" for one that is unknown and "-" for a part.
  } cases[] = {
      {"getdents64", 1, "/?"}, {"getdents64", 3, "/ /a/? /b/"}, {"fstatat", 1, "/- /a/ /b/"}};
  for (const auto& c : cases) {
    const ScopedFault fault(c.function, EIO, c.nth);
    const auto wants = [](const std::string&) { return true; };
    const auto in = [](const std::string&) { return std::optional(ContentByType{}); };
    DiskScan scan(folder.Path(), Everything(), {wants, in}, 0, [] {});
    std::string got;
    while (const auto each = scan.Next()) {
      got += (got.empty() ? "" : " ") + each->path.substr(folder.Path().size()) +
             (each->error == EIO ? "?"
              : each->is_whole   ? ""
                                 : "-");
    }
    EXPECT_EQ(got, c.want) << c.function << c.nth;
  }
}

TEST(Crawl, MergesAsTwoSetsDo) {
  for (unsigned seed = 0; seed < 300; ++seed) {
    std::mt19937 random(seed);
    std::set<std::string> disk;
    std::set<std::string> index;
    for (std::set<std::string>* const set : {&disk, &index}) {
      for (unsigned i = random() % 30; i > 0; --i) {
        set->insert("/" + std::to_string(random() % 40));
      }
    }
    std::set<std::string> both = disk;
    both.insert(index.begin(), index.end());
    std::vector<std::string> want;
    want.reserve(both.size());
    for (const std::string& path : both) {
      want.push_back(path + (!disk.contains(path)   ? " gone"
                             : index.contains(path) ? " " + path
                                                    : " new"));
    }
    std::vector<std::string> got;
    auto on_disk = disk.begin();
    auto indexed = index.begin();
    MergeByPath(
        [&] {
          return on_disk == disk.end() ? std::nullopt : std::optional(DiskEntry{*on_disk++, {}});
        },
        [&] {
          return indexed == index.end() ? std::nullopt : std::optional(IndexedPath{*indexed++, {}});
        },
        [&](const DiskEntry& entry, const IndexedPath* same) {
          got.push_back(entry.path + " " + (same == nullptr ? "new" : same->path));
        },
        [&](const IndexedPath& gone) { got.push_back(gone.path + " gone"); });
    EXPECT_EQ(got, want) << seed;
  }
}

TEST(Crawl, NothingIsTakenForGoneThatCouldNotBeLookedAt) {
  const TempFolder folder;
  for (const char* const name : {"a", "b", "c"}) {
    fs::create_directory(folder / name);
    WriteText(folder / (std::string(name) + "/x"), "");
  }
  const std::vector<std::string> all = Listed(folder.Path());
  const struct {
    const char* function;
    int nth;
    std::set<std::string> unknown;
  } cases[] = {
      {"getdents64", 1, {"/a", "/a/x", "/b", "/b/x", "/c", "/c/x"}},
      {"getdents64", 3, {"/a/x"}},
      {"fstatat", 2, {"/a"}},
  };
  for (const auto& c : cases) {
    std::set<std::string> unknown;
    std::set<std::string> gone;
    DiskWalk walk(folder.Path(), "", Everything());
    const ScopedFault fault(c.function, EIO, c.nth);
    auto it = all.begin();
    MergeByPath([&] { return walk.Next(); },
                [&] {
                  return it == all.end() ? std::nullopt : std::optional(IndexedPath{*it++, {}});
                },
                [](const DiskEntry&, const IndexedPath*) {},
                [&](const IndexedPath& indexed) {
                  (walk.IsUnknown(indexed.path) ? unknown : gone)
                      .insert(indexed.path.substr(folder.Path().size()));
                });
    EXPECT_EQ(unknown, c.unknown) << c.function << c.nth;
    EXPECT_EQ(gone, std::set<std::string>()) << c.function << c.nth;
    EXPECT_EQ(walk.LastError(), EIO);
  }
}

TEST(Crawl, WhatGoesWithAFolderIsNotedOnce) {
  GoneList list(3);
  EXPECT_TRUE(list.Add("/v/a", true));
  EXPECT_TRUE(list.Add("/v/b", false));
  for (const auto& [path, want] : std::map<std::string, bool>{
           {"/v/a", false}, {"/v/a/x/y", true}, {"/v/a.txt", false}, {"/v/b/x", false}}) {
    EXPECT_EQ(list.Contains(path), want) << path;
  }
  EXPECT_TRUE(list.Add("/v/c", false));
  EXPECT_FALSE(list.Add("/v/d", false));
  EXPECT_EQ(list.Take().size(), 3U);
  EXPECT_FALSE(list.Contains("/v/a/x"));
}

}  // namespace
}  // namespace vexlo::fileindexd
