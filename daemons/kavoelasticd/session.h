// One connection to an index with what goes with it. For one thread at a time.
#ifndef DAEMONS_KAVOELASTICD_SESSION_H_
#define DAEMONS_KAVOELASTICD_SESSION_H_

#include <json/value.h>

#include <cstdint>
#include <functional>
#include <optional>
#include <string>
#include <unordered_map>
#include <utility>
#include <vector>

#include "daemons/kavoelasticd/document.h"
#include "daemons/kavoelasticd/record.h"
#include "daemons/kavoelasticd/schema.h"
#include "daemons/kavoelasticd/sqlite.h"
#include "daemons/kavoelasticd/tokens.h"

namespace vexlo::elasticd {

// What an index was made with.
struct IndexInfo {
  std::string token;  // Tells this index from every other; also in the registry.
  Json::Value mappings;
  Json::Value settings;
  Json::Value event_handler;
};

// The Snowball algorithm that the settings name: "english" without one.
std::string LanguageOf(const Json::Value& settings);

// Of the tables and of what cuts texts into words: a text index forgets only what is cut as it was
// when it was learnt, so an index of another version is made anew.
std::string FormatVersion();

// The number of a text of its own: of the document, then the field, which is below kBodyFields.
int64_t BodyId(int64_t document, uint32_t field);

struct StoredDocument {
  int64_t id = 0;
  std::string path;
  Record record;
};

// Which fields of documents are asked for.
struct Selection {
  bool key = true;
  bool all = true;
  std::vector<uint32_t> ids = {};
};

class Session {
 public:
  // `schema` outlives the session.
  Session(const std::string& file, Connection::Use use, const Schema& schema,
          const std::string& language);

  // Makes the tables of a new index.
  void MakeTables(const IndexInfo& info);

  Connection db;
  const Schema& schema;
  WordCutter words;

  // Fields have numbers, given as they come up. Throws Failure kIndexDamaged for a number that is
  // not given.
  const Field& FieldOf(uint32_t id);
  std::optional<uint32_t> IdOf(const std::string& name);
  // The number of a field, given now when it has none: for the connection that writes.
  uint32_t Intern(const std::string& name);
  // After a rollback, numbers may be given anew.
  void ForgetFields();

  // Called before a text index is asked, for changes that are not in it yet. Not set, or what was
  // written waits for nothing.
  void SetBeforeTexts(std::function<void()> before) { before_texts_ = std::move(before); }
  void SettleTexts() {
    if (before_texts_) {
      before_texts_();
    }
  }

  std::optional<StoredDocument> Load(int64_t id);
  std::optional<StoredDocument> LoadByPath(const std::string& path);
  // Reads the text of a kBody item that is not known yet, into the record.
  void FillBody(int64_t id, Record* record, uint32_t field);
  Selection Select(const std::vector<std::string>& names);
  // The document's fields as JSON: those selected that it has and that are stored.
  Json::Value Fields(StoredDocument* document, const Selection& selection);

 private:
  std::function<void()> before_texts_;

  void ReadFields();
  // Whether every name that is not known has no number: only this connection gives them.
  const bool gives_numbers_;
  bool all_read_ = false;
  void Learn(uint32_t id, const std::string& name);

  std::unordered_map<std::string, uint32_t> ids_;
  std::unordered_map<uint32_t, Field> fields_;
};

}  // namespace vexlo::elasticd

#endif  // DAEMONS_KAVOELASTICD_SESSION_H_
