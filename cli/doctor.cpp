#include "cli/doctor.h"

#include <json/value.h>
#include <sys/stat.h>
#include <sys/statvfs.h>
#include <unistd.h>

#include <algorithm>
#include <cerrno>
#include <charconv>
#include <ctime>
#include <filesystem>
#include <initializer_list>
#include <iterator>
#include <map>
#include <memory>
#include <optional>
#include <set>
#include <string_view>
#include <system_error>
#include <utility>

#include "cli/config_check.h"
#include "cli/daemon_stats.h"
#include "cli/quarantine_list.h"
#include "cli/shares.h"
#include "cli/text.h"
#include "common/error.h"
#include "common/file.h"
#include "common/json.h"
#include "common/sdk/share.h"
#include "common/string.h"
#include "fileindex/elastic_control/share_index.h"
#include "fileindex/folder_mgr.h"
#include "fileindex/paths.h"
#include "fileindex/status_mgr.h"
#include "fileindex/util/path_policy.h"
#include "kavo/local/content.h"
#include "kavo/local/monitor_queues.h"
#include "kavo/local/shares.h"

namespace vexlo::cli {
namespace {

using fileindex::FixedPath;

constexpr FixedPath kRunFolder("/var/run");
constexpr FixedPath kLockFolder("/tmp");
constexpr FixedPath kNotifySocket("/var/run/evnotifyd.sock");

// Where the daemons and this tool keep what they know.
constexpr FixedPath kStateFolders[] = {
    kRunFolder,
    kLockFolder,
    FixedPath("/etc/kavo"),
    FixedPath("/var/packages/Vexlo/etc"),
    FixedPath("/var/lib/kavo/elastic"),
    FixedPath("/var/lib/kavo/evnotify"),
    FixedPath("/var/lib/kavo/extract"),
    FixedPath("/var/lib/kavo/fileindex"),
    FixedPath("/var/lib/kavo/fileindex/db"),
    FixedPath("/var/lib/kavo/fileindex/queue"),
    FixedPath("/var/lib/kavo/fileindexd"),
};
constexpr FixedPath kLockFiles[] = {
    fileindex::kFileIndexFoldersLockPath,
    fileindex::kFileIndexStatusLockPath,
    FixedPath("/etc/kavo/shares.json.lock"),
};

constexpr uint64_t kLeastFree = uint64_t{100} << 20;  // Below it nothing is indexed.
constexpr uint64_t kLittleFree = uint64_t{1} << 30;
constexpr uint64_t kFewWatches = 8192;          // More that a tree may want at any time.
constexpr uint64_t kUsualQueuedEvents = 16384;  // The kernel's own default.
constexpr uint64_t kWantedQueuedEvents = 131072;
constexpr uint64_t kSpareInstances = 8;  // For everybody else's programs.
constexpr int64_t kFuture = 3600;        // Seconds that a clock may be ahead.
constexpr size_t kMostNamed = 3;

constexpr int kIndexMissing = 2002;

std::string Join(std::initializer_list<std::string_view> parts) {
  std::string text;
  for (const std::string_view part : parts) {
    text += part;
  }
  return text;
}

std::string Mebibytes(uint64_t bytes) { return Grouped(bytes >> 20) + " MiB"; }

// A number of the kernel's, 0 when it is not told.
uint64_t ReadLimit(const std::string& name) {
  std::string text;
  uint64_t number = 0;
  if (ReadFile(text, "/proc/sys/fs/inotify/" + name)) {
    std::from_chars(text.data(), text.data() + text.size(), number);
  }
  return number;
}

std::string SetLimit(const std::string& name, uint64_t value) {
  return "sudo sysctl fs.inotify." + name + "=" + std::to_string(value);
}

// The program that stands beside this one, or what the shell finds under its name.
std::string StartCommand(const std::string& program) {
  std::error_code ignored;
  const auto self = std::filesystem::read_symlink("/proc/self/exe", ignored);
  const auto beside = self.parent_path() / program;
  return (!ignored && access(beside.c_str(), X_OK) == 0 ? ForShell(beside.string()) : program) +
         " &";
}

class Examination {
 public:
  std::vector<Finding> Run() {
    const std::pair<const char*, void (Examination::*)()> steps[] = {
        {"config", &Examination::LookAtConfig},
        {"state", &Examination::LookAtPermissions},
        {"kavoelasticd", &Examination::LookAtEngine},
        {"fileindexd", &Examination::LookAtIndexDaemon},
        {"evnotifyd", &Examination::LookAtNotifyDaemon},
        {"kavocontentextractd", &Examination::LookAtExtractor},
        {"inotify", &Examination::LookAtInotify},
        {"mounts", &Examination::LookAtMounts},
        {"space", &Examination::LookAtSpace},
        {"shares", &Examination::LookAtStatus},
        {"clock", &Examination::LookAtDates},
    };
    for (const auto& [subject, step] : steps) {
      subject_ = subject;
      const size_t before = findings_.size();
      try {
        (this->*step)();
      } catch (const std::exception& error) {
        Add(Severity::kError, std::string("cannot be looked at: ") + error.what());
      }
      const auto begin = findings_.begin() + static_cast<ptrdiff_t>(before);
      std::stable_sort(begin, findings_.end(),
                       [](const Finding& a, const Finding& b) { return a.severity > b.severity; });
    }
    return std::move(findings_);
  }

