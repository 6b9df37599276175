// One open index: its database, the connection that writes and those that read.
#ifndef DAEMONS_KAVOELASTICD_STORE_H_
#define DAEMONS_KAVOELASTICD_STORE_H_

#include <atomic>
#include <chrono>
#include <functional>
#include <memory>
#include <string>
#include <vector>

#include "daemons/kavoelasticd/schema.h"
#include "daemons/kavoelasticd/session.h"
#include "daemons/kavoelasticd/writer.h"
#include "kavo/local/mutex.h"

namespace vexlo::elasticd {

// The files of an index in `folder`: this one, and "-wal" and "-shm" behind it while it is open.
std::string DatabaseFile(const std::string& folder);

// Any number of threads. One changes at a time, under a lock; readers have connections of their own
// and see the last commit, whatever is being written.
//
// On disk: SQLite in WAL mode, synced at every commit. A crash at any moment leaves the last
// commit; a database that is no longer one is found at the next opening, by a check of every page.
class Store {
 public:
  // Makes an empty index in `folder`, which is made too; files of an index that are there go.
  // Throws Failure.
  static void Create(const std::string& folder, const IndexInfo& info);

  // Throws Failure kIndexDamaged when there is no index, or it is damaged, of another token or of
  // another version; kStorage when that cannot be told.
  Store(std::string folder, const std::string& token);
  ~Store();
  Store(const Store&) = delete;
  Store& operator=(const Store&) = delete;

  // Calls `change` with the writer, while nobody else has it. When the database fails in it,
  // everything since the last commit is lost (see Writer). Commits after 20,000 changes.
  void Write(const std::function<void(Writer&, Session&)>& change);
  // Calls `read` with a session that sees all that was written, committed or not.
  void Read(const std::function<void(Session&)>& read);
  // Calls `read` with the state of one commit, never waiting for a writer.
  void ReadCommitted(const std::function<void(Session&)>& read);

  // What was written is on disk when this returns. Throws kLost when some of it was rolled back
  // before, and what the database answers.
  void Commit();
  // Once nothing was written for `idle`: commits, merges the text indexes a step further, and at
  // last empties the log. Whether anything is left to do, now or after `idle`. Failures are logged,
  // and those of the commit told by Commit().
  bool CommitIdle(std::chrono::steady_clock::duration idle);
  // Commits and empties the log, so that the one file holds everything once the store is gone.
  // Nobody else is using the store. When it throws, the store can be used on.
  void Close();

 private:
  void OpenWriter(const std::string& token);
  void CheckDatabase(Connection& db, const std::string& token);
  void CommitQuietly() KAVO_REQUIRES(write_mutex_);
  void RollBack(const char* reason) KAVO_REQUIRES(write_mutex_);
  bool Rest() KAVO_REQUIRES(write_mutex_);
  std::unique_ptr<Session> TakeReader();

  const std::string folder_;
  std::string language_;
  std::unique_ptr<Schema> schema_;
  kavo::local::Mutex write_mutex_;
  std::unique_ptr<Session> write_session_ KAVO_GUARDED_BY(write_mutex_);
  std::unique_ptr<Writer> writer_ KAVO_GUARDED_BY(write_mutex_);
  std::chrono::steady_clock::time_point last_change_ KAVO_GUARDED_BY(write_mutex_);
  std::atomic<bool> uncommitted_ = false;
  std::atomic<bool> at_rest_ = true;  // Nothing is left for CommitIdle().
  kavo::local::Mutex readers_mutex_;
  std::vector<std::unique_ptr<Session>> readers_
      KAVO_GUARDED_BY(readers_mutex_);  // That no one uses.
};

}  // namespace vexlo::elasticd

#endif  // DAEMONS_KAVOELASTICD_STORE_H_
