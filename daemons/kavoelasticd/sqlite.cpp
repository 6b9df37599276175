#include "daemons/kavoelasticd/sqlite.h"

#include <sqlite3.h>

#include <utility>

#include "daemons/kavoelasticd/tokenizer.h"

namespace vexlo::elasticd {
namespace {

constexpr int kBusyMilliseconds = 10000;
constexpr int kStepsBetweenLooks = 1000;  // Some hundredths of a millisecond.

Code CodeOf(int result) {
  switch (result & 0xFF) {
    case SQLITE_FULL:
      return Code::kNoSpace;
    case SQLITE_CORRUPT:
    case SQLITE_NOTADB:
      return Code::kIndexDamaged;
    default:
      return Code::kStorage;
  }
}

void Member(sqlite3_context* context, int /*count*/, sqlite3_value** arguments) {
  const auto* const members =
      *static_cast<const std::vector<bool>* const*>(sqlite3_user_data(context));
  const auto id = static_cast<uint64_t>(sqlite3_value_int64(arguments[0]));
  sqlite3_result_int(context, members != nullptr && id < members->size() && (*members)[id] ? 1 : 0);
}

int IsBehind(void* deadline) {
  const auto& moment = *static_cast<const Connection::Deadline*>(deadline);
  return moment && std::chrono::steady_clock::now() >= *moment ? 1 : 0;
}

}  // namespace

SqlError::SqlError(int result, const std::string& message)
    : Failure(CodeOf(result), message),
      of_statement_((result & 0xFF) == SQLITE_CONSTRAINT || (result & 0xFF) == SQLITE_TOOBIG),
      of_reading_(result == SQLITE_IOERR_READ || result == SQLITE_IOERR_SHORT_READ ||
                  result == SQLITE_IOERR_CORRUPTFS) {}

void ConnectionDelete::operator()(sqlite3* db) const { sqlite3_close_v2(db); }
void StatementDelete::operator()(sqlite3_stmt* statement) const { sqlite3_finalize(statement); }

Connection::Connection(const std::string& path, Use use)
    : members_(std::make_unique<const std::vector<bool>*>(nullptr)) {
  sqlite3* db = nullptr;
  const int flags = SQLITE_OPEN_READWRITE | SQLITE_OPEN_NOMUTEX | SQLITE_OPEN_EXRESCODE |
                    (use == Use::kCreate ? SQLITE_OPEN_CREATE : 0);
  const int result = sqlite3_open_v2(path.c_str(), &db, flags, nullptr);
  db_.reset(db);
  if (result != SQLITE_OK) {
    throw SqlError(result, "open failed, path=" + path +
                               ", reason=" + (db != nullptr ? sqlite3_errmsg(db) : "memory"));
  }
  sqlite3_busy_timeout(db, kBusyMilliseconds);
  RegisterTokenizers(db);
  sqlite3_create_function(db, "member", 1, SQLITE_UTF8, members_.get(), Member, nullptr, nullptr);
  // Deleted text is overwritten by default in some builds, which doubles what a delete writes.
  Run("PRAGMA secure_delete=OFF; PRAGMA temp_store=MEMORY");
  switch (use) {
    case Use::kRead:
      Run("PRAGMA query_only=ON; PRAGMA cache_size=-8192");
      break;
    case Use::kWrite:
      // Where a file cannot be opened for writing at the moment (no descriptor is left, say),
      // SQLite is content with reading it, and the connection would never write: the database here,
      // the log and its index when the first transaction opens them.
      if (sqlite3_db_readonly(db, "main") != 0) {
        throw SqlError(SQLITE_CANTOPEN, "opened for reading alone, path=" + path);
      }
      Run("BEGIN IMMEDIATE; ROLLBACK");
      break;
    case Use::kCreate:
      break;
  }
}

Connection::~Connection() = default;

bool Connection::IsTimeUp() const {
  return deadline_ && std::chrono::steady_clock::now() >= *deadline_;
}

void Connection::CheckTime() const {
  if (IsTimeUp()) {
    throw Failure(Code::kTimeIsUp, "this takes too long: ask for less, or for longer words");
  }
}

// What SQLite makes of an end in its midst is none of its results: it may call it damage.
void Connection::Fail(int result, std::string_view sql) const {
  CheckTime();
  throw SqlError(result, std::string(sqlite3_errmsg(db_.get())) + ", sql=" + std::string(sql));
}

void Connection::Run(const std::string& sql) {
  const int result = sqlite3_exec(db_.get(), sql.c_str(), nullptr, nullptr, nullptr);
  if (result != SQLITE_OK) {
    Fail(result, sql);
  }
}

bool Connection::InTransaction() const { return sqlite3_get_autocommit(db_.get()) == 0; }
int64_t Connection::LastInsertId() const { return sqlite3_last_insert_rowid(db_.get()); }
int64_t Connection::TotalChanges() const { return sqlite3_total_changes64(db_.get()); }

TimeLimit::TimeLimit(Connection& db, Connection::Deadline deadline) : db_(db) {
  db_.deadline_ = deadline;
  sqlite3_progress_handler(db_.db_.get(), deadline ? kStepsBetweenLooks : 0, IsBehind,
                           &db_.deadline_);
}

TimeLimit::~TimeLimit() {
  sqlite3_progress_handler(db_.db_.get(), 0, nullptr, nullptr);
  db_.deadline_.reset();
}

Connection::Idle::value_type& Connection::IdleOf(std::string_view sql) {
  const auto found = idle_.find(sql);
  return found != idle_.end() ? *found : *idle_.try_emplace(std::string(sql)).first;
}

Sql::Sql(Connection& db, std::string_view sql) : db_(db), kept_(db.IdleOf(sql)) {
  db.CheckTime();
  std::vector<StatementPtr>& idle = kept_.second;
  if (!idle.empty()) {
    statement_ = std::move(idle.back());
    idle.pop_back();
    return;
  }
  sqlite3_stmt* statement = nullptr;
  Check(sqlite3_prepare_v3(db_.db_.get(), kept_.first.c_str(), static_cast<int>(sql.size()),
                           SQLITE_PREPARE_PERSISTENT, &statement, nullptr));
  statement_.reset(statement);
}

Sql::~Sql() {
  sqlite3_reset(statement_.get());
  sqlite3_clear_bindings(statement_.get());
  try {
    kept_.second.push_back(std::move(statement_));
  } catch (...) {  // No memory to keep it: it is finalized instead.
  }
}

void Sql::Check(int result) const {
  if (result != SQLITE_OK) {
    db_.Fail(result, kept_.first);
  }
}

Sql& Sql::Int(int64_t value) {
  Check(sqlite3_bind_int64(statement_.get(), ++parameter_, value));
  return *this;
}

Sql& Sql::Double(double value) {
  Check(sqlite3_bind_double(statement_.get(), ++parameter_, value));
  return *this;
}

Sql& Sql::Blob(std::string_view value) {
  // A null pointer would bind NULL.
  Check(sqlite3_bind_blob64(statement_.get(), ++parameter_, value.empty() ? "" : value.data(),
                            value.size(), SQLITE_STATIC));
  return *this;
}

Sql& Sql::Text(std::string_view value) {
  Check(sqlite3_bind_text64(statement_.get(), ++parameter_, value.empty() ? "" : value.data(),
                            value.size(), SQLITE_STATIC, SQLITE_UTF8));
  return *this;
}

Sql& Sql::Null() {
  Check(sqlite3_bind_null(statement_.get(), ++parameter_));
  return *this;
}

bool Sql::Row() {
  const int result = sqlite3_step(statement_.get());
  if (result == SQLITE_ROW) {
    return true;
  }
  Check(result == SQLITE_DONE ? SQLITE_OK : result);
  return false;
}

void Sql::Run() {
  while (Row()) {
  }
}

bool Sql::RunUnlessTaken() {
  const int result = sqlite3_step(statement_.get());
  if ((result & 0xFF) == SQLITE_CONSTRAINT) {
    return false;
  }
  Check(result == SQLITE_DONE ? SQLITE_OK : result);
  return true;
}

bool Sql::NullAt(int column) const {
  return sqlite3_column_type(statement_.get(), column) == SQLITE_NULL;
}

int64_t Sql::IntAt(int column) const { return sqlite3_column_int64(statement_.get(), column); }
double Sql::DoubleAt(int column) const { return sqlite3_column_double(statement_.get(), column); }

std::string_view Sql::BytesAt(int column) const {
  const void* bytes = sqlite3_column_blob(statement_.get(), column);
  const int size = sqlite3_column_bytes(statement_.get(), column);
  return bytes == nullptr
             ? std::string_view()
             : std::string_view(static_cast<const char*>(bytes), static_cast<size_t>(size));
}

}  // namespace vexlo::elasticd
