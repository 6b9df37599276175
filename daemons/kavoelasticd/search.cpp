#include "daemons/kavoelasticd/search.h"

#include <algorithm>
#include <iterator>
#include <set>
#include <unordered_map>
#include <utility>

#include "common/string.h"
#include "daemons/kavoelasticd/failure.h"
#include "daemons/kavoelasticd/fields.h"
#include "daemons/kavoelasticd/fold.h"
#include "daemons/kavoelasticd/query.h"
#include "daemons/kavoelasticd/snippet.h"

namespace vexlo::elasticd {
namespace {

[[noreturn]] void Refuse(const std::string& what) { throw Failure(Code::kBadRequest, what); }

constexpr size_t kMaxPage = 100'000'000;
// Each costs a look at all that it finds, and a word of a phrase as much.
constexpr size_t kMostTerms = 64;
constexpr size_t kMostTokens = 1000;

std::string TextMember(const Json::Value& data, const char* name) {
  const Json::Value& value = data[name];
  if (!value.isNull() && !value.isString()) {
    Refuse(std::string(name) + " is no text");
  }
  return value.asString();
}

bool BoolMember(const Json::Value& data, const char* name) {
  const Json::Value& value = data[name];
  if (!value.isNull() && !value.isBool()) {
    Refuse(std::string(name) + " is neither true nor false");
  }
  return value.asBool();
}

std::vector<std::string> ListMember(const Json::Value& data, const char* name) {
  std::vector<std::string> list;
  if (!data[name].isNull() && !data[name].isArray()) {
    Refuse(std::string(name) + " is no list");
  }
  for (const Json::Value& element : data[name]) {
    if (!element.isString()) {
      Refuse(std::string(name) + " holds something else than texts");
    }
    list.push_back(element.asString());
  }
  return list;
}

std::optional<int64_t> NumberMember(const Json::Value& data, const std::string& name) {
  const Json::Value& value = data[name];
  if (value.isNull()) {
    return std::nullopt;
  }
  if (!value.isInt64()) {
    Refuse(name + " is no whole number");
  }
  return value.asInt64();
}

Range RangeMember(const Json::Value& data, const std::string& name) {
  return {NumberMember(data, name + "_min"), NumberMember(data, name + "_max")};
}

// "quoted phrases" and what white space separates, each with an optional * behind it.
std::vector<SearchRequest::Term> ParseWords(const std::string& words) {
  std::vector<SearchRequest::Term> terms;
  const std::string space = " \t\r\n";
  for (size_t i = 0; i < words.size();) {
    if (space.find(words[i]) != std::string::npos) {
      ++i;
      continue;
    }
    SearchRequest::Term term;
    const bool quoted = words[i] == '"';
    size_t end = quoted ? words.find('"', i + 1) : words.find_first_of(space + '"', i);
    end = std::min(end, words.size());
    term.text = words.substr(i + (quoted ? 1 : 0), end - i - (quoted ? 1 : 0));
    i = end + (quoted ? 1 : 0);
    if (quoted && i < words.size() && words[i] == '*') {
      term.prefix = true;
      ++i;
    } else if (!quoted && term.text.ends_with('*')) {
      term.prefix = true;
      term.text.pop_back();
    }
    terms.push_back(std::move(term));
  }
  return terms;
}

// Without what has no word in it, and what stands there before.
std::vector<SearchRequest::Term> TermsOf(const std::string& words) {
  std::vector<SearchRequest::Term> terms;
  std::set<std::pair<std::vector<std::string>, bool>> known;
  size_t token_count = 0;
  WordCutter cutter("none");
  for (SearchRequest::Term& term : ParseWords(words)) {
    std::vector<std::string> tokens = cutter.QueryTokens(term.text, Cut::kPrefixQuery);
    const size_t count = tokens.size();
    term.prefix = term.prefix || IsSingleIdeograph(term.text);
    if (count > 0 && known.emplace(std::move(tokens), term.prefix).second) {
      token_count += count;
      if (terms.size() == kMostTerms || token_count > kMostTokens) {
        Refuse("words has more than " + std::to_string(kMostTerms) + " different words, or " +
               std::to_string(kMostTokens) + " with those of its phrases");
      }
      terms.push_back(std::move(term));
    }
  }
  return terms;
}

Order OrderMember(const Json::Value& data) {
  const std::string name = TextMember(data, "sort");
  constexpr std::pair<const char*, Order> kOrders[] = {
      {"", Order::kRelevance}, {"relevance", Order::kRelevance}, {"name", Order::kName},
      {"path", Order::kPath},  {"size", Order::kSize},           {"modified", Order::kModified}};
  for (const auto& [text, order] : kOrders) {
    if (name == text) {
      return order;
    }
  }
  Refuse("sort is not known: " + name);
}

using Ids = std::vector<int64_t>;
using Scores = std::unordered_map<int64_t, double>;

// The catch-all columns of the two tables, before a phrase. Empty for a table without any.
std::string TextFilter(const Session& session) {
  std::string columns;
  bool all = true;
  for (const std::string& name : session.schema.TextColumns()) {
    const Field field = session.schema.Rules(name);
    if (field.all) {
      columns += " t" + std::to_string(field.column);
    }
    all = all && field.all;
  }
  return columns.empty() || all ? "" : "{" + columns + " } : ";
}

bool HasTextColumns(const Session& session) {
  const auto& names = session.schema.TextColumns();
  return std::any_of(names.begin(), names.end(),
                     [&](const std::string& name) { return session.schema.Rules(name).all; });
}

std::string Phrase(const SearchRequest::Term& term) {
  return Quote(term.text) + (term.prefix ? " *" : "");
}

Ids Intersect(const Ids& a, const Ids& b) {
  Ids both;
  std::set_intersection(a.begin(), a.end(), b.begin(), b.end(), std::back_inserter(both));
  return both;
}

void CollectTable(Session& session, const char* sql, const std::string& match, Ids* ids) {
  Sql rows(session.db, sql);
  rows.Text(match);
  while (rows.Row()) {
    ids->push_back(rows.IntAt(0));
  }
}

Ids FindTerm(Session& session, const SearchRequest::Term& term) {
  Ids texts;
  Ids words;
  if (HasTextColumns(session)) {
    CollectTable(session, "SELECT rowid FROM texts WHERE texts MATCH ?",
                 TextFilter(session) + Phrase(term), &texts);
  }
  CollectTable(session, "SELECT rowid FROM words WHERE words MATCH ?",
               "{name rest} : " + Phrase(term), &words);
  Ids either;
  std::set_union(texts.begin(), texts.end(), words.begin(), words.end(),
                 std::back_inserter(either));
  return either;
}

void AddScores(Session& session, const char* sql, const std::string& match, Scores* scores) {
  Sql rows(session.db, sql);
  rows.Text(match);
  while (rows.Row()) {
    (*scores)[rows.IntAt(0)] -= rows.DoubleAt(1);  // Better is lower there.
  }
}

// How well the documents fit the terms: BM25 of the two tables, words of the name counting most. Of
// `members` only. Term by term, which adds up to the same, as SQLite weighs all that it is asked
// for at once before it looks at the time.
Scores Rank(Session& session, const std::vector<SearchRequest::Term>& terms, const Ids& members) {
  std::vector<bool> bits(members.empty() ? 0 : static_cast<size_t>(members.back()) + 1);
  for (const int64_t id : members) {
    bits[static_cast<size_t>(id)] = true;
  }
  session.db.SetMembers(&bits);
  Scores scores;
  scores.reserve(members.size());
  for (const SearchRequest::Term& term : terms) {
    if (HasTextColumns(session)) {
      AddScores(session,
                "SELECT rowid, bm25(texts) FROM texts WHERE texts MATCH ? AND member(rowid)",
                TextFilter(session) + Phrase(term), &scores);
    }
    AddScores(session,
              "SELECT rowid, bm25(words, 10.0, 3.0, 0.0) FROM words WHERE words MATCH ?"
              " AND member(rowid)",
              "{name rest} : " + Phrase(term), &scores);
  }
  session.db.SetMembers(nullptr);
  return scores;
}

// What is looked for in the columns of docs.
class Filter {
 public:
  explicit Filter(const SearchRequest& request)
      : request_(request), name_(Fold(request.name)), below_(request.below) {
    while (below_.ends_with('/')) {
      below_.pop_back();
    }
    for (const std::string& type : request.types) {
      types_.push_back(Fold(type.starts_with('.') ? type.substr(1) : type));
    }
    std::sort(types_.begin(), types_.end());
  }

