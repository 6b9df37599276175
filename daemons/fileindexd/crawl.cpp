#include "daemons/fileindexd/crawl.h"

#include <chrono>

#include "common/string.h"

namespace vexlo::fileindexd {
namespace {

using Clock = std::chrono::steady_clock;

constexpr size_t kMostGone = 10000;
constexpr size_t kMostDiffering = 10000;
constexpr unsigned kCommitStep = 4000;
constexpr std::chrono::seconds kCheckpointTime{2};
constexpr unsigned kProgressStep = 256;
constexpr unsigned kClockStep = 16;

// What is found in one pass over the folder, or over parts of it.
class Pass {
 public:
  // Without `keeps_place`, whoever goes on begins anew.
  Pass(CrawlPoint* point, const CrawlDeeds& deeds, bool keeps_place)
      : point_(*point),
        deeds_(deeds),
        keeps_place_(keeps_place),
        noted_before_(!point->after.empty() && point->saw_gone),
        gone_(kMostGone) {}

  template <typename NextOnDisk, typename NextIndexed>
  void Merge(DiskWalk& walk, const NextOnDisk& next_on_disk, const NextIndexed& next_indexed) {
    MergeByPath(
        next_on_disk, next_indexed,
        [this](const DiskEntry& entry, const IndexedPath* indexed) {
          deeds_.compare(entry, indexed, point_.pass == 1);
          Advance(entry.path);
        },
        [&](const IndexedPath& indexed) {
          MeetGone(walk, indexed.path);
          Advance(indexed.path);
        });
    result_.unknown += walk.UnknownCount();
    result_.last_error = walk.UnknownCount() > 0 ? walk.LastError() : result_.last_error;
  }

  // Whether the folder was met as gone, or lies below one that was.
  bool IsGone(const std::string& folder) const { return gone_.Contains(folder + "/"); }

  // Whether another pass is wanted.
  bool End() {
    deeds_.commit();
    Remove();
    deeds_.progress(done_, /*is_end=*/true);
    return point_.pass == 1 && (noted_before_ || has_overflowed_);
  }

  void CountDone(uint64_t entries) { done_ += entries; }
  CrawlResult Result() const { return result_; }

 private:
  void MeetGone(DiskWalk& walk, const std::string& path) {
    if (walk.IsUnknown(path) || gone_.Contains(path)) {
      return;
    }
    point_.saw_gone = true;
    if (gone_.IsFull()) {
      if (point_.pass == 1) {
        has_overflowed_ = true;
        return;
      }
      Remove();
    }
    gone_.Add(path, deeds_.is_gone(path));
  }

  void Remove() {
    std::vector<GoneList::Gone> gone = gone_.Take();
    if (!gone.empty()) {
      deeds_.remove(std::move(gone));
      deeds_.commit();
    }
  }

  void Advance(const std::string& path) {
    deeds_.check();
    if (++done_ % kProgressStep == 0) {
      deeds_.progress(done_, /*is_end=*/false);
    }
    const bool is_due = done_ % kClockStep == 0 && Clock::now() - saved_ >= kCheckpointTime;
    if (is_due || done_ % kCommitStep == 0) {
      deeds_.commit();
    }
    if (is_due) {
      if (keeps_place_) {
        point_.after = path;
      }
      deeds_.save(point_);
      saved_ = Clock::now();
    }
  }

  CrawlPoint& point_;
  const CrawlDeeds& deeds_;
  const bool keeps_place_;
  const bool noted_before_;
  CrawlResult result_;
  GoneList gone_;
  bool has_overflowed_ = false;
  uint64_t done_ = 0;
  Clock::time_point saved_ = Clock::now();
};

// A folder that is not the same in index and disk, as far as can be told without looking into it.
struct Differing {
  std::string path;
  bool is_indexed;  // Whether the index had anything in it.
};

// What a comparison by digests comes to.
class Differences {
 public:
  explicit Differences(const CrawlDeeds& deeds) : deeds_(deeds) {}

  // In the order of their paths with "/" behind them.
  void Meet(const ScannedFolder& folder, const IndexedFolder* indexed) {
    const daemon::FolderDigest digest =
        indexed == nullptr ? daemon::FolderDigest() : indexed->digest;
    if (folder.error != 0) {
      unknown_ = folder.path;
      ++result_.unknown;
      result_.last_error = folder.error;
    } else if (!folder.is_whole || folder.digest != digest) {
      Add(folder.path, indexed != nullptr);
    } else {
      same_ += digest.count;
      deeds_.progress(same_, /*is_end=*/false);
    }
  }
  void MeetIndexed(const IndexedFolder& folder) {
    if (!unknown_ || !folder.path.starts_with(*unknown_)) {
      Add(folder.path, /*is_indexed=*/true);
    }
  }

  bool AreTooMany() const { return folders_.size() > kMostDiffering; }
  const std::vector<Differing>& Folders() const { return folders_; }
  uint64_t Same() const { return same_; }  // Entries of all other folders.
  CrawlResult Result() const { return result_; }

 private:
  void Add(const std::string& path, bool is_indexed) {
    folders_.push_back({path.substr(0, path.size() - 1), is_indexed});
  }

