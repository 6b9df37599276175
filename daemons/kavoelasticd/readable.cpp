#include "daemons/kavoelasticd/readable.h"

#include <algorithm>
#include <utility>

#include "common/string.h"
#include "daemons/kavoelasticd/fields.h"
#include "daemons/kavoelasticd/record.h"
#include "daemons/kavoelasticd/search.h"

namespace vexlo::elasticd {
namespace {

bool StandsInName(Session& session, const StoredDocument& document, const Wanted& term) {
  const std::vector<Item>& items = document.record.Items();
  return std::any_of(items.begin(), items.end(), [&](const Item& item) {
    return item.kind == Kind::kName && session.FieldOf(item.field).all &&
           session.words.Contains(Basename(document.path), term.tokens, term.prefix);
  });
}

bool IsByPath(Order order) { return order == Order::kName || order == Order::kPath; }

// Whether more than paths decides what is found and in which order.
bool LooksInside(const SearchRequest& request) {
  return !request.terms.empty() || !request.size.Open() || !request.modified.Open() ||
         request.order == Order::kSize || request.order == Order::kModified;
}

// Whoever may write to a folder can put a file of his own at the path of another's, of which the
// document still tells. A folder gets another date with every change in it, and is to be found.
bool MayBeTold(Session& session, const SearchRequest& request, const std::vector<Wanted>& wanted,
               bool is_cut, SearchHit* hit) {
  auto document = session.Load(hit->id);
  if (!document) {
    return false;
  }
  if (IsOfFile(session, *document, hit->changed)) {
    return true;
  }
  hit->score = 0;
  hit->size.reset();
  hit->modified.reset();
  return request.size.Open() && request.modified.Open() &&
         // It is among the first by what must not be told.
         (!is_cut || IsByPath(request.order)) &&
         std::all_of(wanted.begin(), wanted.end(),
                     [&](const Wanted& term) { return StandsInName(session, *document, term); });
}

}  // namespace

void KeepReadable(Session& session, const SearchRequest& request, const std::vector<Wanted>& wanted,
                  const JudgePaths& judge, SearchPage* page, size_t most) {
  std::vector<SearchHit>& hits = page->hits;
  if (hits.size() > most) {
    std::nth_element(
        hits.begin(), hits.begin() + static_cast<std::ptrdiff_t>(most), hits.end(),
        [&](const SearchHit& a, const SearchHit& b) { return ComesBefore(request, a, b); });
    hits.resize(most);
    page->is_least = true;
  }
  std::vector<std::string> paths;
  paths.reserve(hits.size());
  for (SearchHit& hit : hits) {
    AddPath(session, &hit);
    paths.push_back(hit.path);
  }
  const std::vector<Verdict> verdicts = judge(paths);
  const bool looks_inside = LooksInside(request);
  size_t kept = 0;
  for (size_t i = 0; i < hits.size() && i < verdicts.size(); ++i) {
    hits[i].changed = verdicts[i].changed;
    if (verdicts[i].is_readable &&
        (!looks_inside || MayBeTold(session, request, wanted, page->is_least, &hits[i]))) {
      if (kept != i) {
        hits[kept] = std::move(hits[i]);
      }
      ++kept;
    }
  }
  hits.resize(kept);
  page->total = kept;
}

bool IsOfFile(Session& session, StoredDocument& document, int64_t changed) {
  const auto id = session.IdOf(kStampField);
  const Item* const item = id ? document.record.Find(*id) : nullptr;
  const Json::Value stamp = item != nullptr ? JsonOf(*item, document.path) : Json::Value();
  return stamp.isObject() && stamp["ctime"].isInt64() && stamp["ctime"].asInt64() == changed;
}

}  // namespace vexlo::elasticd
