// The administrative operations on the real engine and platform: what they do in which order, and
// what is left when any of it fails.
#include "fileindex/index_mgr/folder_ops.h"

#include <sys/file.h>
#include <sys/wait.h>

#include <cstdarg>
#include <filesystem>
#include <optional>

#include "common/json.h"
#include "common/sdk/share.h"
#include "fileindex/caught.h"
#include "fileindex/comm.h"
#include "fileindex/elastic_control/share_index.h"
#include "fileindex/folder_mgr.h"
#include "fileindex/index_mgr/status_report.h"
#include "fileindex/status_mgr.h"
#include "kavo/last_error.h"
#include "kavo/local/monitor_queues.h"
#include "support/fake_engine.h"
#include "support/faults.h"
#include "support/private_root.h"
#include "support/program.h"
#include "support/syslog_capture.h"

using vexlo::JsonToString;
using vexlo::fileindex::FolderAdd;
using vexlo::fileindex::FolderDelete;
using vexlo::fileindex::FolderMgr;
using vexlo::fileindex::FolderReindex;
using vexlo::fileindex::FolderSet;
using vexlo::fileindex::StatusMgr;
using vexlo::sdk::SDKShare;

namespace {

const PrivateRoot kRoot;
const std::string kEtc = kRoot.MakeFolder("var/packages/Vexlo/etc");
std::vector<std::string> steps;  // What was done, or tried, since Recorded().
size_t failing_step = SIZE_MAX;  // Its index in `steps`.
int last_error = KAVO_ERR_NONE;

// True when this step is to fail.
bool Step(const std::string& step) {
  steps.push_back(step);
  return steps.size() - 1 == failing_step;
}

std::string WithoutRoot(std::string text) {
  for (size_t at = 0; (at = text.find(kRoot.Path(), at)) != std::string::npos;) {
    text.erase(at, kRoot.Path().size());
  }
  return text;
}

std::string NameOf(int fd) {
  std::error_code error;
  return std::filesystem::read_symlink("/proc/self/fd/" + std::to_string(fd), error);
}

}  // namespace

INTERPOSED ssize_t write(int fd, const void* data, size_t size) {
  static const auto real = REAL_FUNCTION(ssize_t, write, (int, const void*, size_t));
  const std::string text(static_cast<const char*>(data), size);
  Json::Value value;
  bool fails = false;
  if (NameOf(fd).find("/fileindex/queue/") != std::string::npos) {
    vexlo::JsonFromString(value, text);
    fails = Step("event " + value["event"].asString() + " " +
                 WithoutRoot(value["path"].asString()) + " " + JsonToString(value["data"]));
  } else if (text.starts_with("{\"data\":") && NameOf(fd).starts_with("socket:")) {
    vexlo::JsonFromString(value, text.substr(0, size - 1));
    fails = Step("tell " + JsonToString(value["data"]));
  }
  errno = fails ? ENOSPC : errno;
  return fails ? -1 : real(fd, data, size);
}
INTERPOSED ssize_t sendmsg(int fd, const struct msghdr* message, int flags) {
  static const auto real = REAL_FUNCTION(ssize_t, sendmsg, (int, const struct msghdr*, int));
  std::string text;
  for (size_t i = 0; i < message->msg_iovlen; ++i) {
    text.append(static_cast<const char*>(message->msg_iov[i].iov_base),
                message->msg_iov[i].iov_len);
  }
  Json::Value request;
  vexlo::JsonFromString(request, text.substr(std::min(text.size(), sizeof(uint64_t))));
  const std::string command = request.isObject() ? request["command"].asString() : "";
  const bool fails = command.starts_with("index_") && command != "index_list" &&
                     Step(command + " " + request["data"]["id"].asString());
  errno = fails ? EPIPE : errno;
  return fails ? -1 : real(fd, message, flags);
}
INTERPOSED int rename(const char* from, const char* to) {
  static const auto real = REAL_FUNCTION(int, rename, (const char*, const char*));
  const std::string name = std::filesystem::path(to).filename();
  const bool fails = name == "fileindex.folders" ? Step("save")
                     : name == "fileindex.json"  ? Step("watch")
                                                 : name == "fileindex.status" && Step("status");
  errno = fails ? EIO : errno;
  return fails ? -1 : real(from, to);
}
INTERPOSED int flock(int fd, int operation) {
  static const auto real = REAL_FUNCTION(int, flock, (int, int));
  if (NameOf(fd).ends_with("/vexlo_cfg_folder.lock")) {
    Step((operation & LOCK_UN) != 0 ? "unlock" : "lock");
  }
  return real(fd, operation);
}
INTERPOSED int KAVOQuotaIsEnough(uid_t /*user*/, const char* path, uint64_t /*bytes*/) {
  const bool fails = Step("space " + WithoutRoot(path));
  last_error = fails ? KAVO_ERR_NO_SPACE : last_error;
  return fails ? 0 : 1;
}
INTERPOSED int KLIBCErrGet() { return last_error; }
#define STEP(name, parameters, step) \
  INTERPOSED int name parameters { return Step(step) ? -1 : 0; }
