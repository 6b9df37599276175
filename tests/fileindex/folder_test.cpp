// The folders file, its records, and which of them a path goes by.
#include "fileindex/folder_mgr.h"

#include <random>

#include "common/json.h"
#include "fileindex/caught.h"
#include "fileindex/util/path_index.h"
#include "support/private_root.h"

using vexlo::JsonFromString;
using vexlo::fileindex::Folder;
using vexlo::fileindex::FolderMgr;
using vexlo::fileindex::PathIndex;

namespace {

const PrivateRoot kRoot;
const std::string kFolder = kRoot.MakeFolder("var/packages/Vexlo/etc");
const std::string kFile = kFolder + "/fileindex.folders";

using FolderPtr = std::shared_ptr<Folder>;

// JSON with ' for ".
Json::Value Parsed(std::string text) {
  std::replace(text.begin(), text.end(), '\'', '"');
  Json::Value value;
  EXPECT_TRUE(JsonFromString(value, text)) << text;
  return value;
}

// `types` as "davp", less those that are off; `more` as "'group': 'x'".
Json::Value Data(const std::string& path, const std::string& types = "davp",
                 const std::string& more = "") {
  Json::Value data = Parsed("{" + more + "}");
  data["path"] = path;
  data["name"] = data.get("name", "N");
  for (const std::string type : {"document", "audio", "video", "photo"}) {
    data[type] = types.find(type[0]) != std::string::npos;
  }
  return data;
}

FolderPtr Make(const std::string& path, const std::string& types = "davp",
               const std::string& more = "") {
  return std::make_shared<Folder>(Data(path, types, more));
}

// "PATH:TYPES", or "none".
std::string Told(const FolderPtr& folder) {
  if (folder == nullptr) {
    return "none";
  }
  EXPECT_EQ(folder->GetName(), "N");
  return folder->GetPath() + ":" + (folder->IsDocument() ? "d" : "") +
         (folder->IsAudio() ? "a" : "") + (folder->IsVideo() ? "v" : "") +
         (folder->IsPhoto() ? "p" : "");
}

std::string Paths(const std::vector<FolderPtr>& folders) {
  std::string paths;
  for (const FolderPtr& folder : folders) {
    paths += folder->GetPath() + " ";
  }
  return paths;
}

void SetShares() {
  kRoot.MakeFolder("tmp");
  kRoot.SetShares(R"({"name": "p", "path": ")" + kRoot.MakeFolder("v1/p") +
                  R"("}, {"name": "m", "path": ")" + kRoot.MakeFolder("v1/m") + "\"}");
}

FolderMgr Loaded(const std::vector<Json::Value>& records) {
  Json::Value folders(Json::arrayValue);
  for (const Json::Value& record : records) {
    folders.append(record);
  }
  WriteText(kFile, vexlo::JsonToString(folders));
  return {};
}

TEST(FolderMgr, GivesBackWhatWasSaved) {
  const FolderMgr old = Loaded({Data("/p/\xE9", "dv",
                                     "'owner':'o','group':'g','paused':true,"
                                     "'privileged':true,'volume_to_be_clean':'/v'")});
  const Json::Value record = old.GetFolders()[0]->GetData();
  EXPECT_EQ(record["owner"].asString() + record["group"].asString(), "og");
  EXPECT_EQ(record.size(), 11U);
  unlink(kFile.c_str());
  old.Save();
  EXPECT_EQ(FolderMgr().GetFolders().at(0)->GetData(), record);
  EXPECT_EQ(std::filesystem::status(kFile).permissions(), std::filesystem::perms{0644});
}

TEST(FolderMgr, TellsWhatAChangeMeansForAPath) {
  SetShares();
  struct Row {
    const char* name;
    FolderPtr upsert;
    std::string erase, want_diff, want_paths;
  };
  const std::string rest = "/p /p/a ";
  for (const Row& row : {
           Row{"Same", Make("/p", "dv"), "", "/p:", "/p/a /p "},
           Row{"Changed", Make("/p/a", "dp", "'group':'g','owner':'o'"), "", "/p/a:dap", rest},
           Row{"CoveredBefore", Make("/p/ab", "d"), "", "/p/ab:v", rest + "/p/ab "},
           Row{"DeletesTheInner", nullptr, "/p/a", "/p/a:dav", "/p "},
           Row{"DeletesTheOuter", nullptr, "/p", "/p:davp", "/p/a "},
           Row{"DeletesNoFolderOfACoveredPath", nullptr, "/p/x", "/p:", rest},
           Row{"DeletesNoFolder", nullptr, "/m", "none", rest},
           Row{"UnknownShare", nullptr, "/gone/x", "800", rest},
       }) {
    SCOPED_TRACE(row.name);
    FolderMgr manager = Loaded({Data("/p", "dv"), Data("/p/a", "a")});
    FolderPtr diff;
    const std::string error = Caught([&] {
      row.upsert == nullptr ? manager.Delete(diff, row.erase) : manager.Upsert(diff, row.upsert);
    });
    EXPECT_EQ(error.empty() ? Told(diff) : error.substr(0, 3), row.want_diff);
    EXPECT_TRUE(diff == nullptr || (diff->GetGroup() + diff->GetOwner()).empty());
    EXPECT_EQ(Paths(manager.GetFolders()), row.want_paths);
  }
}

