// Compares a folder on the disk with what the index has of it.
#ifndef DAEMONS_FILEINDEXD_CRAWL_H_
#define DAEMONS_FILEINDEXD_CRAWL_H_

#include <cstdint>
#include <functional>
#include <future>
#include <optional>
#include <string>
#include <unordered_set>
#include <utility>
#include <vector>

#include "daemons/fileindexd/disk_scan.h"
#include "daemons/fileindexd/disk_walk.h"
#include "daemons/fileindexd/documents.h"
#include "daemons/fileindexd/share_state.h"

namespace vexlo::fileindexd {

// Takes two lists in the order of their paths, each by a function that gives the next element or
// none, and calls `on_disk(entry, indexed or null)` for what the disk has and `on_gone(indexed)`
// for what only the index has, in that order too.
template <typename NextOnDisk, typename NextIndexed, typename OnDisk, typename OnGone>
void MergeByPath(const NextOnDisk& next_on_disk, const NextIndexed& next_indexed,
                 const OnDisk& on_disk, const OnGone& on_gone) {
  auto entry = next_on_disk();
  auto indexed = next_indexed();
  while (entry || indexed) {
    const int order = !entry ? 1 : !indexed ? -1 : entry->path.compare(indexed->path);
    if (order > 0) {
      on_gone(*indexed);
    } else {
      on_disk(*entry, order == 0 ? &*indexed : nullptr);
    }
    if (order <= 0) {
      entry = next_on_disk();
    }
    if (order >= 0) {
      indexed = next_indexed();
    }
  }
}

// A list of the index, page by page, in the order of its paths. The next page is asked for, by a
// thread of its own, while one is gone through: so the walk over the disk and the engine are both
// at work. What is written meanwhile at paths behind those that were given may be in it or not.
template <typename Item>
class PagedListing {
 public:
  // The page of up to `count` behind a path; one that is not full is the last. Called by one thread
  // at a time.
  using Ask = std::function<std::vector<Item>(const std::string& after, unsigned count)>;

  // Begins with the first page at once. What `ask` refers to outlives the object.
  PagedListing(Ask ask, std::string after) : ask_(std::move(ask)) { Begin(std::move(after)); }

  // Throws as `ask` does.
  std::optional<Item> Next() {
    if (next_ == page_.size() && next_page_.valid()) {
      page_ = next_page_.get();
      next_ = 0;
      if (page_.size() == kPage) {
        Begin(page_.back().path);
      }
    }
    return next_ < page_.size() ? std::optional(std::move(page_[next_++])) : std::nullopt;
  }

 private:
  static constexpr unsigned kPage = 2000;

  void Begin(std::string after) {
    next_page_ = std::async(std::launch::async, ask_, std::move(after), kPage);
  }

  const Ask ask_;
  std::vector<Item> page_;
  size_t next_ = 0;                           // In the page.
  std::future<std::vector<Item>> next_page_;  // Waited for where it is dropped.
};

// Paths that the index has and the disk has not, until they are deleted. What lies below one of
// them goes with it.
class GoneList {
 public:
  struct Gone {
    std::string path;
    bool with_all_below;
  };

  explicit GoneList(size_t most) : most_(most) {}
  // False when there is no room.
  bool Add(const std::string& path, bool with_all_below);
  // Whether the path lies below one that goes with all below.
  bool Contains(const std::string& path) const;
  bool IsFull() const { return list_.size() >= most_; }
  std::vector<Gone> Take();

 private:
  const size_t most_;
  std::vector<Gone> list_;
  std::unordered_set<std::string> folders_;
};

// What a crawl does with what it finds. Each may throw, which ends the crawl where it stands.
struct CrawlDeeds {
  std::function<void()> check;  // Throws when the crawl is to end.
  // Whether the file's document is to be made, and makes it.
  std::function<void(const DiskEntry& entry, const IndexedPath* indexed, bool first_pass)> compare;
  std::function<bool(const std::string& path)> is_gone;
  std::function<void(std::vector<GoneList::Gone> gone)> remove;
  std::function<void()> commit;
  std::function<void(const CrawlPoint& point)> save;
  std::function<void(uint64_t done, bool is_end)> progress;
};

struct CrawlResult {
  uint64_t unknown = 0;  // What could not be looked at.
  int last_error = 0;    // An errno.
};

// Carries out the crawl from `point` on; it is at its end afterwards.
//
// The first pass brings in what is new and only notes what is gone, so that whatever has another
// path now is found there before it is lost here. What was noted goes at the pass's end. Where that
// is too much to be noted, or was noted by a run that was cut short, a second pass over everything
// removes what it meets.
//
// With `content`, a crawl from the start begins with the digests of the folders, and goes through
// those alone that differ, unless they are many or all is new. Without, every entry is compared:
// for those who compare something else than what EntryHash() is made of.
CrawlResult Crawl(const std::string& id, CrawlPoint point, const WalkRules& rules,
                  const std::optional<ContentRules>& content, const CrawlDeeds& deeds);

}  // namespace vexlo::fileindexd

#endif  // DAEMONS_FILEINDEXD_CRAWL_H_
