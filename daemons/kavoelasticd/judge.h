// Who may read what: the kernel's own judgement about a user and a path.
#ifndef DAEMONS_KAVOELASTICD_JUDGE_H_
#define DAEMONS_KAVOELASTICD_JUDGE_H_

#include <sys/types.h>

#include <cstddef>
#include <string>
#include <vector>

#include "daemons/common/frame_server.h"
#include "daemons/common/unique_fd.h"
#include "daemons/kavoelasticd/readable.h"
#include "kavo/local/mutex.h"

namespace vexlo::elasticd {

// A process that takes on the identity of who asks and tries. It has the right to do so, CAP_SETUID
// and CAP_SETGID, and no other; the engine around it needs none.
class Judge {
 public:
  // Starts it, while the process has one thread and its rights. Without the right to become other
  // users there is none, and it judges nobody. Throws std::system_error.
  Judge();
  ~Judge() = default;  // It ends when its socket is closed.
  Judge(const Judge&) = delete;
  Judge& operator=(const Judge&) = delete;

  bool IsThere() const { return socket_.Get() >= 0; }

  // Returns when the process has ended, which it does only when it was killed, or when `quit` is
  // readable: false. There is no other one then, as the rights to start it are gone.
  bool AwaitEnd(int quit) const;

  // For each path whether the user may reach it and read it: modes, access control lists and groups
  // of each folder on the way and of the last component count as they do in open(). Nobody's
  // superuser: for uid 0 nothing is readable. Throws Failure kInternal when there is no answer in
  // ten seconds, as a file system may make it wait, and kTimeIsUp when there is not the whole one.
  // Any thread may call.
  std::vector<Verdict> Ask(const daemon::Peer& peer, const std::vector<std::string>& paths);

 private:
  void AskSome(const daemon::Peer& peer, const std::vector<std::string>& paths, size_t from,
               size_t count, std::vector<Verdict>& verdicts) KAVO_REQUIRES(mutex_);
  std::string Receive() KAVO_REQUIRES(mutex_);

  daemon::UniqueFd socket_;
  kavo::local::Mutex mutex_;  // One question at a time.
  // An answer that nobody waits for any more is still to come.
  bool is_waiting_ KAVO_GUARDED_BY(mutex_) = false;
};

}  // namespace vexlo::elasticd

#endif  // DAEMONS_KAVOELASTICD_JUDGE_H_
