#include "daemons/kavoelasticd/store.h"

#include <malloc.h>
#include <sys/stat.h>

#include <cerrno>
#include <exception>
#include <utility>

#include "common/check.h"
#include "common/json.h"
#include "daemons/common/log.h"
#include "daemons/kavoelasticd/disk.h"
#include "daemons/kavoelasticd/failure.h"

namespace vexlo::elasticd {
namespace {

constexpr size_t kCommitAfter = 20'000;
constexpr size_t kIdleReaders = 8;
// Of a text index, 8 KB each: some hundredths of a second.
constexpr int64_t kMergedPages = 500;
constexpr int kStepsAtOnce = 10;

[[noreturn]] void Damaged(const std::string& what) { throw Failure(Code::kIndexDamaged, what); }

std::string Meta(Connection& db, const char* key) {
  Sql row(db, "SELECT v FROM meta WHERE k = ?");
  if (!row.Text(key).Row()) {
    Damaged(std::string("the database has no ") + key);
  }
  return row.StringAt(0);
}

Json::Value JsonMeta(Connection& db, const char* key) {
  Json::Value value;
  if (!JsonFromString(value, Meta(db, key))) {
    Damaged(std::string("the database has no readable ") + key);
  }
  return value;
}

}  // namespace

std::string DatabaseFile(const std::string& folder) { return folder + "/index.db"; }

void Store::Create(const std::string& folder, const IndexInfo& info) {
  MakeFolders(folder);
  RemoveDatabase(folder);
  MakePrivateFile(DatabaseFile(folder));
  const Schema schema(info.mappings);
  {
    Session session(DatabaseFile(folder), Connection::Use::kCreate, schema,
                    LanguageOf(info.settings));
    session.MakeTables(info);
    session.db.Run("PRAGMA wal_checkpoint(TRUNCATE)");
  }
  SyncFolder(folder);
}

Store::Store(std::string folder, const std::string& token) : folder_(std::move(folder)) {
  struct stat status;
  if (stat(DatabaseFile(folder_).c_str(), &status) != 0) {
    if (errno == ENOENT || errno == ENOTDIR) {
      Damaged("there is no database in " + folder_);
    }
    throw Failure(Code::kStorage, ErrnoText("the database cannot be looked at", folder_));
  }
  if (!S_ISREG(status.st_mode)) {
    Damaged("the database is no file in " + folder_);
  }
  OpenWriter(token);
}

void Store::CheckDatabase(Connection& db, const std::string& token) {
  {
    Sql check(db, "PRAGMA quick_check(1)");
    if (!check.Row() || check.BytesAt(0) != "ok") {
      Damaged("the database in " + folder_ + " is damaged: " + check.StringAt(0));
    }
  }
  Sql tables(db,
             "SELECT count(*) FROM sqlite_master WHERE name IN"
             "('meta','fields','docs','gone','records','bodies','exact','folders','texts','words',"
             "'grams')");
  if (!tables.Row() || tables.IntAt(0) != 11) {
    Damaged("the database in " + folder_ + " is not an index");
  }
  if (Meta(db, "version") != FormatVersion()) {
    Damaged("the index in " + folder_ + " is of another version");
  }
  if (Meta(db, "token") != token) {
    Damaged("the index in " + folder_ + " is another one");
  }
}

void Store::OpenWriter(const std::string& token) {
  const kavo::local::MutexLock lock(write_mutex_);
  const std::string file = DatabaseFile(folder_);
  try {
    {
      Connection db(file, Connection::Use::kWrite);
      CheckDatabase(db, token);
      schema_ = std::make_unique<Schema>(JsonMeta(db, "mappings"));
      language_ = LanguageOf(JsonMeta(db, "settings"));
    }
    write_session_ = std::make_unique<Session>(file, Connection::Use::kWrite, *schema_, language_);
    // A copy made by VACUUM INTO has no log; in one that has, the first statement changes nothing.
    write_session_->db.Run(
        "PRAGMA journal_mode=WAL; PRAGMA synchronous=FULL; PRAGMA cache_size=-32768; PRAGMA "
        "wal_autocheckpoint=4000;"
        "PRAGMA journal_size_limit=67108864");
  } catch (const SqlError& error) {
    // A page that cannot be read is as gone as one that makes no sense.
    if (error.OfReading()) {
      Damaged(error.what());
    }
    throw;
  }
  writer_ = std::make_unique<Writer>(*write_session_);
}

Store::~Store() {
  try {
    if (writer_ != nullptr && writer_->Uncommitted() > 0) {
      writer_->Commit();
    }
  } catch (const std::exception& error) {
    daemon::Log(daemon::Level::kError, VEXLO_SOURCE, __LINE__,
                "changes are lost, index=" + folder_ + ", reason=" + error.what());
  }
}

void Store::Write(const std::function<void(Writer&, Session&)>& change) {
  const kavo::local::MutexLock lock(write_mutex_);
  uncommitted_ = true;
  at_rest_ = false;
  last_change_ = std::chrono::steady_clock::now();
  try {
    change(*writer_, *write_session_);
  } catch (const Failure& failure) {
    if (!failure.IsAnswer()) {
      RollBack(failure.what());
    }
    throw;
  } catch (const std::exception& error) {
    RollBack(error.what());
    throw;
  }
  if (writer_->Uncommitted() >= kCommitAfter) {
    CommitQuietly();
  }
}

// The next Commit() tells what is lost.
void Store::RollBack(const char* reason) {
  daemon::Log(daemon::Level::kError, VEXLO_SOURCE, __LINE__,
              "changes are rolled back, index=" + folder_ + ", reason=" + reason);
  writer_->Lose(reason);
  uncommitted_ = false;
}

void Store::Read(const std::function<void(Session&)>& read) {
  if (uncommitted_) {
    const kavo::local::MutexLock lock(write_mutex_);
    try {
      read(*write_session_);
    } catch (const SqlError& error) {
      if (writer_->Uncommitted() > 0 && !write_session_->db.InTransaction()) {
        writer_->Lose(error.what());
        uncommitted_ = false;
      }
      throw;
    }
    return;
  }
  ReadCommitted(read);
}

std::unique_ptr<Session> Store::TakeReader() {
  {
    const kavo::local::MutexLock lock(readers_mutex_);
    if (!readers_.empty()) {
      std::unique_ptr<Session> reader = std::move(readers_.back());
      readers_.pop_back();
      return reader;
    }
  }
  return std::make_unique<Session>(DatabaseFile(folder_), Connection::Use::kRead, *schema_,
                                   language_);
}

void Store::ReadCommitted(const std::function<void(Session&)>& read) {
  // A reader that meets a failure is closed; it may hold a transaction.
  std::unique_ptr<Session> reader = TakeReader();
  reader->db.Run("BEGIN");
  read(*reader);
  reader->db.Run("COMMIT");
  const kavo::local::MutexLock lock(readers_mutex_);
  if (readers_.size() < kIdleReaders) {
    readers_.push_back(std::move(reader));
  }
}

void Store::Commit() {
  const kavo::local::MutexLock lock(write_mutex_);
  try {
    writer_->Commit();
  } catch (const SqlError& error) {
    writer_->Lose(error.what());
    writer_->LossIsTold();
    uncommitted_ = false;
    throw;
  }
  uncommitted_ = false;
}

void Store::CommitQuietly() {
  try {
    writer_->CommitChanges();
    uncommitted_ = false;
  } catch (const SqlError& error) {
    RollBack(error.what());
  }
}

bool Store::CommitIdle(std::chrono::steady_clock::duration idle) {
  for (int step = 0; step < kStepsAtOnce && !at_rest_; ++step) {
    // Given back after each step, and whoever writes meanwhile ends the loop.
    if (!write_mutex_.TryLock()) {
      return true;
    }
    const kavo::local::MutexLock lock(write_mutex_, std::adopt_lock);
    if (std::chrono::steady_clock::now() - last_change_ < idle) {
      return true;
    }
    if (uncommitted_) {
      CommitQuietly();
    }
    try {
      at_rest_ = !Rest();
    } catch (const std::exception& error) {
      daemon::Log(daemon::Level::kWarning, VEXLO_SOURCE, __LINE__,
                  "tidying failed, index=" + folder_ + ", reason=" + error.what());
      at_rest_ = true;
    }
  }
  return !at_rest_;
}

// Nothing is uncommitted. In steps, as whoever writes waits for one.
// Whether there are more.
bool Store::Rest() {
  Connection& db = write_session_->db;
  if (writer_->ForgetGone()) {
    return true;
  }
  for (const char* const merge : {"INSERT INTO texts(texts, rank) VALUES('merge', ?)",
                                  "INSERT INTO words(words, rank) VALUES('merge', ?)",
                                  "INSERT INTO grams(grams, rank) VALUES('merge', ?)"}) {
    const int64_t before = db.TotalChanges();
    Sql(db, merge).Int(kMergedPages).Run();
    // One is the command itself.
    if (db.TotalChanges() - before > 1) {
      return true;
    }
  }
  // Readers may keep it from it; the next change brings another try.
  Sql(db, "PRAGMA wal_checkpoint(TRUNCATE)").Run();
  db.Run("PRAGMA shrink_memory");
  malloc_trim(0);
  return false;
}

void Store::Close() {
  Commit();
  {
    const kavo::local::MutexLock lock(readers_mutex_);
    readers_.clear();
  }
  const kavo::local::MutexLock lock(write_mutex_);
  Sql checkpoint(write_session_->db, "PRAGMA wal_checkpoint(TRUNCATE)");
  if (!checkpoint.Row() || checkpoint.IntAt(0) != 0) {
    throw Failure(Code::kStorage, "the log cannot be emptied, index=" + folder_);
  }
}

}  // namespace vexlo::elasticd
