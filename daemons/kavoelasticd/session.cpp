#include "daemons/kavoelasticd/session.h"

#include <unicode/uchar.h>

#include <set>
#include <utility>

#include "common/json.h"
#include "daemons/kavoelasticd/failure.h"
#include "daemons/kavoelasticd/folder_sums.h"
#include "daemons/kavoelasticd/pack.h"

namespace vexlo::elasticd {
namespace {

// FTS5 takes no table without columns.
std::string Columns(char letter, size_t count) {
  std::string columns;
  for (size_t i = 0; i < count || i == 0; ++i) {
    columns += letter + std::to_string(i) + ",";
  }
  return columns;
}

StoredDocument Stored(const Sql& row) {
  return {row.IntAt(0), row.StringAt(1), Record::Decode(row.StringAt(2))};
}

}  // namespace

std::string FormatVersion() { return "4, Unicode " U_UNICODE_VERSION; }

int64_t BodyId(int64_t document, uint32_t field) {
  static_assert(kBodyFields == 1 << 16);
  return static_cast<int64_t>((static_cast<uint64_t>(document) << 16) | field);
}

std::string LanguageOf(const Json::Value& settings) {
  if (!settings.isObject() || !settings.isMember("language")) {
    return "english";
  }
  if (!settings["language"].isString()) {
    throw Failure(Code::kBadMappings, "settings: language is no text");
  }
  return settings["language"].asString();
}

Session::Session(const std::string& file, Connection::Use use, const Schema& index_schema,
                 const std::string& language)
    : db(file, use),
      schema(index_schema),
      words(language),
      gives_numbers_(use != Connection::Use::kRead) {}

void Session::MakeTables(const IndexInfo& info) {
  // Contentless: what a text index is to forget is told to it from the stored document.
  const std::string contentless = "content='',tokenize='kavo " + LanguageOf(info.settings) + "')";
  db.Run(
      "PRAGMA page_size=8192; PRAGMA journal_mode=WAL; BEGIN;"
      "CREATE TABLE meta(k TEXT PRIMARY KEY, v BLOB) WITHOUT ROWID;"
      "CREATE TABLE fields(id INTEGER PRIMARY KEY, name BLOB NOT NULL UNIQUE);"
      "CREATE TABLE docs(id INTEGER PRIMARY KEY, path BLOB NOT NULL UNIQUE, ext BLOB,"
      " size INTEGER, mtime INTEGER);"
      // Documents that the text indexes are still to forget, from records and bodies.
      "CREATE TABLE gone(id INTEGER PRIMARY KEY, path BLOB NOT NULL);"
      "CREATE TABLE records(id INTEGER PRIMARY KEY, record BLOB NOT NULL);"
      // Under their own number, as a page of any other table is left half empty by texts.
      "CREATE TABLE bodies(id INTEGER PRIMARY KEY, text BLOB NOT NULL);"
      "CREATE TABLE exact(field INTEGER, value BLOB, id INTEGER,"
      " PRIMARY KEY(field, value, id)) WITHOUT ROWID;" +
      std::string(kMakeFolderSums) + "CREATE VIRTUAL TABLE texts USING fts5(" +
      Columns('t', schema.TextColumns().size()) + contentless +
      ";CREATE VIRTUAL TABLE words USING fts5(name,rest,other," + contentless +
      ";CREATE VIRTUAL TABLE grams USING fts5(" + Columns('g', schema.GramColumns().size()) +
      "content='',columnsize=0,detail=none,tokenize='kavograms');"
      // The default of 1 MB writes many small segments, which are then merged again and again.
      "INSERT INTO texts(texts, rank) VALUES('hashsize', 8388608);"
      "INSERT INTO words(words, rank) VALUES('hashsize', 4194304);"
      "INSERT INTO grams(grams, rank) VALUES('hashsize', 4194304);"
      // A page of an index fills a page of the file, and a commit merges less; Store::Rest() does.
      "INSERT INTO texts(texts, rank) VALUES('pgsz', 8000);"
      "INSERT INTO words(words, rank) VALUES('pgsz', 8000);"
      "INSERT INTO grams(grams, rank) VALUES('pgsz', 8000);"
      "INSERT INTO texts(texts, rank) VALUES('automerge', 8);"
      "INSERT INTO words(words, rank) VALUES('automerge', 8);"
      "INSERT INTO grams(grams, rank) VALUES('automerge', 8);");
  const std::pair<const char*, std::string> rows[] = {
      {"version", FormatVersion()},
      {"token", info.token},
      {"mappings", JsonToString(info.mappings)},
      {"settings", JsonToString(info.settings)},
      {"event_handler", JsonToString(info.event_handler)},
  };
  for (const auto& [key, value] : rows) {
    Sql(db, "INSERT INTO meta VALUES(?,?)").Text(key).Blob(value).Run();
  }
  for (const auto& [name, field] : schema.Listed()) {
    Sql(db, "INSERT INTO fields(name) VALUES(?)").Blob(name).Run();
  }
  db.Run("COMMIT");
}

void Session::Learn(uint32_t id, const std::string& name) {
  ids_.emplace(name, id);
  fields_.emplace(id, schema.Rules(name));
}

void Session::ReadFields() {
  Sql rows(db, "SELECT id, name FROM fields");
  while (rows.Row()) {
    Learn(static_cast<uint32_t>(rows.IntAt(0)), rows.StringAt(1));
  }
  all_read_ = true;
}

const Field& Session::FieldOf(uint32_t id) {
  auto found = fields_.find(id);
  if (found == fields_.end()) {
    ReadFields();
    found = fields_.find(id);
    if (found == fields_.end()) {
      throw Failure(Code::kIndexDamaged, "a document has a field without a name");
    }
  }
  return found->second;
}

std::optional<uint32_t> Session::IdOf(const std::string& name) {
  auto found = ids_.find(name);
  if (found == ids_.end() && !(gives_numbers_ && all_read_)) {
    ReadFields();
    found = ids_.find(name);
  }
  return found == ids_.end() ? std::nullopt : std::optional(found->second);
}

uint32_t Session::Intern(const std::string& name) {
  if (const auto id = IdOf(name)) {
    return *id;
  }
  Sql(db, "INSERT INTO fields(name) VALUES(?)").Blob(name).Run();
  const auto id = static_cast<uint32_t>(db.LastInsertId());
  Learn(id, name);
  return id;
}

void Session::ForgetFields() {
  ids_.clear();
  fields_.clear();
  all_read_ = false;
}

std::optional<StoredDocument> Session::Load(int64_t id) {
  Sql row(db,
          "SELECT d.id, d.path, r.record FROM docs d CROSS JOIN records r ON r.id = d.id"
          " WHERE d.id = ?");
  return row.Int(id).Row() ? std::optional(Stored(row)) : std::nullopt;
}

std::optional<StoredDocument> Session::LoadByPath(const std::string& path) {
  Sql row(db,
          "SELECT d.id, d.path, r.record FROM docs d CROSS JOIN records r ON r.id = d.id"
          " WHERE d.path = ?");
  return row.Blob(path).Row() ? std::optional(Stored(row)) : std::nullopt;
}

void Session::FillBody(int64_t id, Record* record, uint32_t field) {
  const Item* item = record->Find(field);
  if (item == nullptr || item->kind != Kind::kBody || item->bytes.data() != nullptr) {
    return;
  }
  Sql row(db, "SELECT text FROM bodies WHERE id = ?");
  if (!row.Int(BodyId(id, field)).Row()) {
    throw Failure(Code::kIndexDamaged, "the text of a document is missing");
  }
  record->Fill(field, Unpack(row.BytesAt(0)));
}

Selection Session::Select(const std::vector<std::string>& names) {
  if (names.empty()) {
    return {};
  }
  Selection selection = {/*key=*/false, /*all=*/false};
  const std::set<std::string> once(names.begin(), names.end());
  for (const std::string& name : once) {
    if (name == schema.Key()) {
      selection.key = true;
    } else if (const auto id = IdOf(name)) {
      selection.ids.push_back(*id);
    }
  }
  return selection;
}

Json::Value Session::Fields(StoredDocument* document, const Selection& selection) {
  Json::Value out(Json::objectValue);
  const auto add = [&](uint32_t id) {
    const Field& field = FieldOf(id);
    if (field.stored) {
      FillBody(document->id, &document->record, id);
      out[field.name] = JsonOf(*document->record.Find(id), document->path);
    }
  };
  if (selection.key) {
    out[schema.Key()] = document->path;
  }
  if (selection.all) {
    const std::vector<Item> items = document->record.Items();
    for (const Item& item : items) {
      add(item.field);
    }
  }
  for (const uint32_t id : selection.ids) {
    if (document->record.Find(id) != nullptr) {
      add(id);
    }
  }
  return out;
}

}  // namespace vexlo::elasticd
