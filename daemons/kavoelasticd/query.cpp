#include "daemons/kavoelasticd/query.h"

#include <algorithm>
#include <optional>
#include <utility>

#include "daemons/kavoelasticd/failure.h"
#include "daemons/kavoelasticd/fold.h"

namespace vexlo::elasticd {
namespace {

[[noreturn]] void Refuse(const std::string& what) {
  throw Failure(Code::kUnknownQuery, "qsl: " + what);
}

constexpr int kMaxDepth = 32;

void Parse(const Json::Value& qsl, int depth, Conditions* out) {
  if (!qsl.isObject() || qsl.empty()) {
    Refuse("a query is an object with \"term\", \"prefix\" or \"and\"");
  }
  for (const std::string& form : qsl.getMemberNames()) {
    const Json::Value& body = qsl[form];
    if (form == "and" && body.isArray() && !body.empty() && depth < kMaxDepth) {
      for (const Json::Value& part : body) {
        Parse(part, depth + 1, out);
      }
      continue;
    }
    if ((form != "term" && form != "prefix") || !body.isObject() || body.empty()) {
      Refuse("\"" + form + "\" is not known, or empty");
    }
    for (const std::string& field : body.getMemberNames()) {
      const Json::Value& value = body[field];
      if (!value.isString() && (form == "prefix" || (!value.isNumeric() && !value.isBool()))) {
        Refuse("the value for " + field + " cannot be looked for");
      }
      out->push_back({field, form == "prefix", value});
    }
  }
}

// Lower ones read less.
int Cost(const Session& session, const Condition& condition) {
  switch (session.schema.Rules(condition.field).lookup) {
    case Lookup::kKey:
      return condition.prefix ? 4 : 0;
    case Lookup::kExact:
      return 1;
    case Lookup::kGrams:
    case Lookup::kText:
    case Lookup::kWords:
      return 2;
    case Lookup::kAncestor:
      return 3;
    case Lookup::kNumber:
      return 5;
  }
  return 5;
}

void Collect(Sql& rows, std::vector<int64_t>* ids) {
  while (rows.Row()) {
    ids->push_back(rows.IntAt(0));
  }
}

void CollectPaths(Session& session, const std::string& prefix, std::vector<int64_t>* ids) {
  std::string end;
  if (EndOfPrefix(prefix, &end)) {
    Sql rows(session.db, "SELECT id FROM docs WHERE path >= ? AND path < ?");
    Collect(rows.Blob(prefix).Blob(end), ids);
  } else {
    Sql rows(session.db, "SELECT id FROM docs WHERE path >= ?");
    Collect(rows.Blob(prefix), ids);
  }
}

void CollectExact(Session& session, const Condition& condition, const Field& field,
                  std::vector<int64_t>* ids) {
  const std::string text = condition.value.asString();
  if (FoundByPath(field)) {
    CollectPaths(session, condition.prefix ? text : text + "/", ids);
  }
  const auto id = session.IdOf(condition.field);
  if (!id) {
    return;
  }
  const std::string value = field.tolower ? Fold(text) : text;
  std::string end;
  if (!condition.prefix) {
    Sql rows(session.db, "SELECT id FROM exact WHERE field = ? AND value = ?");
    Collect(rows.Int(*id).Blob(value), ids);
  } else if (EndOfPrefix(value, &end)) {
    Sql rows(session.db, "SELECT id FROM exact WHERE field = ? AND value >= ? AND value < ?");
    Collect(rows.Int(*id).Blob(value).Blob(end), ids);
  } else {
    Sql rows(session.db, "SELECT id FROM exact WHERE field = ? AND value >= ?");
    Collect(rows.Int(*id).Blob(value), ids);
  }
}

void CollectWords(Session& session, const Condition& condition, const Field& field,
                  std::vector<int64_t>* ids) {
  const std::string text = condition.value.asString();
  const bool prefix = condition.prefix || EndsInSingleIdeograph(text);
  if (session.words.QueryTokens(text, Cut::kPrefixQuery).empty()) {
    return;
  }
  session.SettleTexts();
  const std::string phrase = Quote(text) + (prefix ? " *" : "");
  if (field.lookup == Lookup::kText) {
    Sql rows(session.db, "SELECT rowid FROM texts WHERE texts MATCH ?");
    Collect(rows.Text("t" + std::to_string(field.column) + " : " + phrase), ids);
  } else {
    Sql rows(session.db, "SELECT rowid FROM words WHERE words MATCH ?");
    Collect(rows.Text((field.all ? "rest : " : "other : ") + phrase), ids);
  }
}

// Those that may fulfil the condition, among them all that do.
std::vector<int64_t> Candidates(Session& session, const Condition& condition) {
  std::vector<int64_t> ids;
  const Field field = session.schema.Rules(condition.field);
  if (field.lookup == Lookup::kNumber) {
    Sql rows(session.db, "SELECT id FROM docs");
    Collect(rows, &ids);
    return ids;
  }
  if (!condition.value.isString()) {
    return ids;
  }
  const std::string text = condition.value.asString();
  switch (field.lookup) {
    case Lookup::kKey:
      if (condition.prefix) {
        CollectPaths(session, text, &ids);
      } else {
        Sql rows(session.db, "SELECT id FROM docs WHERE path = ?");
        Collect(rows.Blob(text), &ids);
      }
      break;
    case Lookup::kGrams:
      ids = FindGrams(session, text);
      break;
    case Lookup::kText:
    case Lookup::kWords:
      CollectWords(session, condition, field, &ids);
      break;
    default:
      CollectExact(session, condition, field, &ids);
  }
  std::sort(ids.begin(), ids.end());
  ids.erase(std::unique(ids.begin(), ids.end()), ids.end());
  return ids;
}

bool TextFits(Session& session, const Field& field, const std::string& text,
              const Condition& condition) {
  const std::string wanted = condition.value.asString();
  switch (field.lookup) {
    case Lookup::kExact:
    case Lookup::kAncestor:
      return MatchesExactly(field, text, wanted, condition.prefix);
    case Lookup::kGrams: {
      const size_t at = Fold(text).find(Fold(wanted));
      return condition.prefix ? at == 0 : at != std::string::npos;
    }
    default: {
      const bool prefix = condition.prefix || EndsInSingleIdeograph(wanted);
      return session.words.Contains(
          text, session.words.QueryTokens(wanted, prefix ? Cut::kPrefixQuery : Cut::kQuery),
          prefix);
    }
  }
}

bool Fits(Session& session, StoredDocument* document, const Condition& condition) {
  if (condition.field == session.schema.Key()) {
    return condition.value.isString() &&
           (condition.prefix ? document->path.starts_with(condition.value.asString())
                             : document->path == condition.value.asString());
  }
  const auto id = session.IdOf(condition.field);
  if (!id || document->record.Find(*id) == nullptr) {
    return false;
  }
  session.FillBody(document->id, &document->record, *id);
  const Item& item = *document->record.Find(*id);
  const Field& field = session.FieldOf(*id);
  if (field.lookup == Lookup::kNumber && item.kind != Kind::kJson) {
    return !condition.prefix && SameNumber(item, condition.value);
  }
  const std::vector<std::string> texts = TextsOf(item, document->path);
  return std::any_of(texts.begin(), texts.end(), [&](const std::string& text) {
    return field.lookup == Lookup::kNumber ? text == condition.value.asString()
                                           : TextFits(session, field, text, condition);
  });
}

// Those directly in the folder that the prefix, up to its last "/", is.
std::vector<int64_t> FindFlat(Session& session, const std::string& prefix, const std::string& end,
                              const Page& page) {
  std::vector<int64_t> ids;
  size_t passed = 0;
  std::string begin = page.after < prefix ? prefix : page.after + '\0';
  for (bool is_end = false; !is_end;) {
    Sql rows(session.db, "SELECT id, path FROM docs WHERE path >= ? AND path < ? ORDER BY path");
    rows.Blob(begin).Blob(end);
    is_end = true;
    while (ids.size() < page.size && rows.Row()) {
      const std::string_view path = rows.BytesAt(1);
      const size_t slash = path.find('/', prefix.size());
      if (slash == std::string_view::npos) {
        if (passed++ >= page.from) {
          ids.push_back(rows.IntAt(0));
        }
        continue;
      }
      begin = std::string(path.substr(0, slash)) + '0';  // What follows "/".
      is_end = false;
      break;
    }
  }
  return ids;
}

// One condition on the path: the order of the index is the order that is asked for.
std::vector<int64_t> FindByPath(Session& session, const Condition& condition, const Page& page) {
  std::vector<int64_t> ids;
  const std::string text = condition.value.asString();
  // One bound, as the database uses no more of them to find the first row.
  const std::string begin = page.after < text ? text : page.after + '\0';
  std::string end;
  const auto collect = [&](Sql& rows) {
    rows.Int(static_cast<int64_t>(page.size)).Int(static_cast<int64_t>(page.from));
    Collect(rows, &ids);
  };
  if (!condition.prefix) {
    if (page.after < text) {
      Sql rows(session.db, "SELECT id FROM docs WHERE path = ? LIMIT ? OFFSET ?");
      collect(rows.Blob(text));
    }
  } else if (page.flat && EndOfPrefix(text, &end)) {
    return FindFlat(session, text, end, page);
  } else if (EndOfPrefix(text, &end)) {
    Sql rows(session.db,
             "SELECT id FROM docs WHERE path >= ? AND path < ? ORDER BY path LIMIT ? OFFSET ?");
    collect(rows.Blob(begin).Blob(end));
  } else {
    Sql rows(session.db, "SELECT id FROM docs WHERE path >= ? ORDER BY path LIMIT ? OFFSET ?");
    collect(rows.Blob(begin));
  }
  return ids;
}

}  // namespace

Conditions ParseQuery(const Json::Value& qsl) {
  Conditions conditions;
  Parse(qsl, 0, &conditions);
  return conditions;
}

bool EndOfPrefix(std::string prefix, std::string* end) {
  while (!prefix.empty() && prefix.back() == '\xFF') {
    prefix.pop_back();
  }
  if (prefix.empty()) {
    return false;
  }
  prefix.back() = static_cast<char>(static_cast<unsigned char>(prefix.back()) + 1);
  *end = std::move(prefix);
  return true;
}

std::string Quote(const std::string& text) {
  std::string quoted = "\"";
  for (const char c : text) {
    if (c == '"') {
      quoted += '"';
    }
    // FTS5 reads a query up to the first NUL; no word holds one.
    quoted += c == '\0' ? ' ' : c;
  }
  return quoted + '"';
}

std::vector<int64_t> FindGrams(Session& session, const std::string& part) {
  bool begins = false;
  std::string match;
  for (const std::string& gram : QueryGrams(part, &begins)) {
    match += match.empty() ? "" : " AND ";
    match += Quote(gram) + (begins ? " *" : "");
  }
  std::vector<int64_t> ids;
  if (!match.empty()) {
    session.SettleTexts();
    Sql rows(session.db, "SELECT rowid FROM grams WHERE grams MATCH ?");
    Collect(rows.Text(match), &ids);
  }
  return ids;
}

std::vector<int64_t> Find(Session& session, const Conditions& conditions, const Page& page) {
  if (conditions.size() == 1 && conditions[0].field == session.schema.Key() &&
      conditions[0].value.isString()) {
    return FindByPath(session, conditions[0], page);
  }
  if (page.flat) {
    throw Failure(Code::kUnknownQuery, "flat is for a prefix of the path alone");
  }
  const auto driver = std::min_element(
      conditions.begin(), conditions.end(),
      [&](const Condition& a, const Condition& b) { return Cost(session, a) < Cost(session, b); });
  std::vector<std::pair<std::string, int64_t>> found;
  for (const int64_t id : Candidates(session, *driver)) {
    auto document = session.Load(id);
    if (document && (page.after.empty() || document->path > page.after) &&
        std::all_of(conditions.begin(), conditions.end(),
                    [&](const Condition& c) { return Fits(session, &*document, c); })) {
      found.emplace_back(std::move(document->path), id);
    }
  }
  std::sort(found.begin(), found.end());
  std::vector<int64_t> ids;
  for (size_t i = page.from; i < found.size() && ids.size() < page.size; ++i) {
    ids.push_back(found[i].second);
  }
  return ids;
}

}  // namespace vexlo::elasticd
