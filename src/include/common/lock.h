// A mutex for one process, and a lock file between processes.
#ifndef COMMON_LOCK_H_
#define COMMON_LOCK_H_

#include <pthread.h>

#include <mutex>
#include <string>

#include "common/export.h"

// What clang's -Wthread-safety is told of locks. Nothing for other compilers.
#ifdef __clang__
#define VEXLO_THREAD_ATTRIBUTE(attribute) __attribute__((attribute))
#else
#define VEXLO_THREAD_ATTRIBUTE(attribute)
#endif
// Of data: touched only by who holds the mutex.
#define VEXLO_GUARDED_BY(mutex) VEXLO_THREAD_ATTRIBUTE(guarded_by(mutex))

namespace vexlo {

// One non-recursive POSIX mutex. The calls return true when the POSIX call returned 0.
class VEXLO_THREAD_ATTRIBUTE(capability("mutex")) VEXLO_EXPORT Mutex {
 public:
  Mutex();
  ~Mutex();
  Mutex(const Mutex&) = delete;
  Mutex& operator=(const Mutex&) = delete;

  // Waits without a limit; TryLock() does not wait. Whoever locked unlocks, on the same thread.
  bool Lock();
  bool TryLock();
  bool Unlock();

 private:
  pthread_mutex_t mutex_;
};

// Holds a Mutex for a scope. A failure to lock or unlock is logged and the caller goes on: a
// destructor must not throw, and both ends behave alike.
class VEXLO_THREAD_ATTRIBUTE(scoped_lockable) VEXLO_EXPORT LockMutex {
 public:
  // The mutex outlives the object.
  explicit LockMutex(Mutex& mutex) VEXLO_THREAD_ATTRIBUTE(acquire_capability(mutex));
  ~LockMutex() VEXLO_THREAD_ATTRIBUTE(release_capability());
  LockMutex(const LockMutex&) = delete;
  LockMutex& operator=(const LockMutex&) = delete;

 private:
  Mutex& mutex_;
};

// Holds an flock on a file for a scope; the file is made when it is missing. The lock belongs to
// the file that the path names: when the path has moved on to another file between open and lock (a
// queue is renamed to its snapshot), the lock is given up and taken anew on the file that stands
// there now, so two holders never coexist.
//
// In a folder where everybody may make files, such as /tmp, others may get at the path first. A
// link there is never followed. Root removes one, and removes a file of another user's when it
// cannot be locked in the time below and no process of root's holds it; for anybody else it is an
// error. Whoever may read a file may
// hold its lock, so one that root made can be held by others for ever, and each attempt is an error
// then.
//
// Two LockFiles on one path exclude each other within a process too: never nest them. A LockFile is
// not shared between threads, and its descriptor is not inherited by programs that are started.
class VEXLO_EXPORT LockFile {
 public:
  // Tries up to 64 times with pauses of 0 to 0.9 s (about 29 s on average), shared unless
  // `exclusive`. Throws Error 506 when the path cannot be opened (a link is refused) or
  // locked, or the tries are used up.
  LockFile(const std::string& path, bool exclusive);
  // Takes the lock if it is free now; IsHeld() says whether it was. Where it was not, errno is
  // EWOULDBLOCK while somebody holds it, else what open or flock failed with. Nothing is logged.
  LockFile(const std::string& path, bool exclusive, std::try_to_lock_t);
  ~LockFile();
  LockFile(const LockFile&) = delete;
  LockFile& operator=(const LockFile&) = delete;

  // True of every object that the first constructor made.
  bool IsHeld() const { return fd_ >= 0; }

 private:
  int fd_;
  std::string path_;
};

}  // namespace vexlo

#endif  // COMMON_LOCK_H_