 private:
  void Add(Severity severity, std::string what, std::string remedy = "") {
    findings_.push_back({severity, subject_, std::move(what), std::move(remedy)});
  }

  void LookAtConfig();
  void LookAtPermissions();
  void LookAtSockets();
  void LookAtEngine();
  void LookAtIndexDaemon();
  void LookAtNotifyDaemon();
  void LookAtExtractor();
  void LookAtInotify();
  void LookAtMounts();
  void LookAtSpace();
  void LookAtStatus();
  void LookAtDates();

  std::optional<Json::Value> AskOne(const std::string& socket, const std::string& request,
                                    Severity severity, const std::string& effect);
  bool CanUseFolder(const std::string& path, std::vector<std::string>& foreign);
  bool CanUseLock(const std::string& path);
  void LookAtVolume(const std::string& path, const std::string& of);

  const char* subject_ = "";
  std::vector<Finding> findings_;
  // What the steps before found; null where they could not.
  std::unique_ptr<fileindex::FolderMgr> folders_;
  std::set<std::string> shares_;  // Indexed and there.
  std::optional<Json::Value> notify_stats_;
  bool engine_answers_ = false;
};

void Examination::LookAtConfig() {
  size_t count = 0;
  for (const auto& [file, place, what] : CheckConfig(count)) {
    const bool is_gone_share = what.starts_with("there is no share '");
    Add(Severity::kError, Join({file, place.empty() ? "" : ": ", place, ": ", what}),
        is_gone_share ? "fileindex folder prune" : "${EDITOR:-vi} " + ForShell(file));
  }
  try {
    folders_ = std::make_unique<fileindex::FolderMgr>();
    const std::set<std::string> known = ShareNames();
    for (const std::string& share : folders_->GetIndexedShares()) {
      if (known.contains(share)) {
        shares_.insert(share);
      }
    }
  } catch (const Error&) {
    return;  // Told above.
  }
  Add(Severity::kOk, Counted(count, "folder") + " of " + Counted(shares_.size(), "share") +
                         (count == 1 ? " is" : " are") + " configured");
}

// Whether the folder can be used, or its owner is to be asked: that one's is put with `foreign`.
bool Examination::CanUseFolder(const std::string& path, std::vector<std::string>& foreign) {
  struct stat info {};
  const bool is_there = stat(path.c_str(), &info) == 0;
  if (is_there && !S_ISDIR(info.st_mode)) {
    Add(Severity::kError, "'" + path + "' is no folder",
        "mv " + ForShell(path) + " " + ForShell(path + ".old"));
    return false;
  }
  if (is_there && access(path.c_str(), R_OK | W_OK | X_OK) == 0) {
    return true;
  }
  const int error = errno;
  if (error == ENOENT) {
    // The others are made by whoever needs them.
    if (path == kLockFolder.Get()) {
      Add(Severity::kError, "'" + path + "' is missing, and holds the locks",
          "mkdir -p " + ForShell(path));
    }
  } else if (error == EACCES && (!is_there || info.st_uid != geteuid())) {
    foreign.push_back(ForShell(path));
  } else {
    Add(Severity::kError,
        Join({"'", path, "' cannot be written: ", std::generic_category().message(error)}),
        error == EACCES ? "chmod u+rwx " + ForShell(path) : "");
  }
  return false;
}

bool Examination::CanUseLock(const std::string& path) {
  struct stat info {};
  if (lstat(path.c_str(), &info) != 0) {
    return false;
  }
  const bool is_file = S_ISREG(info.st_mode);
  if (is_file && access(path.c_str(), R_OK) == 0) {
    return true;
  }
  // One that somebody may hold is never removed: another could take the lock beside it then.
  Add(Severity::kError,
      Join({"the lock file '", path, "' of user ", std::to_string(info.st_uid),
            " cannot be opened"}),
      (is_file ? "sudo chmod a+r " : "sudo rm ") + ForShell(path));
  return false;
}

void Examination::LookAtPermissions() {
  std::vector<std::string> foreign;
  const auto folders =
      std::count_if(std::begin(kStateFolders), std::end(kStateFolders),
                    [&](const FixedPath& path) { return CanUseFolder(path.Get(), foreign); });
  if (!foreign.empty()) {
    Add(Severity::kError,
        Counted(foreign.size(), "folder") + " of other users cannot be written, " + foreign[0] +
            (foreign.size() > 1 ? " among them" : "") + ": the service is theirs",
        "sudo fileindex doctor");
  }
  const auto locks = std::count_if(std::begin(kLockFiles), std::end(kLockFiles),
                                   [&](const FixedPath& path) { return CanUseLock(path.Get()); });
  LookAtSockets();
  Add(Severity::kOk, std::to_string(folders + locks) + " folders and locks can be used");
}

void Examination::LookAtSockets() {
  std::map<uid_t, std::string> owners;
  for (const char* const name :
       {"kavoelasticd", "fileindexd", "evnotifyd", "kavocontentextractd"}) {
    struct stat info {};
    const std::string path = kRunFolder.Get() + "/" + name + ".sock";
    if (lstat(path.c_str(), &info) == 0) {
      std::string& names = owners[info.st_uid];
      names.append(names.empty() ? "" : ", ").append(name);
    }
  }
  if (owners.size() < 2) {
    return;
  }
  for (const auto& [owner, names] : owners) {
    Add(Severity::kWarning,
        Join({"the daemons run as different users, and may not reach each other: ", names,
              " as user ", std::to_string(owner)}));
  }
}

// Says what does not work without the daemon when it does not answer.
std::optional<Json::Value> Examination::AskOne(const std::string& socket,
                                               const std::string& request, Severity severity,
                                               const std::string& effect) {
  struct stat info {};
  if (stat(socket.c_str(), &info) == 0 && access(socket.c_str(), W_OK) != 0) {
    Add(Severity::kError,
        "its socket belongs to user " + std::to_string(info.st_uid) +
            " and is closed to this one, so nothing can be told of it",
        "sudo fileindex doctor");
    return std::nullopt;
  }
  std::string reason;
  std::optional<Json::Value> reply = AskDaemon(socket, request, &reason);
  if (!reply) {
    const bool is_listening = !reason.starts_with("nobody answers");
    Add(severity,
        (is_listening ? "runs but gives no answer, " : "does not run, ") + effect + " (" + reason +
            ")",
        is_listening ? "kill $(cat " + ForShell(kRunFolder.Get() + "/" + subject_ + ".pid") + ")"
                     : StartCommand(subject_));
  }
  return reply;
}

void Examination::LookAtEngine() {
  const auto reply = AskOne(fileindex::kElasticdSocketPath.Get(), R"({"command":"index_list"})",
                            Severity::kError, "so nothing is searched or indexed");
  if (!reply) {
    return;
  }
  engine_answers_ = true;
  std::map<std::string, std::string> states;
  for (const Json::Value& index : (*reply)["data"]) {
    states[index["id"].asString()] = index["state"].asString();
  }
  size_t active = 0;
  for (const std::string& share : shares_) {
    const std::string state = states[fileindex::elastic::GetFileIndexID(share)];
    if (state == "active") {
      ++active;
    } else if (state == "paused") {
      Add(Severity::kWarning, "the index of '" + share + "' is paused, so it is not searched",
          "fileindex index resume " + ForShell(share));
    } else if (state.empty()) {
      Add(Severity::kError, "the share '" + share + "' has no index",
          "fileindex index create " + ForShell(share) + " && fileindex folder reindex " +
              ForShell("/" + share));
    } else {
      Add(Severity::kError, Join({"the index of '", share, "' is ", state}),
          "fileindex index delete " + ForShell(share) + " && fileindex folder reindex " +
              ForShell("/" + share));
    }
  }
  Add(Severity::kOk, "listens and answers; " + Grouped(active) +
                         (active == 1 ? " index is active" : " indexes are active"));
}

void Examination::LookAtIndexDaemon() {
  const auto reply =
      AskOne(fileindex::kFileIndexDaemonSocketPath.Get(), R"({"type":"stats","data":null})",
             Severity::kError, "so changes wait in the queues");
  if (!reply) {
    return;
  }
  std::set<std::string> without = shares_;
  for (const Json::Value& worker : (*reply)["shares"]) {
    const std::string share = worker["share"].asString();
    const std::string state = worker["state"].asString();
    without.erase(share);
    if (state == "failing" || state == "unavailable") {
      const std::string reason = worker["last_error"].asString();
      Add(Severity::kError,
          Join({"indexing of '", share, "' is ", state, reason.empty() ? "" : ": ", reason}));
    }
  }
  for (const std::string& share : without) {
    Add(Severity::kError, "nobody works on the indexed share '" + share + "'",
        "fileindex folder reindex " + ForShell("/" + share));
  }
  Add(Severity::kOk, "listens and answers; " + Counted((*reply)["shares"].size(), "worker"));
}

void Examination::LookAtNotifyDaemon() {
  notify_stats_ = AskOne(kNotifySocket.Get(), R"({"command":"stats"})", Severity::kError,
                         "so changes of files go unseen until it is started");
  if (!notify_stats_) {
    return;
  }
  std::vector<std::string> roots;
  for (const Json::Value& queue : (*notify_stats_)["queues"]) {
    for (const Json::Value& root : queue["roots"]) {
      roots.push_back(root.asString());
    }
    if (queue["state"] != "degraded") {
      continue;
    }
    const std::string reason = queue["reason"].asString();
    const bool wants_watches = reason.find("max_user_watches") != std::string::npos;
    const bool wants_instances = reason.find("max_user_instances") != std::string::npos ||
                                 reason.find("inotify cannot be used") != std::string::npos;
    Add(Severity::kWarning,
        "not all changes are seen at once for " + queue["queue"].asString() + ": " + reason,
        wants_watches     ? SetLimit("max_user_watches", 2 * ReadLimit("max_user_watches"))
        : wants_instances ? SetLimit("max_user_instances", 2 * ReadLimit("max_user_instances"))
                          : "");
  }
  if (folders_ != nullptr) {
    for (const auto& folder : folders_->GetFolders()) {
      if (!shares_.contains(folder->GetShare())) {
        continue;
      }
      const std::string path = folder->GetFullPath();
      if (std::none_of(roots.begin(), roots.end(),
                       [&](const std::string& root) { return IsSameOrBelow(path, root); })) {
        Add(Severity::kError, "nobody watches the indexed folder '" + path + "'",
            "fileindex folder set " + ForShell(folder->GetPath()));
      }
    }
  }
  for (const auto& [app, reason] : kavo::local::ReadMonitorQueues().unreadable) {
    Add(Severity::kError, Join({"the registrations of '", app, "' cannot be used: ", reason}));
  }
  Add(Severity::kOk, "listens and answers; " + Counted(roots.size(), "folder") + " watched");
}

void Examination::LookAtExtractor() {
  const auto reply =
      AskOne(kavo::local::ContentSocket(), R"({"command":"stats"})", Severity::kWarning,
             "so of all but plain texts the content is not indexed");
  const QuarantineList quarantine = ReadQuarantine();
  const uint64_t count =
      reply ? (*reply)["quarantined"].asUInt64() : uint64_t{quarantine.files.size()};
  if (!quarantine.files.empty() || (!quarantine.fault.empty() && count > 0)) {
    Add(Severity::kWarning,
        Counted(quarantine.fault.empty() ? quarantine.files.size() : count, "file") +
            " ended the processes that read them, and are left alone until they change",
        "fileindex failed");
  }
  if (!quarantine.fault.empty()) {
    Add(Severity::kWarning, "the list of quarantined files is not known: " + quarantine.fault);
  }
  if (reply) {
    Add(Severity::kOk, "listens and answers; " + Counted((*reply)["files"].asUInt64(), "file") +
                           " asked for, " + Counted((*reply)["deaths"].asUInt64(), "worker") +
                           " lost");
  }
}

void Examination::LookAtInotify() {
  const uint64_t most = ReadLimit("max_user_watches");
  const uint64_t instances = ReadLimit("max_user_instances");
  const uint64_t events = ReadLimit("max_queued_events");
  uint64_t watches = 0;
  uint64_t queues = 0;
  uint64_t overflows = 0;
  if (notify_stats_) {
    for (const Json::Value& queue : (*notify_stats_)["queues"]) {
      watches += queue["watches"].asUInt64();
      overflows += queue["overflows"].asUInt64();
      ++queues;
    }
  }
  const size_t before = findings_.size();
  if (watches + std::max(kFewWatches, watches / 4) > most) {
    Add(Severity::kWarning,
        Grouped(watches) + " folders are watched of " + Grouped(most) +
            " that all programs of a user may watch (max_user_watches)",
        SetLimit("max_user_watches", 2 * (watches + kFewWatches)));
  }
  if (queues + kSpareInstances > instances) {
    Add(Severity::kWarning,
        Counted(queues, "queue") + " and " + Grouped(instances) +
            " inotify instances for all programs of a user (max_user_instances)",
        SetLimit("max_user_instances", 2 * (queues + 2 * kSpareInstances)));
  }
  if (events < kUsualQueuedEvents || overflows > 0) {
    Add(Severity::kWarning,
        (overflows > 0 ? "events were lost " + Counted(overflows, "time") +
                             " and shares compared "
                             "as a whole: "
                       : "") +
            "the kernel keeps " + Grouped(events) + " events (max_queued_events)",
        SetLimit("max_queued_events", std::max(kWantedQueuedEvents, 2 * events)));
  }
  if (findings_.size() == before) {
    Add(Severity::kOk, Grouped(watches) + " of " + Grouped(most) + " watches are used, " +
                           Grouped(instances) + " instances and " + Grouped(events) +
                           " queued events allowed");
  }
}

void Examination::LookAtMounts() {
  if (folders_ == nullptr) {
    return;
  }
  size_t well = 0;
  for (const auto& folder : folders_->GetFolders()) {
    if (!shares_.contains(folder->GetShare())) {
      continue;
    }
    const std::string path = folder->GetFullPath();
    bool is_well = true;
    // Of one that is not there nothing else can be told, and that is told above.
    for (const fileindex::RuleVerdict& verdict : fileindex::ExplainFullPath(path)) {
      const std::string_view rule = verdict.rule;
      if (verdict.answer == fileindex::RuleVerdict::kRefuses && access(path.c_str(), F_OK) == 0 &&
          (rule == "file_system" || rule == "mount_point" || rule == "snapshot")) {
        is_well = false;
        Add(Severity::kError, "'" + path + "' is not indexed: " + verdict.reason,
            "fileindex folder delete " + ForShell(folder->GetPath()));
      }
    }
    well += is_well ? 1 : 0;
  }
  Add(Severity::kOk, Counted(well, "folder") + " on file systems that are indexed");
}

void Examination::LookAtVolume(const std::string& path, const std::string& of) {
  std::filesystem::path there = path;
  struct statvfs info {};
  while (statvfs(there.c_str(), &info) != 0 && there.has_relative_path()) {
    there = there.parent_path();
  }
  const uint64_t free = uint64_t{info.f_bavail} * info.f_frsize;
  const bool lacks_inodes = info.f_files > 0 && info.f_favail < 1000;
  const Severity severity = free < kLeastFree || lacks_inodes ? Severity::kError
                            : free < kLittleFree              ? Severity::kWarning
                                                              : Severity::kOk;
  Add(severity,
      Mebibytes(free) + " are free for " + of + " in '" + path + "'" +
          (lacks_inodes ? ", and " + Counted(info.f_favail, "inode") : ""),
      severity == Severity::kOk ? "" : "df -h " + ForShell(there.string()));
}

void Examination::LookAtSpace() {
  LookAtVolume(kavo::local::Root() + "/var/lib/kavo/fileindex/queue", "the queues");
  std::set<std::string> seen;
  for (const std::string& share : shares_) {
    const std::string folder = Dirname(sdk::SDKShare(share).GetDBPath());
    if (seen.insert(folder).second) {
      LookAtVolume(folder, "the index");
    }
  }
}

void Examination::LookAtStatus() {
  const fileindex::StatusMgr status;
  for (const std::string& share : shares_) {
    const unsigned bits = status.GetShareStatus(share);
    if (bits != 0) {
      Add(Severity::kWarning,
          "'" + share + "' is marked " +
              ((bits & fileindex::SS_NEED_REBUILD) != 0 ? "to be built anew"
                                                        : "for a reindex, as a change was lost"),
          "fileindex folder reindex " + ForShell("/" + share));
    }
    const sdk::SDKShare asked(share);
    if (IsDirExist(asked.GetPath(), /*follow_link=*/false) && !asked.CanBeIndexed()) {
      Add(Severity::kError, "'" + share + "' is " +
                                (asked.IsLocked() ? "locked by encryption" : "read-only") +
                                ", so its index rests");
    }
  }
  const long resume_time = status.GetPauseInfo();
  if (resume_time == 0) {
    Add(Severity::kWarning, "indexing is paused without an end", "fileindex resume");
  } else if (resume_time > time(nullptr)) {
    Add(Severity::kOk, "indexing is paused for " +
                           Counted(static_cast<uint64_t>(resume_time - time(nullptr)), "second"));
  } else {
    Add(Severity::kOk, "indexing is not paused");
  }
}

// Files that are newer than now are found first by every search for new ones.
void Examination::LookAtDates() {
  if (!engine_answers_ || shares_.empty()) {
    return;
  }
  Json::Value request;
  request["command"] = "search";
  for (const std::string& share : shares_) {
    request["data"]["ids"].append(fileindex::elastic::GetFileIndexID(share));
  }
  request["data"]["modified_min"] = Json::Int64{time(nullptr) + kFuture};
  request["data"]["size"] = static_cast<Json::UInt>(kMostNamed);
  request["data"]["sort"] = "modified";
  request["data"]["descending"] = true;
  std::string reason;
  const auto reply =
      AskDaemon(fileindex::kElasticdSocketPath.Get(), JsonToString(request), &reason);
  if (!reply || !(*reply)["success"].asBool()) {
    const int code = reply ? (*reply)["error"]["code"].asInt() : 0;
    if (code != kIndexMissing) {  // Told above.
      Add(Severity::kWarning,
          "the dates of files cannot be asked for" + (reason.empty() ? "" : ": " + reason));
    }
    return;
  }
  const uint64_t total = (*reply)["total"].asUInt64();
  if (total == 0) {
    Add(Severity::kOk, "no file is of the future");
    return;
  }
  std::string paths;
  for (const Json::Value& hit : (*reply)["data"]) {
    paths += (paths.empty() ? "" : " ") + ForShell(hit["path"].asString());
  }
  Add(Severity::kWarning,
      Counted(total, "file") + (total == 1 ? " is" : " are") +
          " dated in the future: the clock of this machine or of another one is wrong",
      "touch -c " + paths);
}

}  // namespace

const char* NameOf(Severity severity) {
  switch (severity) {
    case Severity::kOk:
      return "ok";
    case Severity::kWarning:
      return "warning";
    case Severity::kError:
      break;
  }
  return "error";
}

std::vector<Finding> Diagnose() { return Examination().Run(); }

}  // namespace vexlo::cli
