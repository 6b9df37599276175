// The full-text engine: the indexes that there are, and the commands that clients send. Knows
// nothing of sockets and starts no threads.
#ifndef DAEMONS_KAVOELASTICD_ENGINE_H_
#define DAEMONS_KAVOELASTICD_ENGINE_H_

#include <json/value.h>

#include <chrono>
#include <functional>
#include <map>
#include <memory>
#include <span>
#include <stop_token>
#include <string>

#include "daemons/kavoelasticd/gate.h"
#include "daemons/kavoelasticd/readable.h"
#include "daemons/kavoelasticd/registry.h"
#include "daemons/kavoelasticd/store.h"
#include "kavo/local/mutex.h"

namespace vexlo::elasticd {

// Commands and replies are described in docs/engine.md.
//
// - Each index has one writer at a time; searches run beside it and see the last commit. Commands
//   that pause, move, rename or delete an index wait until nobody uses it, and run one at a time.
// - Locks, outermost first: admin_mutex_, an index's gate, registry_mutex_. Nothing is waited for,
//   and no index's database is touched, under the last.
// - Indexes are opened when they are first used, with a check of every page. A damaged one is
//   renamed to "index.db.damaged-N" and answers kIndexDamaged until it is made anew.
class Engine {
 public:
  // `registry_path` is the file that keeps the ids and folders of the indexes; it is made with the
  // first one. Throws Failure when it cannot be read (see Registry). At most one engine may use a
  // registry and its indexes.
  explicit Engine(std::string registry_path);
  // Commits and closes what is open; logs what fails. No call is running.
  ~Engine();
  Engine(const Engine&) = delete;
  Engine& operator=(const Engine&) = delete;

  // Carries out one request. Any thread; never throws. The reply is {"success": true, ...} or
  // {"success": false, "error": {"code", "msg"}}.
  Json::Value Handle(const Json::Value& request);

  // The same for somebody who may search and nothing else, and finds what the judge says may be
  // read: any other command is refused, and so are pages of over 10,000 hits. Ends with kTimeIsUp
  // what takes over ten seconds.
  Json::Value HandleSearch(const Json::Value& request, const JudgePaths& judge);

  // Commits what was written longer ago than `idle` to any index, and tidies such indexes up in
  // steps. To be called again and again by whoever runs the engine until it says that nothing is
  // left to do; then once AwaitChange() has returned. Never throws.
  bool CommitIdle(std::chrono::steady_clock::duration idle);
  // Waits until something was written since the last call, or a stop is requested.
  void AwaitChange(const std::stop_token& stop);

 private:
  struct Slot {
    Gate gate;
    // Read inside the gate, and changed by whoever is alone there.
    std::string id KAVO_GUARDED_BY(gate);
    RegistryEntry entry KAVO_GUARDED_BY(gate);
    // Deleted: whoever still holds the slot finds no index.
    bool gone KAVO_GUARDED_BY(gate) = false;
    std::unique_ptr<Store> store KAVO_GUARDED_BY(gate);
    uint64_t openings KAVO_GUARDED_BY(gate) = 0;  // Tells one store from the next.
  };
  using SlotPtr = std::shared_ptr<Slot>;
  using StoreUse = std::function<void(Store&)>;

  static Json::Value Answer(const std::function<Json::Value()>& work);
  Json::Value Dispatch(const Json::Value& request);
  Json::Value Compound(const Json::Value& list);
  // Items of one index, all with that id, or any without one. `results` has a place for each.
  void CompoundRun(const std::string& id, std::span<const Json::Value* const> items,
                   std::span<Json::Value> results);

  void IndexCreate(const Json::Value& data) KAVO_REQUIRES(admin_mutex_);
  void IndexDelete(const Json::Value& data) KAVO_REQUIRES(admin_mutex_);
  void IndexPause(const Json::Value& data) KAVO_REQUIRES(admin_mutex_);
  void IndexResume(const Json::Value& data) KAVO_REQUIRES(admin_mutex_);
  void IndexConfigSet(const Json::Value& data) KAVO_REQUIRES(admin_mutex_);
  Json::Value IndexList();
  Json::Value Search(const Json::Value& data, const JudgePaths& judge,
                     Connection::Deadline deadline);

  // Calls `use` with the open store. Throws kIndexMissing, kIndexPaused, kIndexDamaged, and what
  // `use` throws.
  void WithStore(const std::string& id, const StoreUse& use);
  SlotPtr Find(const std::string& id);
  void Open(Slot& slot) KAVO_REQUIRES(slot.gate);
  void CloseCleanly(Slot& slot) KAVO_REQUIRES(slot.gate);
  void MarkDamaged(Slot& slot, const std::string& reason) KAVO_REQUIRES(slot.gate);
  void SetState(Slot& slot, State state) KAVO_REQUIRES(slot.gate);
  void NoteChange();

  kavo::local::Mutex admin_mutex_;  // One command on the indexes themselves at a time.
  kavo::local::Mutex registry_mutex_;
  Registry registry_ KAVO_GUARDED_BY(registry_mutex_);
  std::map<std::string, SlotPtr> slots_
      KAVO_GUARDED_BY(registry_mutex_);  // By id, as in the registry.

  kavo::local::Mutex change_mutex_;
  kavo::local::Condition change_noted_;
  bool changed_ KAVO_GUARDED_BY(change_mutex_) = false;
};

}  // namespace vexlo::elasticd

#endif  // DAEMONS_KAVOELASTICD_ENGINE_H_
