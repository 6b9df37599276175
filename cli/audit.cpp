#include "cli/audit.h"

#include <json/value.h>

#include <cerrno>
#include <ctime>
#include <optional>
#include <utility>

#include "cli/disk_listing.h"
#include "cli/index_listing.h"
#include "common/string.h"
#include "fileindex/elastic_control/schema.h"
#include "fileindex/elastic_control/share_index.h"
#include "watch/directory.h"

namespace vexlo::cli {
namespace {

// What the index daemon's documents say of the state of the file that they were made of. Read here
// anew, so that a fault in how the daemon compares does not hide itself.
constexpr char kStampField[] = "FileIndexStamp";
constexpr int64_t kSecond = 1'000'000'000;
// Each costs a request.
constexpr unsigned kMostLookedAtTwice = 5000;

using fileindex::elastic::field::KAVOMDPath;

int64_t Nanoseconds(const timespec& time) { return time.tv_sec * kSecond + time.tv_nsec; }

bool Is(const Json::Value& value, int64_t number) {
  return value.isInt64() && value.asInt64() == number;
}

bool IsStale(const Json::Value& stamp, const struct stat& info, bool wants_content) {
  if (!stamp.isObject() ||
      (stamp["content"].isBool() && stamp["content"].asBool()) != wants_content) {
    return true;
  }
  const bool is_same_content = Is(stamp["mtime"], Nanoseconds(info.st_mtim));
  const bool is_same_state = Is(stamp["ctime"], Nanoseconds(info.st_ctim));
  if (S_ISDIR(info.st_mode)) {
    // What comes and goes in a folder gives it new dates, and nothing of that is in its document.
    return is_same_content && !is_same_state;
  }
  return !is_same_content || !is_same_state || !Is(stamp["size"], info.st_size);
}

class Comparison {
 public:
  Comparison(const AuditScope& scope, const std::string& root, int64_t grace_seconds,
             const AuditDeeds& deeds)
      : scope_(scope),
        grace_(grace_seconds * kSecond),
        deeds_(deeds),
        disk_(scope, root.empty() ? scope.SharePath() : root,
              [this](const std::string& path, int error) { MeetUnknown(path, error); }),
        index_(fileindex::elastic::GetFileIndexID(scope.Share()), root, {kStampField}) {}

  AuditCounts Run() {
    std::optional<DiskFile> file = NextFile();
    std::optional<Json::Value> document = NextDocument();
    while (file || document) {
      const int order = !file       ? 1
                        : !document ? -1
                                    : file->path.compare((*document)[KAVOMDPath].asString());
      if (order < 0) {
        Meet(*file, nullptr);
      } else if (order > 0) {
        MeetAlone((*document)[KAVOMDPath].asString());
      } else {
        Meet(*file, &*document);
      }
      if (order <= 0) {
        file = NextFile();
      }
      if (order >= 0) {
        document = NextDocument();
      }
    }
    return counts_;
  }

 private:
  std::optional<DiskFile> NextFile() {
    auto file = disk_.Next();
    counts_.files += file ? 1 : 0;
    return file;
  }
  std::optional<Json::Value> NextDocument() {
    auto document = index_.Next();
    counts_.documents += document ? 1 : 0;
    return document;
  }

  std::optional<Difference> Compare(const DiskFile& file, const Json::Value* document) const {
    if (document == nullptr) {
      return Difference::kMissing;
    }
    if (!IsStale((*document)[kStampField], file.info, scope_.WantsContent(file.path))) {
      return std::nullopt;
    }
    timespec now{};
    clock_gettime(CLOCK_REALTIME, &now);
    const int64_t age = Nanoseconds(now) - Nanoseconds(file.info.st_ctim);
    return age >= 0 && age < grace_ ? std::nullopt : std::optional(Difference::kStale);
  }

  void Meet(DiskFile& file, const Json::Value* document) {
    std::optional<Difference> difference = Compare(file, document);
    if (difference && looked_at_twice_ < kMostLookedAtTwice) {
      ++looked_at_twice_;
      if (lstat(file.path.c_str(), &file.info) != 0) {
        return;
      }
      const std::optional<Json::Value> now = index_.Find(file.path);
      difference = Compare(file, now ? &*now : nullptr);
    }
    if (difference) {
      ++(*difference == Difference::kMissing ? counts_.missing : counts_.stale);
      deeds_.report(*difference, file.path, /*is_there=*/true);
    }
  }

  // Only the index has the path, as far as was seen.
  void MeetAlone(const std::string& path) {
    if (disk_.IsUnknown(path)) {
      return;
    }
    struct stat info {};
    const bool is_there = lstat(path.c_str(), &info) == 0;
    if (const int error = errno;
        !is_there && !watch::MeansNoDirectory(error) && error != ENAMETOOLONG) {
      MeetUnknown(path, error);
      return;
    }
    if (is_there && !S_ISLNK(info.st_mode) && scope_.LeadsTo(path) &&
        (S_ISDIR(info.st_mode) ? scope_.IsFolderWanted(path) : scope_.IsFileWanted(path))) {
      return;  // It came after its folder was read.
    }
    // Of a share that has just been taken away nothing is there, or nothing is wanted.
    scope_.CheckShare();
    if (looked_at_twice_ < kMostLookedAtTwice) {
      ++looked_at_twice_;
      if (!index_.Find(path)) {
        return;
      }
    }
    ++counts_.ghost;
    deeds_.report(Difference::kGhost, path, is_there);
  }

  void MeetUnknown(const std::string& path, int error) {
    ++counts_.unknown;
    deeds_.unknown(path, error);
  }

  const AuditScope& scope_;
  const int64_t grace_;
  const AuditDeeds& deeds_;
  AuditCounts counts_;
  DiskListing disk_;
  IndexListing index_;
  unsigned looked_at_twice_ = 0;
};

}  // namespace

const char* NameOf(Difference difference) {
  switch (difference) {
    case Difference::kMissing:
      return "missing";
    case Difference::kGhost:
      return "ghost";
    case Difference::kStale:
      break;
  }
  return "stale";
}

AuditCounts& AuditCounts::operator+=(const AuditCounts& other) {
  files += other.files;
  documents += other.documents;
  missing += other.missing;
  ghost += other.ghost;
  stale += other.stale;
  unknown += other.unknown;
  return *this;
}

AuditCounts Audit(const AuditScope& scope, const std::string& root, int64_t grace_seconds,
                  const AuditDeeds& deeds) {
  scope.CheckShare();
  return Comparison(scope, root, grace_seconds, deeds).Run();
}

}  // namespace vexlo::cli