STEP(KLIBServiceStart, (const char* name), std::string("start ") + name)
STEP(KLIBServicectlStart, (const char* name), std::string("start ") + name)
STEP(KLIBServicectlStop, (const char* name), std::string("stop ") + name)
STEP(KAVOSMBSetSpotlight, (const char* share, int is_on),
     std::string(is_on != 0 ? "searchable " : "unsearchable ") + share)
INTERPOSED int KLIBCExec(const char* path, ...) {
  va_list arguments;
  va_start(arguments, path);
  const std::string option = va_arg(arguments, const char*);
  const std::string target = va_arg(arguments, const char*);
  va_end(arguments);
  EXPECT_EQ(path + (" " + option), "/bin/rm -rf");
  std::filesystem::remove_all(target);
  return Step(target.find("/db/") != std::string::npos ? "rm db"
              : target.ends_with(".tmp")               ? "rm snapshot"
                                                       : "rm queue")
             ? -1
             : 0;
}

namespace {

Json::Value Record(const std::string& path, bool photo = true, const std::string& group = "") {
  Json::Value record;
  record["path"] = path;
  record["name"] = path;
  record["group"] = group;
  record["photo"] = photo;
  record["document"] = record["audio"] = record["video"] = true;
  return record;
}
template <typename... Elements>
Json::Value List(const Elements&... elements) {
  Json::Value list(Json::arrayValue);
  (list.append(elements), ...);
  return list;
}

using Act = std::function<void()>;

// Records what `act` does. "CODE REASON" of the Error, or "".
std::string Recorded(const Act& act, size_t failing = SIZE_MAX) {
  steps.clear();
  failing_step = failing;
  const std::string caught = Caught(act);
  failing_step = SIZE_MAX;
  return WithoutRoot(caught);
}

// What is on disk and in the engine: "FOLDERS | WATCHED | INDEXES | STATUS".
std::string World() {
  std::string world;
  const FolderMgr folders;
  for (const auto& folder : folders.GetFolders()) {
    world += folder->GetPath() + " ";
  }
  world += "|";
  for (const auto& queue : kavo::local::ReadMonitorQueues().queues) {
    for (const auto& folder : queue.folders) {
      EXPECT_EQ(folder.mask, 65484U);
      EXPECT_EQ(folder.ignore, std::vector<std::string>{"@eaDir"});
      world += " " + WithoutRoot(folder.path);
    }
  }
  world += " |";
  Json::Value request, reply;
  request["command"] = "index_list";
  vexlo::SendRequestImpl(reply, request);
  for (const Json::Value& index : reply["data"]) {
    world += " " + index["id"].asString();
  }
  return world + " | " + std::to_string(StatusMgr().GetShareStatus("p"));
}

class IndexMgr : public testing::Test {
 protected:
  static void SetShares() {
    kRoot.SetShares(R"({"name": "p", "path": ")" + kRoot / "v/p" +
                    R"("}, {"name": "m", "path": ")" + kRoot / "v/m" + "\"}");
  }
  static void SetUpTestSuite() {
    for (const char* name : {"tmp", "var/run", "var/lib/kavo/fileindex/queue", "v/p/a/b", "v/m"}) {
      kRoot.MakeFolder(name);
    }
    SetShares();
    engine_.emplace("export FILEINDEX_ROOT=" + kRoot.Path(), KAVOELASTICD_PROGRAM " 2>&1");
    ASSERT_TRUE(engine_->Await("ready")) << engine_->text;
    daemon_.emplace(kRoot / "var/run/fileindexd.sock");
  }
  static void TearDownTestSuite() {
    daemon_.reset();
    EXPECT_EQ(engine_->End(SIGTERM), 0);
  }
  // Nothing but the folders of `paths`, without events.
  static void Begin(const std::vector<std::string>& paths, int status = 0) {
    for (const std::string share : {"p", "m"}) {
      Recorded([&] { vexlo::fileindex::elastic::ShareIndexDelete(share); });
      std::filesystem::remove(SDKShare(share).GetQueuePath());
    }
    for (const char* file : {"/fileindex.folders", "/fileindex.status"}) {
      std::filesystem::remove(kEtc + file);
    }
    std::filesystem::remove_all(kavo::local::MonitorQueuesFolder());
    for (const std::string& path : paths) {
      EXPECT_EQ(Recorded([&] { FolderAdd(List(Record(path)), /*updater_mode=*/true); }), "");
    }
    if (status != 0) {
      StatusMgr().SetShareStatus("p", status);
    }
  }

