// For each folder, the digest of the documents that stand directly in it, kept beside them.
#ifndef DAEMONS_KAVOELASTICD_FOLDER_SUMS_H_
#define DAEMONS_KAVOELASTICD_FOLDER_SUMS_H_

#include <json/value.h>

#include <cstdint>
#include <optional>
#include <string>
#include <unordered_map>

#include "daemons/common/entry_digest.h"
#include "daemons/kavoelasticd/session.h"

namespace vexlo::elasticd {

// What the table of digests holds changes with the documents, in one transaction with them, so
// whoever changes a document changes the digest. For one thread at a time.
//
// Changes wait here until Write(), as many of one folder come together. Nothing waits when a
// savepoint is set or somebody reads.
class FolderSums {
 public:
  // The session may write, and outlives this.
  explicit FolderSums(Session& session) : session_(session) {}

  // The hash of the document in its folder.
  uint64_t HashOf(const std::string& path, const Record& record);

  // The documents `before` and `after` stand for each other; one without a path is none.
  void Change(const StoredDocument& before, const StoredDocument& after);
  // A document with this hash keeps its name and fields, and gets another folder.
  void Move(const std::string& path_old, const std::string& path, uint64_t hash);

  // Throws what the database answers.
  void Write();
  // The transaction or the savepoint was rolled back.
  void Clear() { changes_.clear(); }

 private:
  Session& session_;
  std::optional<uint64_t> seed_;
  std::unordered_map<std::string, daemon::FolderDigest> changes_;  // By keys, see KeyOf().
};

// The statement that makes the table.
extern const char kMakeFolderSums[];

// folder_digests: those of a folder and of all below it. Throws Failure.
Json::Value GetFolderDigests(Session& session, const Json::Value& data);

}  // namespace vexlo::elasticd

#endif  // DAEMONS_KAVOELASTICD_FOLDER_SUMS_H_
