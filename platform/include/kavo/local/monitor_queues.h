// What is registered with the notify daemon of the local platform (kavo/monitor_queue.h), as the
// daemon reads it. docs/notify.md describes the files.
//
// On disk: a file for each application, "APP.json", replaced whole (temporary file beside it,
// fsync, rename, fsync of the folder), so a reader finds the old registrations or the new ones.
// Editors exclude each other by an flock on "APP.json.lock"; readers take no lock.
#ifndef KAVO_LOCAL_MONITOR_QUEUES_H_
#define KAVO_LOCAL_MONITOR_QUEUES_H_

#include <cstdint>
#include <map>
#include <stdexcept>
#include <string>
#include <vector>

namespace kavo::local {

struct MonitoredFolder {
  std::string path;                 // Absolute and normalised.
  uint32_t mask = 0;                // The event bits that are wanted.
  std::vector<std::string> ignore;  // Names, in the order of the registration.

  bool operator==(const MonitoredFolder&) const = default;
};

struct RegisteredQueue {
  std::string app;
  std::string queue;  // The queue file's path. Told apart by application, path and type.
  int type = 0;       // EVNOTIFYD::MonitorQueueType
  std::vector<MonitoredFolder> folders;

  bool operator==(const RegisteredQueue&) const = default;
};

struct MonitorQueues {
  std::vector<RegisteredQueue> queues;  // By application, then as registered.
  // Applications whose file cannot be used, and why ("PATH: ..."): what they have registered is not
  // known, which is something else than nothing.
  std::map<std::string, std::string> unreadable;
};

// The folder of the registrations cannot be read. The message is "PATH: ..." for people.
class MonitorQueuesError : public std::runtime_error {
  using std::runtime_error::runtime_error;
};

// The folder that holds the files.
std::string MonitorQueuesFolder();

// All that is registered; nothing when there is no folder. Throws MonitorQueuesError.
MonitorQueues ReadMonitorQueues();

}  // namespace kavo::local

#endif  // KAVO_LOCAL_MONITOR_QUEUES_H_
