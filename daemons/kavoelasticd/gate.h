// Lets many in, or one alone.
#ifndef DAEMONS_KAVOELASTICD_GATE_H_
#define DAEMONS_KAVOELASTICD_GATE_H_

#include <cstddef>

#include "kavo/local/mutex.h"

namespace vexlo::elasticd {

// Unlike a shared mutex, whoever wants to be alone keeps newcomers out while it waits, so a stream
// of searches cannot hold up a pause for ever. Not recursive.
class KAVO_CAPABILITY("gate") Gate {
 public:
  class KAVO_SCOPED_CAPABILITY Visit {
   public:
    explicit Visit(Gate& gate) KAVO_ACQUIRE_SHARED(gate) : gate_(gate) { gate_.Enter(); }
    ~Visit() KAVO_RELEASE_GENERIC() { gate_.Leave(); }
    Visit(const Visit&) = delete;
    Visit& operator=(const Visit&) = delete;

   private:
    Gate& gate_;
  };

  class KAVO_SCOPED_CAPABILITY Alone {
   public:
    explicit Alone(Gate& gate) KAVO_ACQUIRE(gate) : gate_(gate) { gate_.Close(); }
    ~Alone() KAVO_RELEASE() { gate_.Open(); }
    Alone(const Alone&) = delete;
    Alone& operator=(const Alone&) = delete;

   private:
    Gate& gate_;
  };

 private:
  void Enter() {
    kavo::local::MutexLock lock(mutex_);
    changed_.Wait(lock, [this]() KAVO_REQUIRES(mutex_) { return !closed_; });
    ++visitors_;
  }
  void Leave() {
    const kavo::local::MutexLock lock(mutex_);
    --visitors_;
    changed_.NotifyAll();
  }
  void Close() {
    kavo::local::MutexLock lock(mutex_);
    changed_.Wait(lock, [this]() KAVO_REQUIRES(mutex_) { return !closed_; });
    closed_ = true;
    changed_.Wait(lock, [this]() KAVO_REQUIRES(mutex_) { return visitors_ == 0; });
  }
  void Open() {
    const kavo::local::MutexLock lock(mutex_);
    closed_ = false;
    changed_.NotifyAll();
  }

  kavo::local::Mutex mutex_;
  kavo::local::Condition changed_;
  bool closed_ KAVO_GUARDED_BY(mutex_) = false;
  size_t visitors_ KAVO_GUARDED_BY(mutex_) = 0;
};

}  // namespace vexlo::elasticd

#endif  // DAEMONS_KAVOELASTICD_GATE_H_
