// A mutex of which the compiler knows what it guards. clang's -Wthread-safety, with which every
// build of clang's is made, refuses code that touches what is guarded without the lock; for other
// compilers the macros are nothing.
#ifndef KAVO_LOCAL_MUTEX_H_
#define KAVO_LOCAL_MUTEX_H_

#include <condition_variable>
#include <mutex>
#include <utility>

// An attribute of clang's.
#ifdef __clang__
#define KAVO_THREAD_ATTRIBUTE(attribute) __attribute__((attribute))
#else
#define KAVO_THREAD_ATTRIBUTE(attribute)
#endif

// Of a class: its objects can be held.
#define KAVO_CAPABILITY(name) KAVO_THREAD_ATTRIBUTE(capability(name))
// Of a class: its objects hold another one for a scope.
#define KAVO_SCOPED_CAPABILITY KAVO_THREAD_ATTRIBUTE(scoped_lockable)
// Of data: touched only by who holds `mutex`.
#define KAVO_GUARDED_BY(mutex) KAVO_THREAD_ATTRIBUTE(guarded_by(mutex))
// Of a function: called only by who holds it.
#define KAVO_REQUIRES(...) KAVO_THREAD_ATTRIBUTE(requires_capability(__VA_ARGS__))
// Of a function: takes it, alone.
#define KAVO_ACQUIRE(...) KAVO_THREAD_ATTRIBUTE(acquire_capability(__VA_ARGS__))
// Of a function: takes it, beside others who do no more than read.
#define KAVO_ACQUIRE_SHARED(...) KAVO_THREAD_ATTRIBUTE(acquire_shared_capability(__VA_ARGS__))
// Of a function: takes it when the result is the first argument.
#define KAVO_TRY_ACQUIRE(...) KAVO_THREAD_ATTRIBUTE(try_acquire_capability(__VA_ARGS__))
// Of a function: gives it back.
#define KAVO_RELEASE(...) KAVO_THREAD_ATTRIBUTE(release_capability(__VA_ARGS__))
// Of a function: gives it back, however it was taken.
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

  // Gives it back before the end of the scope.
  void Unlock() KAVO_RELEASE() { lock_.unlock(); }
  // Takes it again after Unlock().
  void Lock() KAVO_ACQUIRE() { lock_.lock(); }

 private:
  friend class Condition;
  std::unique_lock<std::mutex> lock_;
};

// std::condition_variable. `holds` is called with the lock; one that reads what is guarded says so:
// [this]() KAVO_REQUIRES(mutex_) { return ready_; }.
class Condition {
 public:
  // Returns when holds() is true.
  template <typename Holds>
  void Wait(MutexLock& lock, Holds holds) {
    condition_.wait(lock.lock_, std::move(holds));
  }
  // The same, for so long at most; what holds() is then.
  template <typename Duration, typename Holds>
  bool WaitFor(MutexLock& lock, Duration time, Holds holds) {
    return condition_.wait_for(lock.lock_, time, std::move(holds));
  }
  // The same, until that time at most.
  template <typename Time, typename Holds>
  bool WaitUntil(MutexLock& lock, Time until, Holds holds) {
    return condition_.wait_until(lock.lock_, until, std::move(holds));
  }

  // Has one of those who wait look again.
  void NotifyOne() { condition_.notify_one(); }
  // Has all of them look again.
  void NotifyAll() { condition_.notify_all(); }

 private:
  std::condition_variable condition_;
};

}  // namespace kavo::local

#endif  // KAVO_LOCAL_MUTEX_H_
