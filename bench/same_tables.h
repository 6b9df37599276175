// What a program without an engine does to fill an index: a baseline.
#ifndef BENCH_SAME_TABLES_H_
#define BENCH_SAME_TABLES_H_

#include <json/value.h>

#include <algorithm>
#include <cstddef>
#include <cstdint>
#include <string>
#include <utility>
#include <vector>

#include "daemons/kavoelasticd/pack.h"
#include "daemons/kavoelasticd/rows.h"
#include "daemons/kavoelasticd/schema.h"
#include "daemons/kavoelasticd/session.h"
#include "daemons/kavoelasticd/store.h"
#include "fileindex/elastic_control/share_index.h"

namespace bench {

// The same tables as an index of the engine has, filled with the same rows by prepared statements
// on one connection, with the engine's pages, caches and full synchronisation.
class SameTables {
 public:
  explicit SameTables(const std::string& folder)
      : mappings_(vexlo::fileindex::elastic::GetFileIndexMappings()),
        schema_(mappings_),
        session_(Make(folder, mappings_), vexlo::elasticd::Connection::Use::kWrite, schema_,
                 "english") {
    session_.db.Run(
        "PRAGMA synchronous=FULL; PRAGMA cache_size=-32768; PRAGMA wal_autocheckpoint=4000");
  }

  struct Document {
    std::string path;
    vexlo::elasticd::DocsRow docs;
    std::string record;
    vexlo::elasticd::ExactRows exact;
    std::vector<std::pair<uint32_t, std::string>> bodies;
    std::vector<vexlo::elasticd::TextRow> texts;
  };

  Document Rows(const Json::Value& data) {
    vexlo::elasticd::StoredDocument document;
    document.path = data[schema_.Key()].asString();
    for (auto member = data.begin(); member != data.end(); ++member) {
      if (member.name() != schema_.Key()) {
        const uint32_t id = session_.Intern(member.name());
        SetField(&document.record, id, session_.FieldOf(id), *member, document.path);
      }
    }
    Document rows;
    rows.path = document.path;
    rows.docs = DocsRowOf(session_, document);
    rows.record = document.record.Encode();
    rows.exact = ExactRowsOf(session_, document);
    for (const vexlo::elasticd::Item& item : document.record.Items()) {
      if (item.kind == vexlo::elasticd::Kind::kBody) {
        rows.bodies.emplace_back(item.field, item.bytes);
      }
    }
    rows.texts = {
        TextRowOf(session_, document, vexlo::elasticd::kTexts, schema_.TextColumns().size()),
        TextRowOf(session_, document, vexlo::elasticd::kWordTable, 3),
        TextRowOf(session_, document, vexlo::elasticd::kGramTable, schema_.GramColumns().size())};
    return rows;
  }

  void Insert(const Document& document) {
    using vexlo::elasticd::Sql;
    vexlo::elasticd::Connection& db = session_.db;
    Sql(db, "INSERT INTO records(record) VALUES(?)").Blob(document.record).Run();
    const int64_t id = db.LastInsertId();
    Sql(db, "INSERT INTO docs(id, path, ext, size, mtime) VALUES(?,?,?,?,?)")
        .Int(id)
        .Blob(document.path)
        .Blob(*document.docs.extension)
        .Int(*document.docs.size)
        .Int(*document.docs.modified)
        .Run();
    for (const auto& [field, value] : document.exact) {
      Sql(db, "INSERT INTO exact VALUES(?,?,?)").Int(field).Blob(value).Int(id).Run();
    }
    for (const auto& [field, text] : document.bodies) {
      const std::string packed = vexlo::elasticd::Pack(text);
      Sql(db, "INSERT INTO bodies VALUES(?,?)")
          .Int(vexlo::elasticd::BodyId(id, field))
          .Blob(packed)
          .Run();
    }
    for (size_t table = 0; table < document.texts.size(); ++table) {
      const vexlo::elasticd::TextRow& row = document.texts[table];
      if (std::all_of(row.begin(), row.end(), [](const std::string& t) { return t.empty(); })) {
        continue;
      }
      Sql insert(db, inserts_[table]);
      insert.Int(id);
      for (const std::string& text : row) {
        insert.Text(text);
      }
      insert.Run();
    }
  }

  void Execute(const char* sql) { session_.db.Run(sql); }

 private:
  static std::string Make(const std::string& folder, const Json::Value& mappings) {
    vexlo::elasticd::Store::Create(folder + "/same", {"token", mappings, {}, {}});
    return vexlo::elasticd::DatabaseFile(folder + "/same");
  }
  static std::string InsertSql(const std::string& table, const std::string& columns, size_t count) {
    std::string marks;
    for (size_t i = 0; i < count; ++i) {
      marks += ",?";
    }
    return "INSERT INTO " + table + "(rowid" + columns + ") VALUES(?" + marks + ")";
  }
  static std::string Numbered(char letter, size_t count) {
    std::string columns;
    for (size_t i = 0; i < count; ++i) {
      columns += ',';
      columns += letter;
      columns += std::to_string(i);
    }
    return columns;
  }

  const Json::Value mappings_;
  const vexlo::elasticd::Schema schema_;
  vexlo::elasticd::Session session_;
  const std::string inserts_[3] = {
      InsertSql("texts", Numbered('t', schema_.TextColumns().size()), schema_.TextColumns().size()),
      InsertSql("words", ",name,rest,other", 3),
      InsertSql("grams", Numbered('g', schema_.GramColumns().size()),
                schema_.GramColumns().size())};
};

}  // namespace bench

#endif  // BENCH_SAME_TABLES_H_
