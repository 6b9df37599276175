// The search that people use: words, names, filters, order, pages.
#ifndef DAEMONS_KAVOELASTICD_SEARCH_H_
#define DAEMONS_KAVOELASTICD_SEARCH_H_

#include <json/value.h>

#include <cstddef>
#include <cstdint>
#include <optional>
#include <string>
#include <vector>

#include "daemons/kavoelasticd/readable.h"
#include "daemons/kavoelasticd/session.h"

namespace vexlo::elasticd {

struct Range {
  std::optional<int64_t> least;
  std::optional<int64_t> most;
  bool Holds(const std::optional<int64_t>& value) const;
  bool Open() const { return !least && !most; }
};

enum class Order { kRelevance, kName, kPath, kSize, kModified };

struct SearchRequest {
  struct Term {
    std::string text;
    bool prefix = false;
  };
  std::vector<std::string> ids;    // Indexes, all without any.
  std::vector<Term> terms;         // All must be found.
  bool only_noise = false;         // There were words, but nothing in them to look for.
  std::string name;                // Part of the file name.
  std::string below;               // A folder, "" for any.
  std::vector<std::string> types;  // Extensions, any of them.
  Range size;
  Range modified;  // Seconds since the epoch.
  Order order = Order::kRelevance;
  bool descending = false;  // Relevance is always the best first.
  size_t from = 0;
  size_t count = 10;
  bool snippet = false;
  std::vector<std::string> load_fields;
};

struct SearchHit {
  int64_t id = 0;
  std::string path;
  double score = 0;
  std::string name_key;  // The folded name, for that order.
  std::optional<int64_t> size;
  std::optional<int64_t> modified;
  int64_t changed = 0;  // As KeepReadable() has it.
  Json::Value shown;    // What the reply has beside the index.
};

struct SearchPage {
  size_t total = 0;
  bool is_least = false;        // There may be more than the total.
  std::vector<SearchHit> hits;  // The first from + count, in order.
};

// Throws Failure kBadRequest.
SearchRequest ParseSearch(const Json::Value& data);

// The indexes whose pages the caller puts together.
enum class Merge { kOne, kSeveral };

// Searches one index. `shown` is filled from the hit number `shown_from` on. The session is to be
// in a transaction, or parts of the answer may be of different moments. With a judge only what may
// be read is found; of a document whose file is another by now, only its path is looked at and
// shown.
SearchPage Search(Session& session, const SearchRequest& request, Merge merge, size_t shown_from,
                  const JudgePaths& judge = nullptr);

// Reads the path where the hit has none yet: some orders do without.
void AddPath(Session& session, SearchHit* hit);

// Whether `a` comes before `b` in the order asked for.
bool ComesBefore(const SearchRequest& request, const SearchHit& a, const SearchHit& b);

// A page position: a whole number from 0 to 100,000,000 in `object[name]`. Throws Failure
// kBadRequest.
size_t PageNumber(const Json::Value& object, const char* name, size_t otherwise);

}  // namespace vexlo::elasticd

#endif  // DAEMONS_KAVOELASTICD_SEARCH_H_
