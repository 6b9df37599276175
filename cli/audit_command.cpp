// "fileindex audit": whether the index says what is on the disk.
#include <json/value.h>

#include <algorithm>
#include <charconv>
#include <chrono>
#include <map>
#include <optional>
#include <set>
#include <system_error>
#include <thread>
#include <utility>

#include "cli/audit.h"
#include "cli/audit_scope.h"
#include "cli/command.h"
#include "cli/daemon_stats.h"
#include "cli/engine.h"
#include "cli/folder_paths.h"
#include "cli/repair.h"
#include "cli/service.h"
#include "cli/shares.h"
#include "cli/text.h"
#include "common/error.h"
#include "common/json.h"
#include "common/sdk/share.h"
#include "common/string.h"
#include "fileindex/folder_mgr.h"
#include "fileindex/util/share_path.h"

namespace vexlo::cli {
namespace {

constexpr int kDefaultGrace = 3;
constexpr int kLongestGrace = 86400;
constexpr unsigned kMostSaid = 10;  // Paths that could not be looked at.
constexpr std::chrono::milliseconds kAskAgain(100);
// How long a worker may fail before nobody waits for it.
constexpr std::chrono::seconds kFailingPatience(30);

// The engine's answers for an index that cannot be listed.
constexpr int kNoIndex = 2002;
constexpr int kPausedIndex = 2004;
constexpr int kDamagedIndex = 2005;

// A share, and the folders of it that are compared; "" for all of it.
using Targets = std::map<std::string, std::set<std::string>>;

int ReadGrace(const Arguments& arguments) {
  if (!arguments.Has("--grace")) {
    return kDefaultGrace;
  }
  const std::string text = arguments.Get("--grace");
  int seconds = 0;
  const auto [end, error] = std::from_chars(text.data(), text.data() + text.size(), seconds);
  if (error != std::errc() || end != text.data() + text.size() || seconds < 0 ||
      seconds > kLongestGrace) {
    throw UsageError("'" + text + "' is no number of seconds from 0 to " +
                     std::to_string(kLongestGrace));
  }
  return seconds;
}

std::set<std::string> IndexedShares() {
  try {
    return fileindex::FolderMgr().GetIndexedShares();
  } catch (const Error& error) {
    throw Failure("the list of folders cannot be loaded: " + CauseOf(error.what()) +
                  "; 'fileindex config check' says more");
  }
}

Targets ReadTargets(const Arguments& arguments) {
  CheckSharesFile();
  const std::set<std::string> indexed = IndexedShares();
  if (indexed.empty()) {
    throw Failure("no folder is indexed; 'fileindex folder add' adds one");
  }
  Targets targets;
  for (const std::string& named : arguments.positional) {
    const std::string path = ToSharePath(named);
    const std::string share = fileindex::GetShareNameByPath(path);
    if (!indexed.contains(share)) {
      throw Failure("no folder of the share of '" + ForTerminal(named) +
                    "' is indexed; 'fileindex folder list' lists them");
    }
    const std::string below = path.substr(share.size() + 1);
    targets[share].insert(below.empty() ? "" : fileindex::GetFullPath(path));
  }
  if (arguments.positional.empty()) {
    for (const std::string& share : indexed) {
      targets[share].insert("");
    }
  }
  // What lies in another one is compared with that.
  for (auto& [share, roots] : targets) {
    const std::set<std::string> all = roots;
    std::erase_if(roots, [&](const std::string& root) {
      return std::any_of(all.begin(), all.end(), [&](const std::string& other) {
        return other != root && (other.empty() || IsSameOrBelow(root, other));
      });
    });
  }
  return targets;
}

// What has the index of a share built anew: that it is gone is not noticed before something is
// queued for the share.
std::string Rebuild(const std::string& share) {
  return "fileindex index delete " + ForShell(share) + " && fileindex folder reindex " +
         ForShell("/" + share);
}

std::string ExplainIndexError(const Error& error, const std::string& share) {
  switch (static_cast<int>(error.GetErrorCode())) {
    case kNoIndex:
      return "the share has no index; 'fileindex folder reindex " + ForShell("/" + share) +
             "' has fileindexd make it";
    case kPausedIndex:
      return "its index is paused; 'fileindex index resume " + share + "' goes on";
    case kDamagedIndex:
      return "its index is damaged; '" + Rebuild(share) + "' has fileindexd build it anew";
    default:
      ExplainEngineError(error);
      return error.what();
  }
}

class AuditRun {
 public:
  AuditRun(const Arguments& arguments, const Console& console)
      : console_(console),
        as_json_(arguments.Has("--json")),
        grace_(ReadGrace(arguments)),
        targets_(ReadTargets(arguments)) {}

