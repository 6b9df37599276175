// A connection to SQLite and its statements. For one thread at a time; several connections may be
// open on one database.
#ifndef DAEMONS_KAVOELASTICD_SQLITE_H_
#define DAEMONS_KAVOELASTICD_SQLITE_H_

#include <chrono>
#include <cstddef>
#include <cstdint>
#include <functional>
#include <memory>
#include <optional>
#include <string>
#include <string_view>
#include <unordered_map>
#include <vector>

#include "daemons/kavoelasticd/failure.h"

struct sqlite3;
struct sqlite3_stmt;

namespace vexlo::elasticd {

// What SQLite answered. The code is kNoSpace for a full disk, kIndexDamaged for a database that is
// none or contradicts itself, else kStorage.
class SqlError : public Failure {
 public:
  SqlError(int result, const std::string& message);
  // Whether it is about one statement, and not about the disk or the database.
  bool OfStatement() const { return of_statement_; }
  // Whether a page could not be read.
  bool OfReading() const { return of_reading_; }

 private:
  bool of_statement_;
  bool of_reading_;
};

struct ConnectionDelete {
  void operator()(sqlite3* db) const;
};
struct StatementDelete {
  void operator()(sqlite3_stmt* statement) const;
};
using StatementPtr = std::unique_ptr<sqlite3_stmt, StatementDelete>;

class Connection {
 public:
  using Deadline = std::optional<std::chrono::steady_clock::time_point>;

  // Opens an existing database, or makes one with `create`. A connection that is not to write
  // refuses to. Throws SqlError.
  enum class Use { kCreate, kWrite, kRead };
  Connection(const std::string& path, Use use);
  ~Connection();
  Connection(const Connection&) = delete;
  Connection& operator=(const Connection&) = delete;

  // Runs statements without results. Throws SqlError.
  void Run(const std::string& sql);
  bool InTransaction() const;
  int64_t LastInsertId() const;
  // Rows changed since it was opened.
  int64_t TotalChanges() const;
  // What the SQL function member(ID) answers with from now on; `members` outlives its use.
  void SetMembers(const std::vector<bool>* members) { *members_ = members; }

 private:
  friend class Sql;
  friend class TimeLimit;
  bool IsTimeUp() const;
  void CheckTime() const;
  [[noreturn]] void Fail(int result, std::string_view sql) const;

  struct TextHash {
    using is_transparent = void;  // NOLINT(readability-identifier-naming): the library's name.
    size_t operator()(std::string_view text) const { return std::hash<std::string_view>()(text); }
  };
  // Statements that are not in use, by their text.
  using Idle =
      std::unordered_map<std::string, std::vector<StatementPtr>, TextHash, std::equal_to<>>;
  Idle::value_type& IdleOf(std::string_view sql);

  Deadline deadline_;                                  // Its address is known to SQLite.
  std::unique_ptr<const std::vector<bool>*> members_;  // Its address is known to SQLite.
  std::unique_ptr<sqlite3, ConnectionDelete> db_;
  Idle idle_;
};

// As long as it lives, statements of the connection that begin behind the deadline, or are under
// way then, throw Failure kTimeIsUp. A transaction goes on.
class TimeLimit {
 public:
  TimeLimit(Connection& db, Connection::Deadline deadline);
  ~TimeLimit();
  TimeLimit(const TimeLimit&) = delete;
  TimeLimit& operator=(const TimeLimit&) = delete;

 private:
  Connection& db_;
};

// One use of a statement, from binding to the last row; the connection keeps the statement for the
// next use. Parameters are numbered by the order of the calls. Bound texts and blobs, and those
// that columns give, must not, and do not, outlive the use and the row. All throw SqlError, and
// kTimeIsUp as TimeLimit has it.
class Sql {
 public:
  Sql(Connection& db, std::string_view sql);
  ~Sql();
  Sql(const Sql&) = delete;
  Sql& operator=(const Sql&) = delete;

  Sql& Int(int64_t value);
  Sql& Double(double value);
  Sql& Blob(std::string_view value);
  Sql& Text(std::string_view value);
  Sql& Null();

  // Goes to the next row; false when there is none.
  bool Row();
  // Runs a statement without rows.
  void Run();
  // The same; false, with nothing changed, when a unique value is there already.
  bool RunUnlessTaken();

  int64_t IntAt(int column) const;
  bool NullAt(int column) const;
  double DoubleAt(int column) const;
  std::string_view BytesAt(int column) const;
  std::string StringAt(int column) const { return std::string(BytesAt(column)); }

 private:
  void Check(int result) const;

  Connection& db_;
  Connection::Idle::value_type& kept_;
  StatementPtr statement_;
  int parameter_ = 0;
};

}  // namespace vexlo::elasticd

#endif  // DAEMONS_KAVOELASTICD_SQLITE_H_