  bool Open() const {
    return name_.empty() && request_.below.empty() && types_.empty() && request_.size.Open() &&
           request_.modified.Open();
  }

  const std::string& Below() const { return below_; }

  // Takes a row of path, ext, size, mtime from `column` on; false when it is not wanted.
  bool Take(const Sql& row, int column, SearchHit* hit) const {
    const std::string_view path = row.BytesAt(column);
    if (!request_.below.empty() &&
        !(path.starts_with(below_) && path.size() > below_.size() && path[below_.size()] == '/')) {
      return false;
    }
    if (!types_.empty() &&
        (row.NullAt(column + 1) ||
         !std::binary_search(types_.begin(), types_.end(), row.BytesAt(column + 1)))) {
      return false;
    }
    hit->size = row.NullAt(column + 2) ? std::nullopt : std::optional(row.IntAt(column + 2));
    hit->modified = row.NullAt(column + 3) ? std::nullopt : std::optional(row.IntAt(column + 3));
    if (!request_.size.Holds(hit->size) || !request_.modified.Holds(hit->modified)) {
      return false;
    }
    hit->path = path;
    return TakeName(hit);
  }

 private:
  bool TakeName(SearchHit* hit) const {
    if (name_.empty() && request_.order != Order::kName) {
      return true;
    }
    hit->name_key = Fold(Basename(hit->path));
    if (name_.empty()) {
      return true;
    }
    const size_t at = hit->name_key.find(name_);
    if (at == std::string::npos) {
      return false;
    }
    // The whole name before its beginning before the rest, and short names before long ones.
    hit->score += (hit->name_key == name_ ? 3.0
                   : at == 0              ? 2.0
                                          : 1.0) +
                  static_cast<double>(name_.size()) / static_cast<double>(hit->name_key.size() + 1);
    return true;
  }

