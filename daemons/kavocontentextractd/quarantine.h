// The files that ended two processes that read them: they are left alone until they change.
#ifndef DAEMONS_KAVOCONTENTEXTRACTD_QUARANTINE_H_
#define DAEMONS_KAVOCONTENTEXTRACTD_QUARANTINE_H_

#include <sys/stat.h>

#include <cstddef>
#include <cstdint>
#include <list>
#include <map>
#include <optional>
#include <string>
#include <utility>

#include "daemons/kavocontentextractd/fault.h"
#include "kavo/local/mutex.h"

namespace vexlo::extractd {

// A content without having read it: when any of these is another one, the file may read otherwise.
struct ContentKey {
  uint64_t device = 0;
  uint64_t inode = 0;
  uint64_t size = 0;
  int64_t modified = 0;  // Nanoseconds since the epoch.
  int64_t changed = 0;   // The same, of its attributes.

  bool operator==(const ContentKey&) const = default;
};
ContentKey KeyOf(const struct stat& info);

// Any thread may call. On disk: one JSON object, replaced whole at each new entry, so that it is
// the old list or the new one after a crash. A list that cannot be written stays in memory, with a
// line in the log; one that cannot be understood is renamed to "FILE.damaged" and begun anew.
class Quarantine {
 public:
  // Reads the file, whose folder is made when it is missing; only its owner may look in there, as
  // the entries name everybody's files. Of over `most` entries the oldest go.
  explicit Quarantine(std::string file, size_t most = 10000);

  // Why the content was put here. An entry of an older content of the same file is dropped.
  std::optional<Fault> Find(const ContentKey& key);

  // `path` is for those who read the file on disk.
  void Add(const ContentKey& key, const Fault& fault, const std::string& path);

  size_t Size();

  // Counts that a process was killed while it read the content, which may be the content's fault or
  // not. How often that was since ForgetKills(); neither is on disk.
  unsigned CountKill(const ContentKey& key);
  void ForgetKills(const ContentKey& key);

 private:
  struct Entry {
    ContentKey key;
    std::string reason;
    std::string message;
    std::string path;
    int64_t time = 0;  // Seconds since the epoch.
  };
  using FileId = std::pair<uint64_t, uint64_t>;  // Device and inode.

  bool Load() KAVO_REQUIRES(mutex_);
  void Save() KAVO_REQUIRES(mutex_);
  void Put(Entry entry) KAVO_REQUIRES(mutex_);

  const std::string file_;
  const size_t most_;
  kavo::local::Mutex mutex_;
  std::list<Entry> entries_ KAVO_GUARDED_BY(mutex_);  // The oldest first.
  std::map<FileId, std::list<Entry>::iterator> by_file_ KAVO_GUARDED_BY(mutex_);
  std::map<FileId, std::pair<ContentKey, unsigned>> kills_ KAVO_GUARDED_BY(mutex_);
};

}  // namespace vexlo::extractd

#endif  // DAEMONS_KAVOCONTENTEXTRACTD_QUARANTINE_H_