  const CrawlDeeds& deeds_;
  std::vector<Differing> folders_;
  std::optional<std::string> unknown_;  // The last folder that could not be read.
  uint64_t same_ = 0;
  CrawlResult result_;
};

// None where they are too many, or the index has nothing there.
std::optional<Differences> FindDifferences(const std::string& id, const std::string& root,
                                           const WalkRules& rules, const ContentRules& content,
                                           const CrawlDeeds& deeds) {
  uint64_t seed = 0;
  PagedListing<IndexedFolder> listing(
      [&](const std::string& after, unsigned count) {
        FolderPage page = ListFolders(id, root, after, count);
        if (after.empty()) {  // It is the same for all, and read while the next page is asked for.
          seed = page.seed;
        }
        return std::move(page.folders);
      },
      /*after=*/"");
  std::optional<IndexedFolder> first = listing.Next();
  if (!first) {
    return std::nullopt;
  }
  DiskScan scan(root, rules, content, seed, deeds.check);
  Differences found(deeds);
  const auto next_on_disk = [&] { return found.AreTooMany() ? std::nullopt : scan.Next(); };
  const auto next_indexed = [&] {
    if (first) {
      return std::exchange(first, std::nullopt);
    }
    return found.AreTooMany() ? std::nullopt : listing.Next();
  };
  MergeByPath(
      next_on_disk, next_indexed,
      [&](const ScannedFolder& folder, const IndexedFolder* indexed) {
        found.Meet(folder, indexed);
      },
      [&](const IndexedFolder& folder) { found.MeetIndexed(folder); });
  return scan.HasGivenUp() || found.AreTooMany() ? std::nullopt : std::optional(std::move(found));
}

// The folder's own entry, and its own document.
void CompareRoot(Pass& pass, const std::string& id, const std::string& root,
                 const WalkRules& rules) {
  DiskWalk walk(root, "", rules);
  bool is_seen = false;
  bool is_asked = false;
  const auto next_on_disk = [&] {
    auto entry = std::exchange(is_seen, true) ? std::nullopt : walk.Next();
    return entry && entry->path == root ? std::move(entry) : std::nullopt;
  };
  const auto next_indexed = [&] {
    return std::exchange(is_asked, true) ? std::nullopt : FindDocument(id, root);
  };
  pass.Merge(walk, next_on_disk, next_indexed);
}

// What stands directly in the folder.
void CompareFolder(Pass& pass, const std::string& id, const Differing& folder,
                   const WalkRules& rules) {
  DiskWalk walk(folder.path, /*after=*/folder.path, rules);
  std::optional<PagedListing<IndexedPath>> listing;
  if (folder.is_indexed) {
    listing.emplace([&](const std::string& after,
                        unsigned count) { return ListIn(id, folder.path, after, count); },
                    /*after=*/"");
  }
  pass.Merge(
      walk, [&] { return walk.Next(); }, [&] { return listing ? listing->Next() : std::nullopt; });
}

// Carries out a crawl from its start by the digests; none where too much differs. Where it is cut
// short, what it has done differs no more.
std::optional<CrawlResult> CrawlDifferences(const std::string& id, CrawlPoint point,
                                            WalkRules rules, const ContentRules& content,
                                            const CrawlDeeds& deeds) {
  const auto found = FindDifferences(id, point.root, rules, content, deeds);
  if (!found) {
    return std::nullopt;
  }
  rules.enters = false;
  for (;; point.pass = 2) {
    Pass pass(&point, deeds, /*keeps_place=*/false);
    pass.CountDone(found->Same());
    CompareRoot(pass, id, point.root, rules);
    for (const Differing& folder : found->Folders()) {
      deeds.check();
      if (!pass.IsGone(folder.path)) {
        CompareFolder(pass, id, folder, rules);
      }
    }
    if (!pass.End()) {
      CrawlResult result = pass.Result();
      result.unknown += found->Result().unknown;
      result.last_error = result.last_error == 0 ? found->Result().last_error : result.last_error;
      return result;
    }
  }
}

}  // namespace

bool GoneList::Add(const std::string& path, bool with_all_below) {
  if (IsFull()) {
    return false;
  }
  list_.push_back({path, with_all_below});
  if (with_all_below) {
    folders_.insert(path);
  }
  return true;
}

bool GoneList::Contains(const std::string& path) const {
  for (size_t slash = path.rfind('/'); slash != std::string::npos && slash > 0;
       slash = path.rfind('/', slash - 1)) {
    if (folders_.contains(path.substr(0, slash))) {
      return true;
    }
  }
  return false;
}

std::vector<GoneList::Gone> GoneList::Take() {
  folders_.clear();
  return std::exchange(list_, {});
}

CrawlResult Crawl(const std::string& id, CrawlPoint point, const WalkRules& rules,
                  const std::optional<ContentRules>& content, const CrawlDeeds& deeds) {
  if (content && point.after.empty() && point.pass == 1) {
    if (const auto result = CrawlDifferences(id, point, rules, *content, deeds)) {
      return *result;
    }
  }
  for (;;) {
    Pass pass(&point, deeds, /*keeps_place=*/true);
    DiskWalk walk(point.root, point.after, rules);
    // The root stands before what is below it.
    bool is_root_done = point.root <= point.after;
    PagedListing<IndexedPath> listing(
        [&](const std::string& after, unsigned count) {
          return ListBelow(id, point.root, after, count);
        },
        point.after);
    const auto next_indexed = [&] {
      auto found = std::exchange(is_root_done, true) ? std::nullopt : FindDocument(id, point.root);
      return found ? std::move(found) : listing.Next();
    };
    pass.Merge(
        walk, [&] { return walk.Next(); }, next_indexed);
    if (!pass.End()) {
      return pass.Result();
    }
    point.pass = 2;
    point.after.clear();
    deeds.save(point);
  }
}

}  // namespace vexlo::fileindexd
