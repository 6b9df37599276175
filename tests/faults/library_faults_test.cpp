// What the library writes, with each call of the system failing in turn: files are old or new,
// nothing that was asked for is lost without an error, and nothing stays locked or open.
#include <set>
#include <sstream>

#include "common/json.h"
#include "common/lock.h"
#include "faults/every_fault.h"
#include "fileindex/folder_mgr.h"
#include "fileindex/paths.h"
#include "fileindex/queue_mgr.h"
#include "fileindex/status_mgr.h"
#include "fileindex/util/custom_event.h"
#include "kavo/local/shares.h"
#include "support/private_root.h"

namespace {

const PrivateRoot kRoot;
namespace index = vexlo::fileindex;

const std::string kEtc = kRoot.MakeFolder("var/packages/Vexlo/etc");
const std::string kQueueFolder = kRoot.MakeFolder("var/lib/kavo/fileindex/queue");
const std::string kShares = kRoot / "etc/kavo";
const std::string kDocs = kRoot.MakeFolder("vol/docs");

Json::Value Load(const std::string& file) {
  Json::Value value;
  EXPECT_TRUE(vexlo::JsonFromString(value, ReadText(file))) << file << ": " << ReadText(file);
  return value;
}

// What a file that is replaced whole leaves beside it is known; anything else is litter.
void ExpectOnly(const std::string& folder, const std::set<std::string>& names) {
  for (const auto& entry : std::filesystem::directory_iterator(folder)) {
    EXPECT_TRUE(names.contains(entry.path().filename())) << entry.path();
  }
}

// Nothing but the shares.
void Clear() {
  for (const std::string& folder : {kEtc, kQueueFolder, kShares}) {
    for (const auto& entry : std::filesystem::directory_iterator(folder)) {
      std::filesystem::remove(entry);
    }
  }
  kRoot.SetShares(R"({"name":"docs","path":")" + kDocs + "\"}");
}

std::string Line(const std::string& path) {
  return R"({"event":8,"path":")" + kDocs + "/" + path + "\",\"path_old\":\"\"}\n";
}
// As FILEIDXQueuePathCompose() names it; asking it would have the process know the shares.
std::string Queue() {
  std::string name;
  for (const char byte : kDocs) {
    name += byte == '/' ? std::string("%2F") : std::string(1, byte);
  }
  return kQueueFolder + "/" + name;
}

// The paths below the share of which a queue file tells; each line must be whole.
void AddPaths(const std::string& file, std::set<std::string>& paths) {
  if (!std::filesystem::exists(file)) {
    return;
  }
  std::istringstream lines(ReadText(file));
  for (std::string line; std::getline(lines, line);) {
    Json::Value event;
    EXPECT_TRUE(vexlo::JsonFromString(event, line)) << line;
    paths.insert(event["path"].asString().substr(kDocs.size() + 1));
  }
}

Json::Value Record(const std::string& path) {
  Json::Value record;
  record["path"] = record["name"] = path;
  for (const char* type : {"document", "audio", "video", "photo"}) {
    record[type] = true;
  }
  return record;
}

FaultyWork CustomEvent() {
  static const std::string kStatus = kEtc + "/fileindex.status";
  return {"CustomEvent",
          [] {
            Clear();
            WriteText(Queue(), Line("before"));
            WriteText(kStatus, R"({"share":{"docs":0,"other":2}})");
          },
          [] {
            index::AddCustomEvent(0x40, kDocs + "/new", "", Json::Value());
            return true;
          },
          [](bool done, bool lasts) {
            std::set<std::string> paths;
            AddPaths(Queue(), paths);
            EXPECT_TRUE(paths.contains("before"));
            const Json::Value shares = Load(kStatus)["share"];
            EXPECT_EQ(shares["other"].asInt(), 2);
            // Who cannot tell the share, or can write nothing at all, has the error.
            EXPECT_TRUE(paths.contains("new") || !done);
            if (!lasts) {
              ExpectOnly(kEtc, {"fileindex.status"});
            }
          }};
}