 private:
  static inline std::optional<Program> engine_;
  static inline std::optional<FakeEngine> daemon_;
};

using Steps = std::vector<std::string>;

struct OperationCase {
  const char* name;
  std::vector<std::string> before;
  int status;
  Act act;
  Steps want;
  std::string want_world;
};

std::string Tell(const std::string& share, bool is_upsert) {
  return std::string("tell {\"is_upsert\":") + (is_upsert ? "true" : "false") +
         ",\"share_name\":\"" + share + "\"}";
}
std::string Changed(const std::string& path, bool others, bool photo) {
  const std::string other = others ? "true" : "false";
  return "event 131072 " + path + " {\"audio\":" + other + ",\"document\":" + other +
         ",\"photo\":" + (photo ? "true" : "false") + ",\"video\":" + other + "}";
}
Steps Locked(const Steps& inner) {
  Steps all = {"lock"};
  all.insert(all.end(), inner.begin(), inner.end());
  all.emplace_back("unlock");
  return all;
}

const std::string kExtractor = "kavocontentextractd", kIndexer = "pkg-Vexlo-fileindexd";
const OperationCase kOperations[] = {
    {"AddFirst",
     {},
     0,
     [] { FolderAdd(List(Record("/p/a"), Record("/p")), false); },
     Locked({"space /v/p", "space /v/p", "start " + kExtractor, "start " + kIndexer, "searchable p",
             "index_create fileindex_p", "watch", "save", Tell("p", true),
             Changed("/v/p/a", true, true), Changed("/v/p", true, true)}),
     "/p/a /p | /v/p/a /v/p | fileindex_p | 0"},
    {"AddAsUpdater",
     {"/p/a"},
     0,
     [] { FolderAdd(List(Record("/p/.git")), true); },
     Locked({"space /v/p", "start " + kExtractor, "start " + kIndexer, "searchable p", "watch",
             "save", Tell("p", true)}),
     "/p/a /p/.git | /v/p/a /v/p/.git | fileindex_p | 0"},
    {"Set",
     {"/p", "/m"},
     0,
     [] { FolderSet(List(Record("/p", false), Record("/p/a"), Record("/m")), false); },
     Locked({"space /v/p", "space /v/p", "space /v/m", "start " + kExtractor, "start " + kIndexer,
             "searchable m", "searchable p", "watch", "watch", "save", Tell("m", true),
             Tell("p", true), Changed("/v/p", false, true), Changed("/v/p/a", false, true),
             Changed("/v/m", false, false)}),
     "/p /p/a /m | /v/p /v/p/a /v/m | fileindex_m fileindex_p | 0"},
    {"Delete",
     {"/p", "/p/a", "/m"},
     0,
     [] { FolderDelete(List("/p/a", "/m")); },
     Locked({"index_delete fileindex_m", "watch", "rm queue", "rm snapshot", "rm db", "status",
             "watch", "save", Tell("m", false), Tell("p", false), Changed("/v/p/a", false, false),
             "unsearchable m", "searchable p"}),
     "/p | /v/p | fileindex_p | 0"},
    {"DeleteShare",
     {"/p", "/p/a"},
     2,
     [] { FolderDelete(std::string("p")); },
     Locked({"index_delete fileindex_p", "watch", "rm queue", "rm snapshot", "rm db", "status",
             "save", Tell("p", false), "stop " + kIndexer, "stop " + kExtractor, "unsearchable p"}),
     "| | | 0"},
    {"Reindex",
     {"/p"},
     0,
     [] { FolderReindex(List("/p/a", "/m")); },
     {"event 65536 /v/p/a null"},
     "/p | /v/p | fileindex_p | 0"},
    {"ReindexMarked",
     {"/p"},
     1,
     [] { FolderReindex(List("/p")); },
     {"event 65536 /v/p null", "status"},
     "/p | /v/p | fileindex_p | 0"},
    {"Rebuild",
     {"/p/a"},
     3,
     [] { FolderReindex(List("/p/a", "/p/a")); },
     {"index_delete fileindex_p", "index_create fileindex_p", "event 65536 /v/p null", "status"},
     "/p/a | /v/p/a | fileindex_p | 0"},
};

