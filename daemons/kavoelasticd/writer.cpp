#include "daemons/kavoelasticd/writer.h"

#include <algorithm>
#include <map>
#include <optional>
#include <utility>
#include <vector>

#include "common/string.h"
#include "daemons/kavoelasticd/failure.h"
#include "daemons/kavoelasticd/pack.h"
#include "daemons/kavoelasticd/rows.h"

namespace vexlo::elasticd {
namespace {

constexpr size_t kDeleteSlice = 10'000;

// Removed documents that the text indexes may still know; more are forgotten at the next commit.
constexpr int64_t kMostGone = 20'000;
constexpr int64_t kForgottenAtOnce = 2'000;

// Texts that wait for their indexes; as much again is in the indexes' own memory.
constexpr size_t kBatchBytes = size_t{4} << 20;

template <typename T>
void Bind(Sql& sql, const std::optional<T>& value) {
  if (!value) {
    sql.Null();
  } else if constexpr (std::is_same_v<T, std::string>) {
    sql.Blob(*value);
  } else {
    sql.Int(*value);
  }
}

}  // namespace

// A text index, and what of TablesOf() a field is in it by.
struct Writer::TextTable {
  TextBatch::TextTable index;
  unsigned fields;
};

constexpr Writer::TextTable Writer::kTextTables[] = {
    {TextBatch::kTexts, kTexts}, {TextBatch::kWords, kWordTable}, {TextBatch::kGrams, kGramTable}};

// `before` and `after` are the same document; a record without a path is none.
struct Writer::Change {
  StoredDocument before;
  StoredDocument after;
  std::vector<uint32_t> new_bodies = {};
};

Writer::Writer(Session& session) : session_(session), texts_(session), sums_(session) {
  session_.SetBeforeTexts([this] { WriteTexts(); });
}

Writer::~Writer() { session_.SetBeforeTexts({}); }

void Writer::Begin() {
  if (!session_.db.InTransaction()) {
    session_.db.Run("BEGIN IMMEDIATE");
  }
}

void Writer::Lose(const std::string& reason) {
  lost_ = reason;
  changes_ = 0;
  in_list_ = false;
  gone_.reset();
  texts_.Clear();
  sums_.Clear();
  session_.ForgetFields();
  if (session_.db.InTransaction()) {
    session_.db.Run("ROLLBACK");
  }
}

void Writer::CommitChanges() {
  if (session_.db.InTransaction()) {
    while (Gone() > kMostGone) {
      ForgetSome();
    }
    WriteTexts();
    session_.db.Run("COMMIT");
  }
  texts_.Clear();
  changes_ = 0;
}

// A part of what waits cannot be taken back alone.
void Writer::WriteTexts() {
  try {
    texts_.Write();
  } catch (const std::exception& error) {
    Lose(error.what());
    throw;
  }
}

void Writer::Commit() {
  CommitChanges();
  if (!lost_.empty()) {
    throw Failure(Code::kLost, "changes were lost before: " + std::exchange(lost_, {}));
  }
}

void Writer::CheckRequired(const Json::Value& data, bool whole) const {
  if (!data.isObject()) {
    throw Failure(Code::kBadDocument, "the document is no object");
  }
  for (const auto& [name, field] : session_.schema.Listed()) {
    if (field.required && name != session_.schema.Key() && (whole || data.isMember(name)) &&
        data[name].isNull()) {
      throw Failure(Code::kBadDocument, name + " is required");
    }
  }
  const Json::Value& key = data[session_.schema.Key()];
  if (!key.isNull() && (!key.isString() || key.asString().empty())) {
    throw Failure(Code::kBadDocument, session_.schema.Key() + " is no path");
  }
}

void Writer::Upsert(const std::string& doc_id, const Json::Value& data) {
  CheckRequired(data, /*whole=*/true);
  const Json::Value& key = data[session_.schema.Key()];
  const std::string path = key.isString() ? key.asString() : doc_id;
  if (path.empty()) {
    throw Failure(Code::kBadDocument, "the document has no path");
  }
  // Values are converted before anything changes; fields are numbered in the transaction.
  Begin();
  Change change;
  change.after.path = path;
  for (auto member = data.begin(); member != data.end(); ++member) {
    const std::string name = member.name();
    if (name != session_.schema.Key() && !member->isNull()) {
      const uint32_t id = session_.Intern(name);
      SetField(&change.after.record, id, session_.FieldOf(id), *member, path);
    }
  }
  if (auto found = session_.LoadByPath(path)) {
    change.after.id = found->id;
    change.before = std::move(*found);
  }
  Apply(change);
}

void Writer::Set(const std::string& doc_id, const Json::Value& data) {
  CheckRequired(data, /*whole=*/false);
  auto found = session_.LoadByPath(doc_id);
  if (!found) {
    throw Failure(Code::kDocumentMissing, "no document at " + doc_id);
  }
  const Json::Value& key = data[session_.schema.Key()];
  Begin();
  Change change;
  change.after.id = found->id;
  change.after.path = key.isString() ? key.asString() : found->path;
  change.after.record = found->record.Copy();
  change.before = std::move(*found);
  Record* const record = &change.after.record;
  const bool folder_differs = Dirname(change.before.path) != Dirname(change.after.path);
  const bool name_differs = Basename(change.before.path) != Basename(change.after.path);
  for (const Item& item : change.before.record.Items()) {
    if ((item.kind == Kind::kParent && folder_differs) ||
        (item.kind == Kind::kName && name_differs)) {
      // The value stays what it was, unless the data says otherwise.
      const Field& field = session_.FieldOf(item.field);
      SetField(record, item.field, field, TextOf(item, change.before.path), change.after.path);
    }
  }
  for (auto member = data.begin(); member != data.end(); ++member) {
    const std::string name = member.name();
    if (name == session_.schema.Key()) {
      continue;
    }
    const uint32_t id = session_.Intern(name);
    if (member->isNull()) {
      record->Remove(id);
    } else {
      SetField(record, id, session_.FieldOf(id), *member, change.after.path);
    }
  }
  Apply(change);
}

// Whether a move to another folder changes no row of the document but its path: the fields that are
// its folder are those, and are found by the path alone.
bool Writer::FollowsPath(const Record& record, const std::vector<uint32_t>& folder_fields) {
  size_t following = 0;
  for (const Item& item : record.Items()) {
    if (item.kind == Kind::kParent) {
      const Field& field = session_.FieldOf(item.field);
      const unsigned by_path = FoundByPath(field) ? static_cast<unsigned>(kExactTable) : 0;
      if ((TablesOf(field) & ~by_path) != 0 || std::find(folder_fields.begin(), folder_fields.end(),
                                                         item.field) == folder_fields.end()) {
        return false;
      }
      ++following;
    }
  }
  return following == folder_fields.size();
}

std::vector<Writer::Moving> Writer::ListMoving(const FolderMove& move) {
  std::vector<uint32_t> fields;
  fields.reserve(move.folder_fields.size());
  bool all_known = true;  // A field without a number is in no document yet.
  for (const std::string& name : move.folder_fields) {
    const auto id = session_.IdOf(name);
    all_known = all_known && id;
    fields.push_back(id.value_or(0));
  }
  std::sort(fields.begin(), fields.end());
  fields.erase(std::unique(fields.begin(), fields.end()), fields.end());
  const std::string below = move.from + "/";
  const std::string end = move.from + "0";  // What follows "/".
  const std::string begin = move.after < below ? below : move.after + '\0';
  Sql rows(session_.db,
           "SELECT d.id, d.path, r.record FROM docs d CROSS JOIN records r ON r.id = d.id"
           " WHERE d.path >= ? AND d.path < ? ORDER BY d.path LIMIT ?");
  rows.Blob(begin).Blob(end).Int(static_cast<int64_t>(move.size));
  std::vector<Moving> page;
  while (rows.Row()) {
    Moving moving = {rows.IntAt(0), rows.StringAt(1)};
    const Record record = Record::Decode(rows.StringAt(2));
    moving.follows_path = all_known && FollowsPath(record, fields);
    moving.hash = sums_.HashOf(moving.path, record);
    page.push_back(std::move(moving));
  }
  return page;
}

std::string Writer::MoveBelow(
    const FolderMove& move,
    const std::function<void(const std::string& path, const Failure&)>& refused) {
  const std::vector<Moving> page = ListMoving(move);
  if (page.empty()) {
    return "";
  }
  std::map<size_t, Failure> failures;
  const auto move_one = [&](size_t i) {
    const std::string path = move.to + page[i].path.substr(move.from.size());
    failures.erase(i);
    if (page[i].follows_path) {
      MoveRow(page[i].id, path);
      sums_.Move(page[i].path, path, page[i].hash);
      ++changes_;
      return;
    }
    Json::Value data(Json::objectValue);
    for (const std::string& name : move.folder_fields) {
      data[name] = Dirname(path);
    }
    data[session_.schema.Key()] = path;
    try {
      Set(page[i].path, data);
    } catch (const Failure& failure) {
      if (!failure.IsAnswer()) {
        throw;
      }
      failures.emplace(i, failure);
    }
  };
  List(page.size(), move_one,
       [&](size_t i, const Failure& failure) { failures.insert_or_assign(i, failure); });
  for (const auto& [i, failure] : failures) {
    refused(page[i].path, failure);
  }
  return page.size() < move.size ? "" : page.back().path;
}

void Writer::Delete(const std::string& doc_id) {
  if (auto found = session_.LoadByPath(doc_id)) {
    Begin();
    RemoveDocument(std::move(*found));
    WriteSums();
  }
}

size_t Writer::DeleteWhere(const Conditions& conditions) {
  size_t deleted = 0;
  for (;;) {
    // What is deleted is found no more, so every slice begins at the front.
    std::vector<int64_t> ids = Find(session_, conditions, {.after = "", .size = kDeleteSlice});
    // In the order of their rows.
    std::sort(ids.begin(), ids.end());
    for (const int64_t id : ids) {
      if (auto found = session_.Load(id)) {
        Begin();
        RemoveDocument(std::move(*found));
        ++deleted;
      }
    }
    WriteSums();
    if (ids.size() < kDeleteSlice) {
      return deleted;
    }
  }
}

// What the text indexes have of it is forgotten later, by ForgetGone(): that takes as long as
// adding it did.
void Writer::RemoveDocument(StoredDocument document) {
  Change change;
  change.after.id = document.id;
  change.before = std::move(document);
  WriteExact(change);
  Sql(session_.db, "INSERT INTO gone VALUES(?,?)")
      .Int(change.after.id)
      .Blob(change.before.path)
      .Run();
  Sql(session_.db, "DELETE FROM docs WHERE id = ?").Int(change.after.id).Run();
  sums_.Change(change.before, {});
  gone_ = gone_ ? std::optional(*gone_ + 1) : std::nullopt;
  ++changes_;
}

bool Writer::ForgetGone() {
  if (Gone() == 0) {
    return false;
  }
  std::string lost = lost_;
  try {
    Begin();
    ForgetSome();
    session_.db.Run("COMMIT");
    texts_.Clear();
  } catch (...) {
    // No client's change is lost with it.
    lost_ = std::move(lost);
    gone_.reset();
    texts_.Clear();
    if (session_.db.InTransaction()) {
      session_.db.Run("ROLLBACK");
    }
    throw;
  }
  return Gone() > 0;
}

int64_t Writer::Gone() {
  if (!gone_) {
    Sql count(session_.db, "SELECT count(*) FROM gone");
    count.Row();
    gone_ = count.IntAt(0);
  }
  return *gone_;
}

void Writer::ForgetSome() {
  std::vector<StoredDocument> documents;
  {
    Sql rows(session_.db,
             "SELECT g.id, g.path, r.record FROM gone g CROSS JOIN records r ON r.id = g.id"
             " ORDER BY g.id LIMIT ?");
    rows.Int(kForgottenAtOnce);
    while (rows.Row()) {
      documents.push_back({rows.IntAt(0), rows.StringAt(1), Record::Decode(rows.StringAt(2))});
    }
  }
  if (documents.empty()) {
    throw Failure(Code::kIndexDamaged, "a removed document has no record");
  }
  for (StoredDocument& document : documents) {
    Change change;
    change.after.id = document.id;
    change.before = std::move(document);
    for (const TextTable& table : kTextTables) {
      Reindex(change, table);
    }
    WriteBodies(change);
    Sql(session_.db, "DELETE FROM records WHERE id = ?").Int(change.after.id).Run();
    Sql(session_.db, "DELETE FROM gone WHERE id = ?").Int(change.after.id).Run();
    if (texts_.Bytes() >= kBatchBytes) {
      WriteTexts();
    }
  }
  gone_.reset();
  WriteTexts();
}

bool Writer::Same(Change& change, const Item& before, const Item& after) {
  if (IsText(before) != IsText(after) || (!IsText(before) && before.kind != after.kind)) {
    return false;
  }
  if (!IsText(before)) {
    return before.bytes == after.bytes;
  }
  if (after.kind == Kind::kBody && after.bytes.data() == nullptr) {
    return true;
  }
  session_.FillBody(change.before.id, &change.before.record, before.field);
  return TextOf(*change.before.record.Find(before.field), change.before.path) ==
         TextOf(after, change.after.path);
}

// The tables that hold a field whose value differs.
unsigned Writer::ChangedTables(Change& change) {
  unsigned tables = 0;
  for (const Item& before : change.before.record.Items()) {
    const Item* const after = change.after.record.Find(before.field);
    const bool same = after != nullptr && Same(change, before, *after);
    if (same && before.kind == after->kind) {
      continue;
    }
    const Field& field = session_.FieldOf(before.field);
    const unsigned all = TablesOf(field);
    unsigned changed = same ? 0U : all;
    if (after != nullptr && FoundByPath(field)) {
      // A value that follows from the path has no entry; one that ceases to needs one.
      const bool by_path = before.kind == Kind::kParent;
      if (by_path != (after->kind == Kind::kParent)) {
        changed |= all & kExactTable;
      } else if (by_path) {
        changed &= ~static_cast<unsigned>(kExactTable);
      }
    }
    tables |= changed;
  }
  for (const Item& after : change.after.record.Items()) {
    if (change.before.record.Find(after.field) == nullptr) {
      tables |= TablesOf(session_.FieldOf(after.field));
    }
  }
  return tables;
}

// Reads the long texts of the fields that are in `table`.
void Writer::FillBodies(int64_t id, StoredDocument* document, unsigned table) {
  // By number: what is filled in takes the place of the item that is there.
  const std::vector<Item>& items = document->record.Items();
  for (size_t i = 0; i < items.size(); ++i) {
    if (items[i].kind == Kind::kBody && (TablesOf(session_.FieldOf(items[i].field)) & table) != 0) {
      session_.FillBody(id, &document->record, items[i].field);
    }
  }
}

void Writer::Reindex(Change& change, const TextTable& table) {
  const auto row_of = [&](StoredDocument& document) {
    FillBodies(change.after.id, &document, table.fields);
    TextRow row = TextRowOf(session_, document, table.fields, texts_.ColumnsOf(table.index));
    const bool empty =
        std::all_of(row.begin(), row.end(), [](const std::string& text) { return text.empty(); });
    return empty ? TextRow() : row;
  };
  TextRow before;
  if (!texts_.Holds(table.index, change.after.id)) {
    before = row_of(change.before);
  }
  texts_.Put(table.index, change.after.id, std::move(before), row_of(change.after));
}

void Writer::WriteBodies(Change& change) {
  const auto is_body = [](const Item* item) {
    return item != nullptr && item->kind == Kind::kBody;
  };
  for (const Item& item : change.before.record.Items()) {
    if (is_body(&item) && !is_body(change.after.record.Find(item.field))) {
      Sql(session_.db, "DELETE FROM bodies WHERE id = ?")
          .Int(BodyId(change.after.id, item.field))
          .Run();
    }
  }
  for (const uint32_t field : change.new_bodies) {
    const std::string packed = Pack(change.after.record.Find(field)->bytes);
    Sql(session_.db, "INSERT OR REPLACE INTO bodies VALUES(?,?)")
        .Int(BodyId(change.after.id, field))
        .Blob(packed)
        .Run();
  }
}

void Writer::WriteExact(Change& change) {
  for (StoredDocument* document : {&change.before, &change.after}) {
    FillBodies(change.after.id, document, kExactTable);
  }
  const ExactRows before = ExactRowsOf(session_, change.before);
  const ExactRows after = ExactRowsOf(session_, change.after);
  const auto write = [&](const ExactRows& rows, const ExactRows& kept, const char* text) {
    for (const auto& row : rows) {
      if (!std::binary_search(kept.begin(), kept.end(), row)) {
        Sql(session_.db, text).Int(row.first).Blob(row.second).Int(change.after.id).Run();
      }
    }
  };
  write(before, after, "DELETE FROM exact WHERE field = ? AND value = ? AND id = ?");
  write(after, before, "INSERT INTO exact VALUES(?,?,?)");
}

// Removes the document that stands where another one is to stand.
void Writer::MakeRoom(const std::string& path) {
  if (auto found = session_.LoadByPath(path)) {
    RemoveDocument(std::move(*found));
  }
}

void Writer::WriteRows(Change& change, bool filters_differ) {
  Connection& db = session_.db;
  const bool exists = !change.before.path.empty();
  if (!exists) {
    // Records give the number: they still have those that the text indexes have not forgotten.
    const std::string record = change.after.record.Encode();
    Sql(db, "INSERT INTO records(record) VALUES(?)").Blob(record).Run();
    change.after.id = db.LastInsertId();
    const DocsRow row = DocsRowOf(session_, change.after);
    Sql docs(db, "INSERT INTO docs(id, path, ext, size, mtime) VALUES(?,?,?,?,?)");
    docs.Int(change.after.id).Blob(change.after.path);
    Bind(docs, row.extension);
    Bind(docs, row.size);
    Bind(docs, row.modified);
    docs.Run();
    return;
  }
  if (!change.after.record.SameStored(change.before.record)) {
    const std::string record = change.after.record.Encode();
    Sql(db, "UPDATE records SET record = ? WHERE id = ?").Blob(record).Int(change.after.id).Run();
  }
  const bool moved = change.before.path != change.after.path;
  if (filters_differ) {
    const DocsRow row = DocsRowOf(session_, change.after);
    Sql docs(db, "UPDATE docs SET ext = ?, size = ?, mtime = ? WHERE id = ?");
    Bind(docs, row.extension);
    Bind(docs, row.size);
    Bind(docs, row.modified);
    docs.Int(change.after.id).Run();
  }
  if (moved) {
    MoveRow(change.after.id, change.after.path);
  }
}

void Writer::MoveRow(int64_t id, const std::string& path) {
  const auto move = [&] {
    return Sql(session_.db, "UPDATE docs SET path = ? WHERE id = ?")
        .Blob(path)
        .Int(id)
        .RunUnlessTaken();
  };
  if (!move()) {
    MakeRoom(path);
    if (!move()) {
      throw Failure(Code::kInternal, "a path is taken by no document: " + path);
    }
  }
}

void Writer::Apply(Change& change) {
  for (const Item& item : change.after.record.Items()) {
    if (item.kind == Kind::kBody && item.bytes.data() != nullptr) {
      change.new_bodies.push_back(item.field);
    }
  }
  const unsigned tables = ChangedTables(change);
  const bool exists = !change.before.path.empty();
  const bool filters_differ = (tables & kDocsTable) != 0;
  if (!exists) {
    WriteRows(change, filters_differ);
  }
  for (const TextTable& table : kTextTables) {
    if ((tables & table.fields) != 0) {
      Reindex(change, table);
    }
  }
  if ((tables & kExactTable) != 0) {
    WriteExact(change);
  }
  if (exists) {
    WriteRows(change, filters_differ);
  }
  WriteBodies(change);
  sums_.Change(change.before, change.after);
  WriteSums();
  ++changes_;
  if (!in_list_ && texts_.Bytes() >= kBatchBytes) {
    WriteTexts();
  }
}

// Those of a list go together.
void Writer::WriteSums() {
  if (!in_list_) {
    sums_.Write();
  }
}

void Writer::List(size_t count, const std::function<void(size_t)>& item,
                  const std::function<void(size_t, const Failure&)>& refused) {
  Begin();
  const size_t changes = changes_;
  const size_t mark = SetSavepoint("list");
  in_list_ = true;
  try {
    for (size_t i = 0; i < count; ++i) {
      item(i);
    }
    sums_.Write();
  } catch (const SqlError& error) {
    UndoTo("list", mark, error);
    changes_ = changes;
    ListOneByOne(count, item, refused);
  }
  session_.db.Run("RELEASE list");
  in_list_ = false;
  texts_.DropMarks();
  if (texts_.Bytes() >= kBatchBytes) {
    WriteTexts();
  }
}

void Writer::ListOneByOne(size_t count, const std::function<void(size_t)>& item,
                          const std::function<void(size_t, const Failure&)>& refused) {
  for (size_t i = 0; i < count; ++i) {
    const size_t mark = SetSavepoint("item");
    try {
      item(i);
      sums_.Write();
    } catch (const SqlError& error) {
      UndoTo("item", mark, error);
      refused(i, error);
    }
    session_.db.Run("RELEASE item");
  }
}

size_t Writer::SetSavepoint(const std::string& name) {
  session_.db.Run("SAVEPOINT " + name);
  return texts_.SetMark();
}

// Throws the error on when it is not about one statement, or the list's texts are in the database.
void Writer::UndoTo(const std::string& name, size_t mark, const SqlError& error) {
  if (!error.OfStatement() || !session_.db.InTransaction() || !texts_.Undo(mark)) {
    throw SqlError(error);
  }
  session_.db.Run("ROLLBACK TO " + name);
  sums_.Clear();
  session_.ForgetFields();
  gone_.reset();
}

}  // namespace vexlo::elasticd