FaultyWork Cycle() {
  static std::set<std::string> handled;
  return {"Cycle",
          [] {
            Clear();
            handled.clear();
            WriteText(Queue() + ".tmp", Line("a") + Line("b"));
            WriteText(Queue(), Line("c") + Line("d") + Line("e"));
          },
          [] {
            for (int i = 0; i < 2; ++i) {
              std::set<std::string> told;
              index::QueueMgr queue(Queue());
              queue.ProcessOP(
                  [&](const std::shared_ptr<index::OP>& op) {
                    told.insert(op->node.lock()->GetPath().substr(kDocs.size() + 1));
                  },
                  /*use_tmp=*/true);
              handled.merge(told);
              queue.DeleteTmp();
            }
            return true;
          },
          [](bool /*done*/, bool /*lasts*/) {
            std::set<std::string> paths = handled;
            AddPaths(Queue(), paths);
            AddPaths(Queue() + ".tmp", paths);
            EXPECT_EQ(paths, std::set<std::string>({"a", "b", "c", "d", "e"}));
          }};
}

// A file that is replaced whole, with something "old" in it, to which saving adds something "new".
struct SavedFile {
  const char* name;
  std::string path;
  std::string text;
  std::function<bool()> save;
  std::function<std::set<std::string>(const Json::Value&)> read;
};

FaultyWork Saving(const SavedFile& file) {
  return {file.name,
          [file] {
            Clear();
            WriteText(file.path, file.text);
          },
          file.save,
          [file](bool done, bool lasts) {
            const std::set<std::string> names = file.read(Load(file.path));
            EXPECT_TRUE(names.contains("old"));
            EXPECT_TRUE(names.contains("new") || !done);
            if (!lasts) {
              const std::filesystem::path path = file.path;
              ExpectOnly(path.parent_path(), {path.filename(), path.filename().string() + ".lock"});
            }
          }};
}

std::set<std::string> Members(const Json::Value& list, const char* member) {
  std::set<std::string> names;
  for (const Json::Value& each : list) {
    names.insert(std::filesystem::path(each[member].asString()).filename());
  }
  return names;
}

bool SaveFolders() {
  const vexlo::LockFile lock(index::kFileIndexFoldersLockPath.Get(), /*exclusive=*/true);
  index::FolderMgr folders;
  std::shared_ptr<index::Folder> before;
  folders.Upsert(before, std::make_shared<index::Folder>(Record("/docs/new")));
  folders.Save();
  return true;
}

bool EditShares() {
  const std::string file = kShares + "/shares.json";
  const auto shares = kavo::local::ReadShares(file);
  kavo::local::Share share;
  share.name = "new";
  share.path = kRoot / "vol/new";
  if (std::none_of(shares.begin(), shares.end(),
                   [&](const kavo::local::Share& known) { return known.name == share.name; })) {
    kavo::local::AddShare(file, share);
  }
  return true;
}

std::vector<FaultyWork> SavingEachFile() {
  Json::Value folders(Json::arrayValue);
  folders.append(Record("/docs/old"));
  const SavedFile files[] = {
      {"Folders", kEtc + "/fileindex.folders", vexlo::JsonToString(folders), SaveFolders,
       [](const Json::Value& list) { return Members(list, "path"); }},
      {"Status", kEtc + "/fileindex.status", R"({"share":{"other":2},"resume_time":7})",
       [] {
         index::StatusMgr().SetShareStatus("docs", index::SS_NEED_REINDEX);
         return true;
       },
       [](const Json::Value& status) {
         const Json::Value& shares = status["share"];
         return std::set<std::string>{
             shares["other"].asInt() == 2 && status["resume_time"].asInt() == 7 ? "old" : "lost",
             shares["docs"].asInt() == 1 ? "new" : "not yet"};
       }},
      {"Shares", kShares + "/shares.json", R"({"shares":[{"name":"old","path":"/old"}]})",
       EditShares, [](const Json::Value& file) { return Members(file["shares"], "name"); }},
  };
  std::vector<FaultyWork> works;
  works.reserve(std::size(files));
  for (const SavedFile& file : files) {
    works.push_back(Saving(file));
  }
  return works;
}

TEST(LibraryFaults, LoseNothingAndKeepNothing) {
  kRoot.MakeFolder("tmp");
  std::vector<FaultyWork> works = SavingEachFile();
  works.insert(works.end(), {CustomEvent(), Cycle()});
  for (const FaultyWork& work : works) {
    printf("%s: %u faults\n", work.name, RunWithEveryFault(work));
  }
}

}  // namespace