TEST(FolderMgr, StaysWholeWhenAShareCannotBeTold) {
  SetShares();
  FolderMgr manager = Loaded({Data("/p/a", "d"), Data("/m", "d"), Data("bad", "d")});
  EXPECT_EQ(Caught([&] { manager.DeleteByShare("p"); }).substr(0, 3), "120");
  EXPECT_EQ(Paths(manager.GetFolders()), "/p/a /m bad ");
}

TEST(FolderMgr, AnswersByTheDeepestFolderThatCovers) {
  SetShares();
  const std::string volume = kRoot / "v1";
  FolderMgr manager = Loaded({Data("/p/a", "d"), Data("/p", "p", "'group':'g'"), Data("/p/a", "")});
  for (const auto& [path, want] : std::map<std::string, std::string>{
           {"/p/a/b/x.pdf", "/p/a:d meta"},
           {"/p/a/x.jpg", "/p/a:d"},
           {"/p/a/x.unknown", "/p/a:d meta"},
           {"/p/ab.jpg", "/p:p meta"},
           {"/p", "/p:p own"},
           {"/m/x.jpg", "none"},
       }) {
    EXPECT_EQ(Told(manager.GetMostSuitableCfg(volume + path)) +
                  (manager.IsFullPathNeedMeta(volume + path) ? " meta" : "") +
                  (manager.IsFullPathHasOwnCfg(volume + path) ? " own" : ""),
              want);
    EXPECT_EQ(manager.IsFullPathIndexed(volume + path), want != "none");
  }
  EXPECT_EQ(manager.GetIndexedShares(), std::set<std::string>{"p"});
  EXPECT_TRUE(manager.IsShareIndexed("p") && !manager.IsShareIndexed("P"));
  FolderPtr found;
  manager.Get(found, "/p");
  EXPECT_EQ(found->GetFullPath(), volume + "/p");
}

TEST(PathIndex, AgreesWithAPassOverAllPaths) {
  std::mt19937 random(1);
  const auto component = [&random] { return std::string(random() % 3, 'x') + "ab"[random() % 2]; };
  const auto make = [&](size_t most) {
    std::string path;
    for (size_t left = random() % (most + 1); left > 0; --left) {
      path += "/" + component();
    }
    return path;
  };
  for (int round = 0; round < 300; ++round) {
    const size_t most = round % 10 == 0 ? 70 : 4;
    std::vector<std::string> paths(random() % 20);
    std::generate(paths.begin(), paths.end(), [&] { return make(most); });
    const PathIndex index(paths);
    for (int question = 0; question < 50; ++question) {
      std::string path = make(most + 2);
      path += !paths.empty() && random() % 2 == 0 ? "" : paths.empty() ? "/" : paths[0] + path;
      size_t covering = PathIndex::kNone, exact = PathIndex::kNone;
      for (size_t i = paths.size(); i-- > 0;) {
        exact = paths[i] == path ? i : exact;
        if ((path + "/").starts_with(paths[i] + "/") &&
            (covering == PathIndex::kNone || paths[i].size() >= paths[covering].size())) {
          covering = i;
        }
      }
      ASSERT_EQ(index.FindCovering(path), covering) << path;
      ASSERT_EQ(index.FindExactly(path), exact) << path;
    }
  }
}

TEST(FolderMgr, ListsAPage) {
  const FolderMgr manager = Loaded({Data("/p/b", "", "'name':'Z','group':'g','owner':'2'"),
                                    Data("/p/A", "", "'name':'b','owner':'1'"),
                                    Data("/p/c", "", "'name':'b','group':'g','owner':'1'")});
  struct Row {
    const char* name;
    unsigned long offset, limit;
    std::string sort_by, direction, group, keyword, want;
    size_t want_total;
  };
  const unsigned long most = ~0UL;
  for (const Row& row : {
           Row{"EndsKeepTheOrder", 0, 0, "owner", "ASC", "all", "", "/p/A /p/c /p/b ", 3},
           Row{"Descending", 0, 0, "name", "dEsC", "", "", "/p/A /p/c /p/b ", 3},
           Row{"Group", 0, 0, "path", "DESC", "g", "", "/p/c /p/b ", 2},
           Row{"KeywordInPath", 0, 0, "", "", "", "/a", "/p/A ", 1},
           Row{"Page", 1, 1, "path", "", "", "", "/p/b ", 3},
           Row{"NoOverflow", 1, most, "", "", "", "", "/p/A /p/c ", 3},
           Row{"UnknownField", 0, 0, "size", "", "", "", "120 Unknown sort_by: size", 0},
       }) {
    SCOPED_TRACE(row.name);
    std::vector<FolderPtr> page;
    size_t total = 0;
    const std::string error = Caught([&] {
      manager.List(page, total, row.offset, row.limit, row.sort_by, row.direction, row.group,
                   row.keyword);
    });
    EXPECT_EQ(error.empty() ? Paths(page) : error, row.want);
    EXPECT_EQ(total, row.want_total);
  }
}

}  // namespace
