#include "fileindex/util/path_policy.h"

#include <algorithm>
#include <cerrno>
#include <climits>
#include <cstdlib>
#include <cstring>
#include <optional>
#include <string_view>

#include "common/error.h"
#include "common/sdk/share.h"
#include "fileindex/util/share_path.h"
#include "kavo/filesystem.h"
#include "kavo/share.h"

namespace vexlo::fileindex {
namespace {

constexpr std::string_view kPreservedNames[] = {
    ".KAVOPPSDB",                    // The platform's own hidden database.
    ".TemporaryItems",               // Clients' temporary items,
    ".Spotlight-V100",               // search index,
    ".DocumentRevisions-V100",       // document versions,
    ".HFS+ Private Directory Data",  // hard-link store of an HFS+ volume,
    ".Trashes",                      // trash
    ".fseventsd",                    // and event log.
    ".Maildir",
    ".git",
    ".DS_Store",  // How a client shows the folder.
    "Thumbs.db",
};

constexpr char kSnapshotName[] = "#snapshot";
constexpr char kRecycleName[] = "#recycle";
constexpr char kHomesShare[] = "homes";
constexpr int kHomeRecycleKind = 11;
constexpr int kRefusedFsType = 12;

bool IsInRecycleBin(const std::string& full_path, const std::string& share_name) {
  return (full_path.find(kRecycleName) != std::string::npos &&
          KAVOShareIsShareRecycle(full_path.c_str()) == 1) ||
         (share_name == kHomesShare &&
          KAVORecycleUserHomePathIsExist(full_path.c_str(), kHomeRecycleKind) == 1);
}

// A path on its way through the rules, with what they have in common. Its share is looked up when
// the first rule asks for it: a path that is refused before may lie in none.
class Question {
 public:
  explicit Question(const std::string& full_path) : full_path_(full_path) {}

  const std::string& FullPath() const { return full_path_; }
  const std::string& ShareName() {
    if (share_name_.empty()) {
      std::string share_dir;
      GetShareNamePathByFullPath(share_name_, share_dir, full_path_);
    }
    return share_name_;
  }
  bool HasShare() const { return !share_name_.empty(); }
  const sdk::SDKShare& Share() {
    if (!share_.has_value()) {
      share_.emplace(ShareName());
    }
    return *share_;
  }

