// A mutex of which the compiler knows what it guards. clang's -Wthread-safety, with which every
// build of clang's is made, refuses code that touches what is guarded without the lock; for other
// compilers the macros are nothing.
#ifndef KAVO_LOCAL_MUTEX_H_
#define KAVO_LOCAL_MUTEX_H_

#include <chrono>
#include <condition_variable>
#include <mutex>
#include <utility>

#ifdef __clang__
#define KAVO_THREAD_ATTRIBUTE(attribute) __attribute__((attribute))
#else
#define KAVO_THREAD_ATTRIBUTE(attribute)
#endif

// Of a class: its objects can be held; they are held for a scope.
#define KAVO_CAPABILITY(name) KAVO_THREAD_ATTRIBUTE(capability(name))
#define KAVO_SCOPED_CAPABILITY KAVO_THREAD_ATTRIBUTE(scoped_lockable)
// Of data, and of what a pointer leads to: touched only by who holds `mutex`.
#define KAVO_GUARDED_BY(mutex) KAVO_THREAD_ATTRIBUTE(guarded_by(mutex))
#define KAVO_PT_GUARDED_BY(mutex) KAVO_THREAD_ATTRIBUTE(pt_guarded_by(mutex))
// Of a function: called by who holds it, or holds it beside others; by who does not.
#define KAVO_REQUIRES(...) KAVO_THREAD_ATTRIBUTE(requires_capability(__VA_ARGS__))
#define KAVO_REQUIRES_SHARED(...) KAVO_THREAD_ATTRIBUTE(requires_shared_capability(__VA_ARGS__))
#define KAVO_EXCLUDES(...) KAVO_THREAD_ATTRIBUTE(locks_excluded(__VA_ARGS__))
// Of a function: takes it, takes it when the result is the first argument, gives it back.
#define KAVO_ACQUIRE(...) KAVO_THREAD_ATTRIBUTE(acquire_capability(__VA_ARGS__))
#define KAVO_ACQUIRE_SHARED(...) KAVO_THREAD_ATTRIBUTE(acquire_shared_capability(__VA_ARGS__))
#define KAVO_TRY_ACQUIRE(...) KAVO_THREAD_ATTRIBUTE(try_acquire_capability(__VA_ARGS__))
#define KAVO_RELEASE(...) KAVO_THREAD_ATTRIBUTE(release_capability(__VA_ARGS__))
#define KAVO_RELEASE_SHARED(...) KAVO_THREAD_ATTRIBUTE(release_shared_capability(__VA_ARGS__))
#define KAVO_RELEASE_GENERIC(...) KAVO_THREAD_ATTRIBUTE(release_generic_capability(__VA_ARGS__))

namespace kavo::local {

// std::mutex. Usually taken by a MutexLock.
class KAVO_CAPABILITY("mutex") Mutex {
 public:
  // True, and it is held, when nobody else holds it. Give it to MutexLock then.
  bool TryLock() KAVO_TRY_ACQUIRE(true) { return mutex_.try_lock(); }

 private:
  friend class MutexLock;
  std::mutex mutex_;
};

// Holds a Mutex for a scope, with a pause where Unlock() and Lock() are called.
class KAVO_SCOPED_CAPABILITY MutexLock {
 public:
  // Waits for the mutex, which outlives the object.
  explicit MutexLock(Mutex& mutex) KAVO_ACQUIRE(mutex) : lock_(mutex.mutex_) {}
  // Takes over what TryLock() took.
  MutexLock(Mutex& mutex, std::adopt_lock_t held) KAVO_REQUIRES(mutex)
      : lock_(mutex.mutex_, held) {}
  ~MutexLock() KAVO_RELEASE() {}
  MutexLock(const MutexLock&) = delete;
  MutexLock& operator=(const MutexLock&) = delete;

  // Give it back before the end of the scope, and take it again.
  void Unlock() KAVO_RELEASE() { lock_.unlock(); }
  void Lock() KAVO_ACQUIRE() { lock_.lock(); }

 private:
  friend class Condition;
  std::unique_lock<std::mutex> lock_;
};

// std::condition_variable. The waits return when `holds()`, which is called with the lock, is true;
// the latter two also when the time has come, with what it is then. A `holds` that reads what is
// guarded says so: [this]() KAVO_REQUIRES(mutex_) { return ready_; }.
class Condition {
 public:
  template <typename Holds>
  void Wait(MutexLock& lock, Holds holds) {
    condition_.wait(lock.lock_, std::move(holds));
  }
  template <typename Duration, typename Holds>
  bool WaitFor(MutexLock& lock, Duration time, Holds holds) {
    return condition_.wait_for(lock.lock_, time, std::move(holds));
  }
  template <typename Time, typename Holds>
  bool WaitUntil(MutexLock& lock, Time until, Holds holds) {
    return condition_.wait_until(lock.lock_, until, std::move(holds));
  }

  // Have one or all of those who wait look again.
  void NotifyOne() { condition_.notify_one(); }
  void NotifyAll() { condition_.notify_all(); }

 private:
  std::condition_variable condition_;
};

}  // namespace kavo::local

#endif  // KAVO_LOCAL_MUTEX_H_