  // Compares everything. With `repairs`, what mends each share's differences goes there.
  void Compare(bool is_left, std::vector<std::pair<std::string, std::vector<Repair>>>* repairs);
  ExitStatus RunRepair();
  ExitStatus Status() const {
    return !failed_.empty() ? kFailed : counts_.Differences() > 0 ? kNothingFound : kDone;
  }
  void Summarize() const;

 private:
  void Report(const std::string& share, Difference difference, const std::string& path,
              bool is_left);
  void CompareShare(const std::string& share, bool is_left, std::vector<Repair>* repairs);
  using FailingSince = std::map<std::string, std::chrono::steady_clock::time_point>;
  bool IsDone(const std::string& share, const Json::Value& workers, FailingSince& failing);
  bool Await(std::set<std::string> shares);

  const Console& console_;
  const bool as_json_;
  const int grace_;
  const Targets targets_;
  std::map<std::string, AuditScope> scopes_;
  AuditCounts counts_;
  std::set<std::string> failed_;  // Shares.
  std::set<std::string> waiting_;
};

void AuditRun::Report(const std::string& share, Difference difference, const std::string& path,
                      bool is_left) {
  if (!as_json_) {
    console_.out << (is_left ? "still " : "") << NameOf(difference) << " " << ForTerminal(path)
                 << "\n";
    return;
  }
  Json::Value line;
  line["difference"] = NameOf(difference);
  line["path"] = path;
  line["share"] = share;
  if (is_left) {
    line["after_repair"] = true;
  }
  console_.out << JsonToString(line) << "\n";
}

void AuditRun::CompareShare(const std::string& share, bool is_left, std::vector<Repair>* repairs) {
  // Anew each time: settings may have changed while the repair was awaited.
  scopes_.erase(share);
  const AuditScope& scope = scopes_.emplace(share, share).first->second;
  for (const std::string& root : targets_.at(share)) {
    std::optional<Repair> repair;
    if (repairs != nullptr) {
      repair.emplace(scope, root);
    }
    AuditDeeds deeds;
    deeds.report = [&](Difference difference, const std::string& path, bool is_there) {
      Report(share, difference, path, is_left);
      if (repair) {
        repair->Add(difference, path, is_there);
      }
    };
    deeds.unknown = [this, said = 0U](const std::string& path, int error) mutable {
      if (++said <= kMostSaid) {
        console_.err << "not looked at: " << ForTerminal(path) << ": "
                     << std::generic_category().message(error) << "\n";
      }
    };
    counts_ += Audit(scope, root, grace_, deeds);
    if (repair) {
      repairs->push_back(*std::move(repair));
    }
  }
  if (scope.HasWaitingChanges()) {
    waiting_.insert(share);
  }
}

void AuditRun::Compare(bool is_left,
                       std::vector<std::pair<std::string, std::vector<Repair>>>* repairs) {
  RequireEngine();
  counts_ = AuditCounts();
  failed_.clear();
  waiting_.clear();
  for (const auto& [share, roots] : targets_) {
    std::vector<Repair> of_share;
    try {
      try {
        CompareShare(share, is_left, repairs == nullptr ? nullptr : &of_share);
      } catch (const Error& error) {
        throw Failure(ExplainIndexError(error, share));
      }
    } catch (const Failure& failure) {
      failed_.insert(share);
      console_.err << "not compared: the share '" << ForTerminal(share)
                   << "': " << ForTerminal(failure.what()) << "\n";
    }
    if (repairs != nullptr && !of_share.empty()) {
      repairs->emplace_back(share, std::move(of_share));
    }
  }
  console_.out.flush();
}

void AuditRun::Summarize() const {
  console_.err << Grouped(counts_.missing) << " missing, " << Counted(counts_.ghost, "ghost")
               << ", " << Grouped(counts_.stale) << " stale; " << Counted(counts_.files, "path")
               << " on the disk, " << Counted(counts_.documents, "document") << " in "
               << (targets_.size() - failed_.size() == 1
                       ? "1 index"
                       : Grouped(targets_.size() - failed_.size()) + " indexes")
               << "\n";
  if (counts_.unknown > 0) {
    console_.err << Counted(counts_.unknown, "folder or file")
                 << " could not be looked at; nothing below counts as a ghost\n";
  }
  if (!waiting_.empty()) {
    console_.err << Counted(waiting_.size(), "share")
                 << (waiting_.size() == 1 ? " still has" : " still have")
                 << " changes waiting to be indexed\n";
  }
}

// Whether the share's changes are in the index. Throws Failure when there is no use in waiting.
bool AuditRun::IsDone(const std::string& share, const Json::Value& workers, FailingSince& failing) {
  const auto worker = std::find_if(workers.begin(), workers.end(),
                                   [&](const Json::Value& one) { return one["share"] == share; });
  if (worker == workers.end()) {
    throw Failure("fileindexd has no worker for '" + share + "'");
  }
  const std::string state = (*worker)["state"].asString();
  const std::string where = "indexing of '" + share + "' is " + state;
  if (state == "paused") {
    throw Failure(where + "; 'fileindex resume' goes on");
  }
  if (state == "unavailable") {
    throw Failure(where);
  }
  if (state != "failing") {
    failing.erase(share);
  } else {
    const auto now = std::chrono::steady_clock::now();
    if (now - failing.try_emplace(share, now).first->second > kFailingPatience) {
      throw Failure(where + ": " + (*worker)["last_error"].asString());
    }
  }
  return state == "idle" && (*worker)["queue_bytes"].asUInt64() == 0 &&
         !scopes_.at(share).HasWaitingChanges();
}

// False when there is no use in waiting; that is said.
bool AuditRun::Await(std::set<std::string> shares) {
  FailingSince failing;
  try {
    while (!shares.empty()) {
      const std::optional<Json::Value> stats = IndexDaemonStats();
      if (!stats) {
        throw Failure(NoIndexDaemon());
      }
      std::erase_if(shares, [&](const std::string& share) {
        return IsDone(share, (*stats)["shares"], failing);
      });
      if (!shares.empty()) {
        std::this_thread::sleep_for(kAskAgain);
      }
    }
    return true;
  } catch (const Failure& failure) {
    console_.err << ForTerminal(failure.what()) << "; what was queued waits\n";
    return false;
  }
}

ExitStatus AuditRun::RunRepair() {
  std::vector<std::pair<std::string, std::vector<Repair>>> repairs;
  Compare(/*is_left=*/false, &repairs);
  Summarize();
  if (counts_.Differences() == 0) {
    return Status();
  }
  const bool had_failed = !failed_.empty();
  std::set<std::string> queued;
  size_t lines = 0;
  for (const auto& [share, of_share] : repairs) {
    for (const Repair& repair : of_share) {
      const size_t count = repair.Queue();
      lines += count;
      if (count > 0) {
        queued.insert(share);
      }
      if (repair.Strays() > 0) {
        console_.err << Counted(repair.Strays(), "document") << " of '" << ForTerminal(share)
                     << "' lie outside of the share: '" << Rebuild(share)
                     << "' has fileindexd build the index anew\n";
      }
    }
  }
  console_.err << "queued: " << Counted(lines, "line") << " for " << Counted(queued.size(), "share")
               << "\n";
  if (!Await(queued)) {
    return had_failed ? kFailed : kNothingFound;
  }
  Compare(/*is_left=*/true, nullptr);
  console_.err << "after the repair: ";
  Summarize();
  return Status();
}

ExitStatus RunAudit(const Arguments& arguments, const Console& console) {
  AuditRun run(arguments, console);
  if (arguments.Has("--repair")) {
    return run.RunRepair();
  }
  run.Compare(/*is_left=*/false, nullptr);
  run.Summarize();
  return run.Status();
}

}  // namespace

std::vector<Command> AuditCommands() {
  return {
      {"audit",
       "[FOLDER...]",
       "compares the index with the disk",
       "Walks the shares of all indexed folders, or the FOLDERs, and prints a line for each\n"
       "difference: \"missing\" for what is on the disk and not in the index, \"ghost\" for what "
       "is\n"
       "in the index and not on the disk, or not to be indexed, \"stale\" for what was indexed in\n"
       "another state. Control characters of names are shown as \\012.\n"
       "\n"
       "With --repair the changes are queued for the index daemon, waited for while it runs, and\n"
       "everything is compared again; what is left is printed with \"still\" before it.\n"
       "\n"
       "Exit status 0 when they are equal, 1 when they differ, 3 when some share could not be\n"
       "compared.\n"
       "\n"
       "  fileindex audit /volume1/photo/2019\n"
       "  fileindex audit --json | jq -r 'select(.difference == \"missing\").path'\n",
       {{"--repair", nullptr, "queue what makes it right, and compare again"},
        {"--json", nullptr, "one JSON object a line: difference, path, share"},
        {"--grace", "SECONDS", "how old a change is before it counts as stale (3)"}},
       {},
       0,
       SIZE_MAX,
       RunAudit},
  };
}

}  // namespace vexlo::cli