// Those whose failure is passed over, and what the others' failure throws.
std::string ErrorOf(const std::string& step) {
  const std::string verb = step.substr(0, step.find(' '));
  return verb == "space"                                        ? "1003"
         : verb.starts_with("index_")                           ? "913 "
         : verb == "save" || verb == "status"                   ? "505 "
         : verb == "watch" || verb == "tell" || verb == "event" ? "502 "
                                                                : "";
}

TEST_F(IndexMgr, TakesItsStepsInOrderAndNoneAfterOneThatFails) {
  for (const OperationCase& row : kOperations) {
    SCOPED_TRACE(row.name);
    Begin(row.before, row.status);
    EXPECT_EQ(Recorded(row.act), "");
    EXPECT_EQ(steps, row.want);
    EXPECT_EQ(World(), row.want_world);
    for (size_t failing = 0; failing < row.want.size(); ++failing) {
      const std::string& step = row.want[failing];
      SCOPED_TRACE(step);
      SyslogCapture log;
      Begin(row.before, row.status);
      const std::string error = Recorded(row.act, failing);
      EXPECT_EQ(error.substr(0, 4), ErrorOf(step));
      Steps want = row.want;
      if (!error.empty()) {
        want.resize(failing + 1);
        if (step.starts_with("event")) {
          want.emplace_back("status");  // The share is marked, so that nothing is lost.
        }
        if (row.want[0] == "lock") {
          want.emplace_back("unlock");
        }
      }
      EXPECT_EQ(steps, want);
      if (step.starts_with("event")) {
        EXPECT_EQ(StatusMgr().GetShareStatus("p") & 1U, step.find("/v/p") < step.size() ? 1U : 0U);
      }
    }
  }
}

TEST_F(IndexMgr, RefusesAWholeListForOneBadElement) {
  struct Row {
    const char* name;
    Act act;
    std::string want;
  };
  for (const Row& row : {
           Row{"Twice", [] { FolderAdd(List(Record("/p/a"), Record("/p/a")), false); },
               "901 Duplicated ID: /p/a"},
           Row{"InTheList", [] { FolderAdd(List(Record("/p/a/b"), Record("/p")), true); },
               "901 Duplicated ID: /p"},
           Row{"AddOfNoList", [] { FolderAdd(Record("/p/a"), false); }, "120 {"},
           Row{"Refused", [] { FolderSet(List(Record("/p"), Record("/p/.git")), false); },
               "903 Path cannot index: /p/.git"},
           Row{"UnknownShare", [] { FolderAdd(List(Record("/x")), true); }, "800 x"},
           Row{"ReservedGroup", [] { FolderAdd(List(Record("/p/a", true, "all")), false); },
               "120 \"all\" is reserved group name"},
           Row{"DeleteOfNoText", [] { FolderDelete(List("/p", 7)); }, "120 7"},
           Row{"DeleteInUnknownShare", [] { FolderDelete(List("/x/a")); }, "800 x"},
           Row{"ReindexOfNoText", [] { FolderReindex(List("/p", 7)); }, "120 7"},
       }) {
    SCOPED_TRACE(row.name);
    SyslogCapture log;
    Begin({"/p"});
    const std::string before = World();
    EXPECT_EQ(Recorded(row.act).substr(0, row.want.size()), row.want);
    EXPECT_TRUE(std::none_of(steps.begin(), steps.end(), [](const std::string& step) {
      return step.starts_with("event") || step.starts_with("tell") || step.starts_with("start");
    }));
    EXPECT_EQ(World(), before);
  }
  WriteText(kEtc + "/fileindex.folders", "{}");
  EXPECT_EQ(Recorded([] { FolderAdd(Json::Value(), false); }),
            WithoutRoot("504 Cannot load json: " + kEtc + "/fileindex.folders"));
  WriteText(kEtc + "/fileindex.folders", "[" + JsonToString(Record("/p")) + R"(,{"path":"/m"}])");
  EXPECT_TRUE(Recorded([] { FolderMgr(); }).starts_with("120 Missing property: "));
}

