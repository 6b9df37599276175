#include "daemons/kavocontentextractd/worker.h"

#include <grp.h>
#include <sys/prctl.h>
#include <sys/resource.h>
#include <sys/socket.h>
#include <unistd.h>

#include <cerrno>
#include <csignal>
#include <exception>
#include <new>
#include <string>

#include "common/json.h"
#include "daemons/common/unique_fd.h"
#include "daemons/kavocontentextractd/extract.h"
#include "daemons/kavocontentextractd/pool.h"
#include "kavo/local/frames.h"

namespace vexlo::extractd {
namespace {

constexpr size_t kMaxRequestBytes = size_t{64} << 10;
// No wait of a worker's has an end of its own: the daemon ends the worker.
constexpr kavo::local::Deadline kNever = kavo::local::Deadline::max();

bool Limit(int resource, rlim_t value) {
  const struct rlimit limit = {value, value};
  return setrlimit(resource, &limit) == 0;
}

// The files come open, so the user who owns nothing can read them. A superuser who may not do that
// has little to give up.
bool BecomeNobody() {
  constexpr unsigned kNobody = 65534;
  return geteuid() != 0 ||
         (setgroups(0, nullptr) == 0 && setresgid(kNobody, kNobody, kNobody) == 0 &&
          setresuid(kNobody, kNobody, kNobody) == 0) ||
         errno == EPERM;
}

bool GiveUpRights(size_t memory) {
  // A file over the limit is an error where it is written, not a signal.
  signal(SIGXFSZ, SIG_IGN);
  close_range(kWorkerSocket + 1, ~0U, 0);  // What whoever started the daemon has left open.
  prctl(PR_SET_NAME, "kavoce-worker");     // It was started as "exe".
  // The daemon's end ends a worker that is busy, too; an idle one sees its socket closed. A change
  // of the user would undo it.
  return BecomeNobody() && prctl(PR_SET_PDEATHSIG, SIGKILL) == 0 &&
         prctl(PR_SET_NO_NEW_PRIVS, 1, 0, 0, 0) == 0 && Limit(RLIMIT_FSIZE, 0) &&
         Limit(RLIMIT_CORE, 0) &&
         (memory == 0 || Limit(RLIMIT_AS, static_cast<rlim_t>(memory) << 20));
}

}  // namespace

int RunWorker(size_t memory) {
  const daemon::UniqueFd socket(kWorkerSocket);
  if (!GiveUpRights(memory)) {
    return 1;
  }
  const Extractor extractor;
  if (!kavo::local::SendFrame(socket.Get(), "", -1, kNever)) {
    return 1;
  }
  std::string text;
  int number = -1;
  while (kavo::local::ReceiveFrame(socket.Get(), kMaxRequestBytes, text, &number, kNever)) {
    daemon::UniqueFd file(number);
    std::string reply;
    try {
      Json::Value request;
      JsonFromString(request, text);
      reply = JsonToString(extractor.Extract(file.Get(), request["name"].asString()));
    } catch (const std::bad_alloc&) {
      _exit(kOutOfMemory);  // There may be none for an answer, and what is left is in pieces.
    }
    file.Reset();  // Nothing of it is held once the daemon has its answer.
    if (!kavo::local::SendFrame(socket.Get(), reply, -1, kNever)) {
      return 1;
    }
  }
  return 0;
}

}  // namespace vexlo::extractd
