// Lets many in, or one alone.
#ifndef DAEMONS_KAVOELASTICD_GATE_H_
#define DAEMONS_KAVOELASTICD_GATE_H_

#include <condition_variable>
#include <cstddef>
#include <mutex>

namespace vexlo::elasticd {

// Unlike a shared mutex, whoever wants to be alone keeps newcomers out while it waits, so a stream
// of searches cannot hold up a pause for ever. Not recursive.
class Gate {
 public:
  class Visit {
   public:
    explicit Visit(Gate& gate) : gate_(gate) {
      std::unique_lock lock(gate_.mutex_);
      gate_.changed_.wait(lock, [this] { return !gate_.closed_; });
      ++gate_.visitors_;
    }
    ~Visit() {
      const std::lock_guard lock(gate_.mutex_);
      --gate_.visitors_;
      gate_.changed_.notify_all();
    }
    Visit(const Visit&) = delete;
    Visit& operator=(const Visit&) = delete;

   private:
    Gate& gate_;
  };

  class Alone {
   public:
    explicit Alone(Gate& gate) : gate_(gate) {
      std::unique_lock lock(gate_.mutex_);
      gate_.changed_.wait(lock, [this] { return !gate_.closed_; });
      gate_.closed_ = true;
      gate_.changed_.wait(lock, [this] { return gate_.visitors_ == 0; });
    }
    ~Alone() {
      const std::lock_guard lock(gate_.mutex_);
      gate_.closed_ = false;
      gate_.changed_.notify_all();
    }
    Alone(const Alone&) = delete;
    Alone& operator=(const Alone&) = delete;

   private:
    Gate& gate_;
  };

 private:
  std::mutex mutex_;
  std::condition_variable changed_;
  bool closed_ = false;
  size_t visitors_ = 0;
};

}  // namespace vexlo::elasticd

#endif  // DAEMONS_KAVOELASTICD_GATE_H_
