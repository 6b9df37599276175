#include "daemons/kavoelasticd/readable.h"

#include <algorithm>
#include <utility>

#include "daemons/kavoelasticd/fields.h"
#include "daemons/kavoelasticd/record.h"
#include "daemons/kavoelasticd/search.h"

namespace vexlo::elasticd {
namespace {

// Some orders do without the paths.
void AddPath(Session& session, SearchHit* hit) {
  if (hit->path.empty()) {
    Sql row(session.db, "SELECT path FROM docs WHERE id = ?");
    if (row.Int(hit->id).Row()) {
      hit->path = row.BytesAt(0);
    }
  }
}

}  // namespace

void KeepReadable(Session& session, const SearchRequest& request, const JudgePaths& judge,
                  SearchPage* page, size_t most) {
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
  size_t kept = 0;
  for (size_t i = 0; i < hits.size() && i < verdicts.size(); ++i) {
    if (verdicts[i].is_readable) {
      hits[i].changed = verdicts[i].changed;
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
