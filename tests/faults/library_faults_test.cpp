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
#include "kavo/local/monitor_queues.h"
#include "kavo/local/shares.h"
#include "kavo/monitor_queue.h"
#include "support/private_root.h"

namespace {

const PrivateRoot kRoot;
namespace index = vexlo::fileindex;

const std::string kEtc = kRoot.MakeFolder("var/packages/Vexlo/etc");
const std::string kQueueFolder = kRoot.MakeFolder("var/lib/kavo/fileindex/queue");
const std::string kWatchFolder = kRoot.MakeFolder("var/lib/kavo/evnotify");
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
  for (const std::string& folder : {kEtc, kQueueFolder, kWatchFolder, kShares}) {
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
              ExpectOnly(kEtc, {"fileindex.status", "fileindex.folders"});
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

FaultyWork SavingFolders() {
  static const std::string kFile = kEtc + "/fileindex.folders";
  return {"SavingFolders",
          [] {
            Clear();
            Json::Value list(Json::arrayValue);
            list.append(Record("/docs/old"));
            WriteText(kFile, vexlo::JsonToString(list));
          },
          [] {
            const vexlo::LockFile lock(index::kFileIndexFoldersLockPath.Get(), /*exclusive=*/true);
            index::FolderMgr folders;
            std::shared_ptr<index::Folder> before;
            folders.Upsert(before, std::make_shared<index::Folder>(Record("/docs/new")));
            folders.Save();
            return true;
          },
          [](bool done, bool lasts) {
            std::set<std::string> paths;
            for (const Json::Value& folder : Load(kFile)) {
              paths.insert(folder["path"].asString());
            }
            EXPECT_TRUE(paths.contains("/docs/old"));
            EXPECT_TRUE(paths.contains("/docs/new") || !done);
            if (!lasts) {
              ExpectOnly(kEtc, {"fileindex.status", "fileindex.folders"});
            }
          }};
}

FaultyWork SavingStatus() {
  static const std::string kFile = kEtc + "/fileindex.status";
  return {"SavingStatus",
          [] {
            Clear();
            WriteText(kFile, R"({"share":{"other":2},"resume_time":7})");
          },
          [] {
            index::StatusMgr().SetShareStatus("docs", index::SS_NEED_REINDEX);
            return true;
          },
          [](bool done, bool lasts) {
            const Json::Value status = Load(kFile);
            EXPECT_EQ(status["share"]["other"].asInt(), 2);
            EXPECT_EQ(status["resume_time"].asInt(), 7);
            EXPECT_TRUE(status["share"]["docs"].asInt() == 1 || !done);
            if (!lasts) {
              ExpectOnly(kEtc, {"fileindex.status", "fileindex.folders"});
            }
          }};
}

FaultyWork Registering() {
  static const std::string kFile = kWatchFolder + "/app.json";
  static const auto queue = [](const std::string& name) {
    Json::Value description;
    description["queue"] = kQueueFolder + "/" + name;
    description["config"] = Json::arrayValue;
    return description;
  };
  return {"Registering",
          [] {
            Clear();
            Json::Value file;
            file["queues"].append(queue("old"));
            file["queues"][0]["type"] = 0;
            WriteText(kFile, vexlo::JsonToString(file));
          },
          [] {
            return EVNOTIFYD::MonitorQueue::Upsert(EVNOTIFYD::MonitorQueue(queue("new")), "app",
                                                   EVNOTIFYD::MONITOR_QUEUE_TYPE_APPLICATION);
          },
          [](bool done, bool lasts) {
            std::set<std::string> queues;
            const Json::Value file = Load(kFile);
            for (const Json::Value& entry : file["queues"]) {
              queues.insert(std::filesystem::path(entry["queue"].asString()).filename());
            }
            EXPECT_TRUE(queues.contains("old"));
            EXPECT_TRUE(queues.contains("new") || !done);
            if (!lasts) {
              ExpectOnly(kWatchFolder, {"app.json", "app.json.lock"});
            }
          }};
}

FaultyWork EditingShares() {
  static const std::string kFile = kShares + "/shares.json";
  return {"EditingShares", Clear,
          [] {
            for (const kavo::local::Share& share : kavo::local::ReadShares(kFile)) {
              if (share.name == "new") {
                return true;
              }
            }
            kavo::local::Share share;
            share.name = "new";
            share.path = kRoot / "vol/new";
            kavo::local::AddShare(kFile, share);
            return true;
          },
          [](bool done, bool lasts) {
            std::set<std::string> names;
            const Json::Value file = Load(kFile);
            for (const Json::Value& share : file["shares"]) {
              names.insert(share["name"].asString());
            }
            EXPECT_TRUE(names.contains("docs"));
            EXPECT_TRUE(names.contains("new") || !done);
            if (!lasts) {
              ExpectOnly(kShares, {"shares.json", "shares.json.lock"});
            }
          }};
}

TEST(LibraryFaults, LoseNothingAndKeepNothing) {
  kRoot.MakeFolder("tmp");
  for (const FaultyWork& work :
       {CustomEvent(), Cycle(), SavingFolders(), SavingStatus(), Registering(), EditingShares()}) {
    printf("%s: %u faults\n", work.name, RunWithEveryFault(work));
  }
}

}  // namespace