TEST_F(IndexMgr, ListsAndSumsUp) {
  Begin({});
  FolderAdd(List(Record("/p", true, "g"), Record("/m", true, "g"), Record("/m/x", true, "h"),
                 Record("/p/y", true, "h"), Record("/p/a"), Record("/m/@eaDir/x", true, "i")),
            /*updater_mode=*/true);
  Json::Value result;
  vexlo::fileindex::FolderList(result, 1, 1, "path", "DESC", "", "p", List("status"));
  EXPECT_EQ(result["total"].asUInt(), 3U);
  EXPECT_EQ(result["folder"][0]["path"], "/p/a");
  EXPECT_EQ(result["folder"][0]["additional"]["status"]["text"], "finished");
  EXPECT_EQ(
      Recorded([&] { vexlo::fileindex::FolderList(result, 0, 0, "", "", "", "", List("size")); }),
      "120 Unknown additioal: size");
  // "need_reindex" and "processing" each prevail over the other that came before.
  std::filesystem::create_directories(kRoot / "v/m/x");
  std::filesystem::create_directories(kRoot / "v/p/y");
  StatusMgr().SetShareStatus("p", 1);
  WriteText(SDKShare("m").GetQueuePath() + ".tmp",
            R"({"event":8,"path":")" + kRoot / "v/m/x/f" + "\"}");
  EXPECT_EQ(vexlo::fileindex::GetIndexProcessingStatus(), "processing");
  vexlo::fileindex::FolderSummary(result);
  EXPECT_EQ(JsonToString(result), R"({"items":[{"name":"/p/a","text":"need_reindex"},)"
                                  R"({"group":true,"name":"g","text":"processing"},)"
                                  R"({"group":true,"name":"h","text":"need_reindex"},)"
                                  R"({"group":true,"name":"i","text":"error"}],"status":"error"})");
  for (const auto& [resume_time, want] :
       {std::pair{"0", "paused"}, {"4000000000", "paused"}, {"1", "processing"}}) {
    WriteText(kEtc + "/fileindex.status", R"({"resume_time":)" + std::string(resume_time) + "}");
    EXPECT_EQ(vexlo::fileindex::GetIndexProcessingStatus(), want);
    vexlo::fileindex::FolderList(result, 0, 0, "", "", "", "/m/x", List("status"));
    EXPECT_EQ(result["folder"][0]["additional"]["status"]["text"], want);
  }
  kRoot.SetShares(R"({"name": "p", "path": ")" + kRoot / "v/p" + R"("}, {"name": "m", "path": ")" +
                  kRoot / "v/m" + R"(", "read_only": true})");
  EXPECT_EQ(vexlo::fileindex::GetIndexProcessingStatus(), "finished");
  SetShares();
}

TEST_F(IndexMgr, LosesNoUpdateOfTwoProcesses) {
  Begin({"/p"});
  constexpr int kChildren = 2;
  constexpr int kRounds = 30;
  for (int child = 0; child < kChildren; ++child) {
    if (fork() == 0) {
      const std::string stem = "/p/" + std::to_string(child) + "-";
      std::string error;
      for (int round = 0; round < kRounds && error.empty(); ++round) {
        const std::string path = stem + std::to_string(round);
        error = Recorded([&] { FolderAdd(List(Record(path)), /*updater_mode=*/true); });
        if (error.empty() && round % 10 != 0) {
          error = Recorded([&] { FolderDelete(List(path)); });
        }
      }
      fputs(error.c_str(), stderr);
      _exit(error.empty() ? 0 : 1);
    }
  }
  int status = 0;
  int left = kChildren;
  while (left > 0) {
    left -= waitpid(-1, &status, WNOHANG) > 0 ? 1 : 0;
    EXPECT_EQ(status, 0);
    EXPECT_TRUE(FolderMgr().HasFolder("/p"));
  }
  const std::string world = World();
  EXPECT_EQ(FolderMgr().GetFolders().size(), 1U + kChildren * kRounds / 10) << world;
  EXPECT_EQ(kavo::local::ReadMonitorQueues().queues.at(0).folders.size(),
            FolderMgr().GetFolders().size());
}

}  // namespace
