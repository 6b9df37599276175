// Changes to the documents of one index. For one thread at a time.
#ifndef DAEMONS_KAVOELASTICD_WRITER_H_
#define DAEMONS_KAVOELASTICD_WRITER_H_

#include <json/value.h>

#include <cstddef>
#include <cstdint>
#include <functional>
#include <optional>
#include <string>
#include <vector>

#include "daemons/kavoelasticd/folder_sums.h"
#include "daemons/kavoelasticd/query.h"
#include "daemons/kavoelasticd/session.h"
#include "daemons/kavoelasticd/text_batch.h"

namespace vexlo::elasticd {

// What was below one folder gets the same place below another one.
struct FolderMove {
  // Paths without a slash at the end. Neither folder lies in the other.
  std::string from;
  std::string to;
  std::vector<std::string> folder_fields;  // Are set to the folder of the new path.
  std::string after;                       // Only documents behind this path; "" for all.
  size_t size = 0;                         // As many at most.
};

// - Changes gather in one transaction until Commit(). What was committed is on disk: the log is
//   synced before Commit() returns. What was not is gone after a crash.
// - The text indexes get their part late (TextBatch); whoever asks them gets it written before.
// - A change that a rule refuses changes nothing. One that the database refuses (a full disk) rolls
//   back everything since the last commit, and the next Commit() fails with kLost, once.
class Writer {
 public:
  // The session may write. `session` outlives the writer.
  explicit Writer(Session& session);
  ~Writer();
  Writer(const Writer&) = delete;
  Writer& operator=(const Writer&) = delete;

  // Each throws Failure: kBadDocument, kDocumentMissing, or what the database answers.
  void Upsert(const std::string& doc_id, const Json::Value& data);
  // Merges `data` into the document; null removes a field. With another path in it the document
  // moves there, instead of one that is there.
  void Set(const std::string& doc_id, const Json::Value& data);
  void Delete(const std::string& doc_id);
  size_t DeleteWhere(const Conditions& conditions);
  // Does for each document below the folder, in the order of their paths, what a List() of Set()
  // with its new path and folder does; `refused` gets the paths of those that do not move. The path
  // of the last one that was looked at; "" when none is left behind it.
  std::string MoveBelow(
      const FolderMove& move,
      const std::function<void(const std::string& path, const Failure&)>& refused);

  // Throws kLost when changes were rolled back before, once; what is left is committed even so.
  void Commit();
  // The same, and leaves it to the next Commit() to tell of what was lost.
  void CommitChanges();

  // Carries out `item` for 0 to count - 1, all under one savepoint. `item` answers for its own
  // Failures. Where the database refuses one, the list is rolled back and done again with a
  // savepoint for each item, and `refused` gets the items that fail then.
  void List(size_t count, const std::function<void(size_t)>& item,
            const std::function<void(size_t, const Failure&)>& refused);

  // Takes removed documents out of the text indexes, some thousand of them, and commits; nothing
  // else is uncommitted. Whether more are left. Throws what the database answers, with nothing
  // changed.
  bool ForgetGone();

  // Changes since the last commit.
  size_t Uncommitted() const { return changes_; }
  // Rolls back what is not committed after the database failed; see the class.
  void Lose(const std::string& reason);
  void LossIsTold() { lost_.clear(); }

 private:
  struct Change;
  struct Moving {
    int64_t id;
    std::string path;
    bool follows_path = false;  // See FollowsPath().
    uint64_t hash = 0;          // See FolderSums.
  };
  void Begin();
  void ListOneByOne(size_t count, const std::function<void(size_t)>& item,
                    const std::function<void(size_t, const Failure&)>& refused);
  void RemoveDocument(StoredDocument document);
  void ForgetSome();
  int64_t Gone();
  void Apply(Change& change);
  struct TextTable;
  static const TextTable kTextTables[TextBatch::kTables];
  void FillBodies(int64_t id, StoredDocument* document, unsigned table);
  void Reindex(Change& change, const TextTable& table);
  void WriteTexts();
  void WriteSums();
  size_t SetSavepoint(const std::string& name);
  void UndoTo(const std::string& name, size_t mark, const SqlError& error);
  unsigned ChangedTables(Change& change);
  bool Same(Change& change, const Item& before, const Item& after);
  void WriteBodies(Change& change);
  void WriteExact(Change& change);
  void WriteRows(Change& change, bool filters_differ);
  bool FollowsPath(const Record& record, const std::vector<uint32_t>& folder_fields);
  std::vector<Moving> ListMoving(const FolderMove& move);
  void MoveRow(int64_t id, const std::string& path);
  void MakeRoom(const std::string& path);
  void CheckRequired(const Json::Value& data, bool whole) const;

  Session& session_;
  TextBatch texts_;
  FolderSums sums_;  // Nothing waits there between two calls.
  bool in_list_ = false;
  std::optional<int64_t> gone_;  // Rows of that table, once they are counted.
  size_t changes_ = 0;
  std::string lost_;  // Why changes were rolled back, until it is told.
};

}  // namespace vexlo::elasticd

#endif  // DAEMONS_KAVOELASTICD_WRITER_H_