 private:
  const std::string& full_path_;
  std::string share_name_;
  std::optional<sdk::SDKShare> share_;
};

// A rule tells whether it refuses the path, and with `reason` not null puts its answer into words.
using Refuses = bool (*)(Question& question, std::string* reason);

// Returns `refused`; the words are only made up for those who want them.
template <typename IfRefused, typename IfPassed>
bool Answer(bool refused, std::string* reason, const IfRefused& if_refused,
            const IfPassed& if_passed) {
  if (reason != nullptr) {
    *reason = refused ? std::string(if_refused()) : std::string(if_passed());
  }
  return refused;
}

bool RefusesSnapshot(Question& question, std::string* reason) {
  int is_inside = 0;
  const bool is_named = question.FullPath().find(kSnapshotName) != std::string::npos;
  const bool refused = is_named &&
                       KLIBFhsPathInSnapshot(question.FullPath().c_str(), &is_inside) == 0 &&
                       is_inside == 1;
  return Answer(
      refused, reason, [] { return "the path lies in a snapshot"; },
      [&] {
        return is_named ? "the path holds \"#snapshot\" but lies in no snapshot"
                        : "the path does not hold \"#snapshot\"";
      });
}

bool RefusesFileSystem(Question& question, std::string* reason) {
  const int type = KAVOGetFSType(question.FullPath().c_str(), 0);
  const int error = errno;
  const bool is_remote = type >= 0 && KAVOFSIsRemoteFS(type) != 0;
  const bool is_image = type >= 0 && KAVOFSIsImageFS(type) != 0;
  return Answer(
      type < 0 || is_remote || is_image || type == kRefusedFsType, reason,
      [&]() -> std::string {
        if (type < 0) {
          return error == ENOENT
                     ? "the path does not exist"
                     : std::string("the file system cannot be told: ") + strerror(error);
        }
        return is_remote  ? "the file system is another machine's"
               : is_image ? "the file system is a mounted image"
                          : "the file system is of a kind that is not indexed";
      },
      [] { return "the file system is this machine's own"; });
}

bool RefusesShare(Question& question, std::string* reason) {
  const sdk::SDKShare& share = question.Share();
  return Answer(
      !share.CanBeIndexed(), reason,
      [&] {
        return "the share \"" + share.GetName() +
               (share.IsLocked() ? "\" is encrypted and locked" : "\" is read-only");
      },
      [&] { return "the share \"" + share.GetName() + "\" is open and can be written"; });
}

bool RefusesRecycleBin(Question& question, std::string* reason) {
  return Answer(
      IsInRecycleBin(question.FullPath(), question.ShareName()), reason,
      [] { return "the path lies in a recycle bin"; },
      [] { return "the path lies in no recycle bin"; });
}

bool RefusesMountPoint(Question& question, std::string* reason) {
  const bool is_mount_point = KAVOFSDirIsMntPoint(question.FullPath().c_str()) == 1;
  return Answer(
      is_mount_point && !question.Share().IsEncryption(), reason,
      [] { return "another file system is mounted on the path"; },
      [&] {
        return is_mount_point ? "the path is a mount point, as in every encrypted share"
                              : "nothing is mounted on the path";
      });
}

bool RefusesName(Question& question, std::string* reason) {
  std::string name;
  const std::string& path = question.FullPath();
  for (size_t begin = 0; begin <= path.size(); begin += name.size() + 1) {
    name.assign(path, begin, std::min(path.find('/', begin), path.size()) - begin);
    if (IsSystemPreservedFileName(name)) {
      return Answer(
          true, reason, [&] { return "the name \"" + name + "\" is preserved for the system"; },
          [] { return ""; });
    }
  }
  return Answer(
      false, reason, [] { return ""; }, [] { return "no name on the path is preserved"; });
}

bool RefusesCanonical(Question& question, std::string* reason) {
  char resolved[PATH_MAX] = {};
  const bool exists = realpath(question.FullPath().c_str(), resolved) != nullptr;
  const int error = errno;
  return Answer(
      !exists || question.FullPath() != resolved, reason,
      [&] {
        return exists            ? std::string("the path is another name of ") + resolved
               : error == ENOENT ? "the path does not exist"
                                 : std::string("the path cannot be resolved: ") + strerror(error);
      },
      [] { return "the path exists and is its own canonical form"; });
}

struct Rule {
  const char* name;
  Refuses refuses;
};

constexpr Rule kRules[] = {
    {"snapshot", RefusesSnapshot},      {"file_system", RefusesFileSystem}, {"share", RefusesShare},
    {"recycle_bin", RefusesRecycleBin}, {"mount_point", RefusesMountPoint}, {"name", RefusesName},
    {"canonical", RefusesCanonical},
};

}  // namespace

bool IsSystemPreservedFileName(const std::string& name) {
  return KAVOEAIsHiddenDir(name.c_str()) == 1 ||
         std::find(std::begin(kPreservedNames), std::end(kPreservedNames), name) !=
             std::end(kPreservedNames);
}

bool IsFullPathInRecycleBin(const std::string& full_path) {
  std::string share_name;
  std::string share_dir;
  GetShareNamePathByFullPath(share_name, share_dir, full_path);
  return IsInRecycleBin(full_path, share_name);
}

bool CanFullPathBeIndexed(const std::string& full_path) {
  Question question(full_path);
  return std::none_of(std::begin(kRules), std::end(kRules),
                      [&question](const Rule& rule) { return rule.refuses(question, nullptr); });
}

bool CanPathBeIndexed(const std::string& path) { return CanFullPathBeIndexed(GetFullPath(path)); }

std::vector<RuleVerdict> ExplainFullPath(const std::string& full_path) {
  Question question(full_path);
  std::vector<RuleVerdict> verdicts;
  for (const Rule& rule : kRules) {
    std::string reason;
    try {
      const bool refused = rule.refuses(question, &reason);
      verdicts.push_back(
          {rule.name, refused ? RuleVerdict::kRefuses : RuleVerdict::kPasses, std::move(reason)});
    } catch (const Error& error) {
      verdicts.push_back({rule.name, RuleVerdict::kCannotTell,
                          question.HasShare() ? error.what() : "no share holds the path"});
    }
  }
  return verdicts;
}

}  // namespace vexlo::fileindex