  const SearchRequest& request_;
  std::string name_;
  std::string below_;
  std::vector<std::string> types_;
};

// Removes what the text indexes know but is no document any more. `ids` are in order.
void RemoveGone(Session& session, Ids* ids) {
  Sql rows(session.db, "SELECT id FROM gone ORDER BY id");
  Ids gone;
  while (rows.Row()) {
    gone.push_back(rows.IntAt(0));
  }
  std::erase_if(*ids, [&](int64_t id) { return std::binary_search(gone.begin(), gone.end(), id); });
}

std::vector<SearchHit> HitsOf(Session& session, const SearchRequest& request, Ids ids,
                              const Filter& filter) {
  std::vector<SearchHit> hits;
  hits.reserve(ids.size());
  const bool by_id = filter.Open() && request.order == Order::kRelevance;
  if (by_id) {
    RemoveGone(session, &ids);
  }
  for (const int64_t id : ids) {
    SearchHit hit;
    hit.id = id;
    if (!by_id) {
      Sql row(session.db, "SELECT path, ext, size, mtime FROM docs WHERE id = ?");
      if (!row.Int(id).Row() || !filter.Take(row, 0, &hit)) {
        continue;
      }
    }
    hits.push_back(std::move(hit));
  }
  return hits;
}

// Without words or a name, whatever the filters let through.
std::vector<SearchHit> HitsOfAll(Session& session, const Filter& filter) {
  const std::string columns = "SELECT id, path, ext, size, mtime FROM docs";
  const std::string from = filter.Below() + "/";
  const std::string to = filter.Below() + "0";  // What follows "/".
  Sql rows(session.db,
           filter.Below().empty() ? columns : columns + " WHERE path >= ? AND path < ?");
  if (!filter.Below().empty()) {
    rows.Blob(from).Blob(to);
  }
  std::vector<SearchHit> hits;
  while (rows.Row()) {
    SearchHit hit;
    hit.id = rows.IntAt(0);
    if (filter.Take(rows, 1, &hit)) {
      hits.push_back(std::move(hit));
    }
  }
  return hits;
}

std::vector<SearchHit> FindHits(Session& session, const SearchRequest& request) {
  const Filter filter(request);
  const bool grams = !request.name.empty() && !session.schema.GramColumns().empty();
  if (request.terms.empty() && !grams) {
    return HitsOfAll(session, filter);
  }
  std::optional<Ids> ids;
  for (const SearchRequest::Term& term : request.terms) {
    Ids found = FindTerm(session, term);
    ids = ids ? Intersect(*ids, found) : std::move(found);
  }
  if (grams) {
    Ids found = FindGrams(session, request.name);
    ids = ids ? Intersect(*ids, found) : std::move(found);
  }
  std::vector<SearchHit> hits = HitsOf(session, request, *std::move(ids), filter);
  if (!request.terms.empty()) {
    Ids left;
    for (const SearchHit& hit : hits) {
      left.push_back(hit.id);
    }
    const Scores scores = Rank(session, request.terms, left);
    for (SearchHit& hit : hits) {
      if (const auto found = scores.find(hit.id); found != scores.end()) {
        hit.score += found->second;
      }
    }
  }
  return hits;
}

std::vector<Wanted> WantedOf(Session& session, const SearchRequest& request) {
  std::vector<Wanted> wanted;
  for (const SearchRequest::Term& term : request.terms) {
    wanted.push_back(
        {session.words.QueryTokens(term.text, term.prefix ? Cut::kPrefixQuery : Cut::kQuery),
         term.prefix});
  }
  return wanted;
}

std::string SnippetOf(Session& session, StoredDocument* document,
                      const std::vector<Wanted>& wanted) {
  if (wanted.empty()) {
    return "";
  }
  // Long texts first: a name is shown anyway.
  for (const bool long_ones : {true, false}) {
    const std::vector<Item> items = document->record.Items();
    for (const Item& item : items) {
      const Field& field = session.FieldOf(item.field);
      if ((field.lookup == Lookup::kText) != long_ones || !field.all || !field.stored) {
        continue;
      }
      session.FillBody(document->id, &document->record, item.field);
      std::string snippet = MakeSnippet(
          session.words, JoinedTexts(*document->record.Find(item.field), document->path), wanted);
      if (!snippet.empty()) {
        return snippet;
      }
    }
  }
  return "";
}

void Show(Session& session, const SearchRequest& request, const Selection& selection,
          const std::vector<Wanted>& wanted, bool is_judged, SearchHit* hit) {
  auto document = session.Load(hit->id);
  if (!document) {
    return;
  }
  hit->path = document->path;
  const bool is_told = !is_judged || IsOfFile(session, *document, hit->changed);
  hit->shown = is_told ? session.Fields(&*document, selection) : Json::Value(Json::objectValue);
  hit->shown["path"] = document->path;
  if (!is_judged) {  // How often a word stands in others' files shows in it.
    hit->shown["score"] = hit->score;
  }
  const auto number = [&](const char* field) -> Json::Value {
    const auto id = session.IdOf(field);
    const Item* const item = id ? document->record.Find(*id) : nullptr;
    return item != nullptr ? JsonOf(*item, document->path) : Json::Value();
  };
  hit->shown["name"] = Basename(document->path);
  if (is_told) {
    hit->shown["size"] = number(kSizeField);
    hit->shown["modified"] = number(kModifiedField);
  }
  hit->shown["is_dir"] = number(kIsDirField).isBool() && number(kIsDirField).asBool();
  if (request.snippet && is_told) {
    hit->shown["snippet"] = SnippetOf(session, &*document, wanted);
  }
}

// Which of the hits that fit equally well are among the first `count` is the same for every page of
// several indexes when their paths decide, as they do between the indexes.
void AddPathsAtCut(Session& session, const SearchRequest& request, size_t count,
                   std::vector<SearchHit>* hits) {
  if (request.order != Order::kRelevance || count == 0 || count >= hits->size()) {
    return;
  }
  const auto last = hits->begin() + static_cast<std::ptrdiff_t>(count - 1);
  std::nth_element(hits->begin(), last, hits->end(),
                   [](const SearchHit& a, const SearchHit& b) { return a.score > b.score; });
  const double score = last->score;
  for (SearchHit& hit : *hits) {
    if (hit.score == score) {
      AddPath(session, &hit);
    }
  }
}

template <typename T>
int Compare(const T& a, const T& b) {
  return a < b ? -1 : b < a ? 1 : 0;
}

}  // namespace

bool Range::Holds(const std::optional<int64_t>& value) const {
  return Open() || (value && (!least || *value >= *least) && (!most || *value <= *most));
}

size_t PageNumber(const Json::Value& object, const char* name, size_t otherwise) {
  const std::optional<int64_t> number = NumberMember(object, name);
  if (number && (*number < 0 || *number > static_cast<int64_t>(kMaxPage))) {
    Refuse(std::string(name) + " is out of range");
  }
  return number ? static_cast<size_t>(*number) : otherwise;
}

SearchRequest ParseSearch(const Json::Value& data) {
  SearchRequest request;
  request.ids = ListMember(data, "ids");
  const std::string words = TextMember(data, "words");
  request.terms = TermsOf(words);
  request.only_noise = request.terms.empty() && !Trim(words).empty();
  request.name = TextMember(data, "name");
  request.below = TextMember(data, "below");
  request.types = ListMember(data, "types");
  request.size = RangeMember(data, "size");
  request.modified = RangeMember(data, "modified");
  request.order = OrderMember(data);
  request.descending = BoolMember(data, "descending");
  request.from = PageNumber(data, "from", 0);
  request.count = PageNumber(data, "size", 10);
  request.snippet = BoolMember(data, "snippet");
  request.load_fields = ListMember(data, "load_field");
  return request;
}

bool ComesBefore(const SearchRequest& request, const SearchHit& a, const SearchHit& b) {
  int order = 0;
  switch (request.order) {
    case Order::kRelevance:
      order = Compare(b.score, a.score);
      break;
    case Order::kName:
      order = Compare(a.name_key, b.name_key);
      break;
    case Order::kPath:
      break;
    case Order::kSize:
      order = Compare(a.size, b.size);
      break;
    case Order::kModified:
      order = Compare(a.modified, b.modified);
      break;
  }
  order = order != 0 ? order : Compare(a.path, b.path);
  order = order != 0 ? order : Compare(a.id, b.id);
  return request.descending && request.order != Order::kRelevance ? order > 0 : order < 0;
}

void AddPath(Session& session, SearchHit* hit) {
  if (hit->path.empty()) {
    Sql row(session.db, "SELECT path FROM docs WHERE id = ?");
    if (row.Int(hit->id).Row()) {
      hit->path = row.BytesAt(0);
    }
  }
}

SearchPage Search(Session& session, const SearchRequest& request, Merge merge, size_t shown_from,
                  const JudgePaths& judge) {
  if (request.only_noise) {
    return {};
  }
  SearchPage page;
  page.hits = FindHits(session, request);
  page.total = page.hits.size();
  const std::vector<Wanted> wanted = WantedOf(session, request);
  if (judge) {
    KeepReadable(session, request, wanted, judge, &page);
  }
  const size_t count = std::min(page.hits.size(), request.from + request.count);
  if (merge == Merge::kSeveral) {
    AddPathsAtCut(session, request, count, &page.hits);
  }
  std::partial_sort(
      page.hits.begin(), page.hits.begin() + static_cast<std::ptrdiff_t>(count), page.hits.end(),
      [&](const SearchHit& a, const SearchHit& b) { return ComesBefore(request, a, b); });
  page.hits.resize(count);
  Selection selection = session.Select(request.load_fields);
  if (request.load_fields.empty()) {
    selection = {/*key=*/false, /*all=*/false};
  }
  for (size_t i = shown_from; i < count; ++i) {
    Show(session, request, selection, wanted, /*is_judged=*/judge != nullptr, &page.hits[i]);
  }
  return page;
}

}  // namespace vexlo::elasticd
