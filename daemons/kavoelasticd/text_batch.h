// What the text indexes are still to forget and to learn. For one thread at a time.
#ifndef DAEMONS_KAVOELASTICD_TEXT_BATCH_H_
#define DAEMONS_KAVOELASTICD_TEXT_BATCH_H_

#include <array>
#include <cstddef>
#include <cstdint>
#include <map>
#include <optional>
#include <string>
#include <vector>

#include "daemons/kavoelasticd/session.h"

namespace vexlo::elasticd {

// The columns of a text index for one document; without columns where it has no words there.
using TextRow = std::vector<std::string>;

// FTS5 gathers words in memory and writes them out as a segment, to be merged with others later,
// whenever a lower document number follows a higher one, and at each savepoint. So changes wait
// here and go to it in the order of their numbers; of several changes to one document only the
// first row before and the last row after are left.
class TextBatch {
 public:
  static constexpr size_t kTables = 3;  // In the order of kTextTables.
  enum TextTable : size_t { kTexts, kWords, kGrams };

  // The session may write, and outlives the batch.
  explicit TextBatch(Session& session);

  // How many columns the table has.
  size_t ColumnsOf(TextTable table) const { return statements_[table].columns; }
  // Whether the database has other words of the document than its last row, so that the row before
  // a change is known here.
  bool Holds(TextTable table, int64_t id) const { return changes_[table].contains(id); }
  // The document's row changes; `before` is not looked at when the batch Holds() it.
  void Put(TextTable table, int64_t id, TextRow before, TextRow after);

  // What waits goes to the database, in a transaction. When it throws, that is to be rolled back.
  void Write();
  // What waits is no longer wanted: the transaction was rolled back, and savepoints with it.
  void Clear();
  // Of the texts that wait.
  size_t Bytes() const { return bytes_; }

  // A savepoint was set. Only then may one be undone. They nest.
  size_t SetMark();
  // Back to what waited at the mark; false, and nothing changes, when some of it was written since.
  bool Undo(size_t mark);
  // The outermost savepoint was released.
  void DropMarks();

 private:
  struct Waiting {
    TextRow before;
    TextRow after;
  };
  struct Step {
    TextTable table;
    int64_t id;
    std::optional<Waiting> before;
  };
  struct Statements {
    size_t columns;
    std::string insert;
    std::string remove;
  };
  void Run(const std::string& sql, int64_t id, const TextRow& row);
  static size_t BytesOf(const Waiting& waiting);

  Session& session_;
  const std::array<Statements, kTables> statements_;
  std::array<std::map<int64_t, Waiting>, kTables> changes_;
  // The highest number that each table got in this transaction.
  std::array<int64_t, kTables> last_{};
  size_t bytes_ = 0;
  // While there are marks: what Undo() needs.
  std::vector<Step> steps_;
  size_t marks_ = 0;
  bool written_ = false;  // Since the outermost mark.
};

}  // namespace vexlo::elasticd

#endif  // DAEMONS_KAVOELASTICD_TEXT_BATCH_H_
