// Registrations with the notify daemon: which folders it watches, and into which queue file it
// writes what happens there. docs/notify.md has their form on disk and docs/queue.md that of a
// queue.
#ifndef KAVO_MONITOR_QUEUE_H_
#define KAVO_MONITOR_QUEUE_H_

#include <json/value.h>

#include <string>

// NOLINTNEXTLINE(readability-identifier-naming): callers know it by this name.
namespace EVNOTIFYD {

// Stored in registrations: never renumber.
enum MonitorQueueType : int {
  MONITOR_QUEUE_TYPE_APPLICATION = 1,
};

// One queue and the folders whose events go into it. Any process and any thread may register at any
// time: those that change the queues of one application take turns by a lock file, and the daemon
// sees the change by itself, whether it runs now or is started later.
class MonitorQueue {
 public:
  // Keeps a description, which Upsert() checks:
  //
  //   {"queue": "/var/lib/kavo/fileindex/queue/photo",
  //    "config": [{"path": "/volume1/photo", "mask": 65484, "ignore": ["@eaDir"]}]}
  //
  // "queue" is the queue file and "path" a folder to watch with all below it, both absolute and
  // without ".", "..", doubled or trailing slashes; no "path" equals the queue,
  // and of equal ones the first holds. "mask" is a whole number of 32 bits: the event bits that are
  // wanted. "ignore", which may be left out, lists names: what is called so, at any depth below
  // "path", is neither watched nor reported. Other members are not kept.
  explicit MonitorQueue(const Json::Value& description);

  // Registers the queue for an application, or replaces what it had registered under the same queue
  // path and type. True when that is on disk. False, with one line in syslog that says why and
  // nothing changed, for a description or name that is malformed (a name has 1 to 200 bytes without
  // "/" and NUL, and does not begin with "."), for registrations of the application that cannot be
  // read, which are never overwritten, and when writing fails. Only when the folder cannot be
  // synced at last, the change is there but may not outlive a power failure. Blocks while another
  // process changes the same application's queues.
  static bool Upsert(const MonitorQueue& queue, const std::string& app_name,
                     MonitorQueueType type) noexcept;

  // Takes a registration back. True when there is none of this path and type afterwards, so that a
  // caller who was interrupted can do it again; false as above otherwise.
  static bool Delete(const std::string& queue_path, const std::string& app_name,
                     MonitorQueueType type) noexcept;

 private:
  Json::Value description_;
};

}  // namespace EVNOTIFYD

#endif  // KAVO_MONITOR_QUEUE_H_
