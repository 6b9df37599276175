// A daemon of one's own: has a folder's changes queued in a file of its own, and prints what they
// come down to. A backup, a thumbnailer or a mirror would act on each instead.
//
// usage: example_daemon QUEUE [FOLDER]
//   QUEUE   the queue file, which no other program may take from; lies outside of FOLDER
//   FOLDER  a folder whose changes the notify daemon is to write there, from now on and for good
#include <json/value.h>
#include <time.h>

#include <csignal>
#include <iostream>
#include <memory>

#include "common/error.h"
#include "fileindex/queue_mgr.h"
#include "kavo/monitor_queue.h"

namespace {

using vexlo::fileindex::OP;
using vexlo::fileindex::QueueMgr;

constexpr unsigned kAllEvents = 0xFFCC;
constexpr timespec kCycle = {1, 0};

bool Register(const char* queue, const char* folder) {
  Json::Value watched;
  watched["path"] = folder;
  watched["mask"] = kAllEvents;
  Json::Value description;
  description["queue"] = queue;
  description["config"].append(watched);
  return EVNOTIFYD::MonitorQueue::Upsert(EVNOTIFYD::MonitorQueue(description), "example",
                                         EVNOTIFYD::MONITOR_QUEUE_TYPE_APPLICATION);
}

// Throws when the operation cannot be carried out: it comes again, and all of its cycle with it, so
// doing it twice must come to the same as doing it once.
void CarryOut(const std::shared_ptr<OP>& op) {
  if (!(std::cout << op << std::endl)) {
    throw vexlo::Error(vexlo::ERR_SYSTEM, "standard output is gone");
  }
}

}  // namespace

int main(int argc, char** argv) {
  if (argc < 2 || argc > 3) {
    std::cerr << "usage: example_daemon QUEUE [FOLDER]\n";
    return 2;
  }
  if (argc == 3 && !Register(argv[1], argv[2])) {
    std::cerr << "example_daemon: not registered; the system log has the reason\n";
    return 3;
  }
  sigset_t stop;
  sigemptyset(&stop);
  sigaddset(&stop, SIGTERM);
  sigaddset(&stop, SIGINT);
  sigprocmask(SIG_BLOCK, &stop, nullptr);  // A signal ends the daemon between two cycles.
  std::signal(SIGPIPE, SIG_IGN);
  do {
    try {
      QueueMgr queue(argv[1]);  // A new one for each cycle, as it keeps what it has read.
      queue.ProcessOP(CarryOut, /*use_tmp=*/true);
      queue.DeleteTmp();  // Only now: until here a kill brings the whole cycle back.
    } catch (const vexlo::Error& error) {
      std::cerr << "example_daemon: " << error.GetErrorCode() << " " << error.what() << "\n";
    }
  } while (sigtimedwait(&stop, nullptr, &kCycle) < 0);
  return 0;
}
