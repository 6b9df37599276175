#include "daemons/fileindexd/crawl.h"

#include <chrono>

#include "common/string.h"

namespace vexlo::fileindexd {
namespace {

using Clock = std::chrono::steady_clock;

constexpr unsigned kPage = 2000;
constexpr size_t kMostGone = 10000;
constexpr unsigned kCommitStep = 4000;
constexpr std::chrono::seconds kCheckpointTime{2};
constexpr unsigned kProgressStep = 256;
constexpr unsigned kClockStep = 16;

// One pass over the folder.
class Pass {
 public:
  Pass(const std::string& id, CrawlPoint* point, const WalkRules& rules, const CrawlDeeds& deeds)
      : point_(*point),
        deeds_(deeds),
        was_cut_short_(!point->after.empty()),
        walk_(point->root, point->after, rules),
        listing_(id, point->root, point->after),
        gone_(kMostGone) {}

  // Whether another pass is wanted.
  bool Run() {
    const bool noted_before = was_cut_short_ && point_.saw_gone;
    MergeByPath([this] { return walk_.Next(); }, [this] { return listing_.Next(); },
                [this](const DiskEntry& entry, const IndexedPath* indexed) {
                  deeds_.compare(entry, indexed, point_.pass == 1);
                  Advance(entry.path);
                },
                [this](const IndexedPath& indexed) {
                  MeetGone(indexed.path);
                  Advance(indexed.path);
                });
    deeds_.commit();
    Remove();
    deeds_.progress(done_, /*is_end=*/true);
    return point_.pass == 1 && (noted_before || has_overflowed_);
  }

  CrawlResult Result() const { return {walk_.UnknownCount(), walk_.LastError()}; }

 private:
  void MeetGone(const std::string& path) {
    if (walk_.IsUnknown(path) || gone_.Contains(path)) {
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
      point_.after = path;
      deeds_.save(point_);
      saved_ = Clock::now();
    }
  }

  CrawlPoint& point_;
  const CrawlDeeds& deeds_;
  const bool was_cut_short_;
  DiskWalk walk_;
  IndexListing listing_;
  GoneList gone_;
  bool has_overflowed_ = false;
  uint64_t done_ = 0;
  Clock::time_point saved_ = Clock::now();
};

}  // namespace

IndexListing::IndexListing(std::string id, std::string root, std::string after)
    : id_(std::move(id)),
      root_(std::move(root)),
      after_(std::move(after)),
      is_root_done_(root_ <= after_) {
  AskForPage();
}

void IndexListing::AskForPage() {
  next_page_ = std::async(std::launch::async, ListBelow, id_, root_, after_, kPage);
}

std::optional<IndexedPath> IndexListing::Next() {
  if (!is_root_done_) {
    is_root_done_ = true;
    if (auto found = FindDocument(id_, root_)) {
      return found;
    }
  }
  if (next_ == page_.size() && next_page_.valid()) {
    page_ = next_page_.get();
    next_ = 0;
    if (page_.size() == kPage) {
      after_ = page_.back().path;
      AskForPage();
    }
  }
  return next_ < page_.size() ? std::optional(std::move(page_[next_++])) : std::nullopt;
}

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
                  const CrawlDeeds& deeds) {
  for (;;) {
    Pass pass(id, &point, rules, deeds);
    const bool wants_another = pass.Run();
    if (!wants_another) {
      return pass.Result();
    }
    point.pass = 2;
    point.after.clear();
    deeds.save(point);
  }
}

}  // namespace vexlo::fileindexd
