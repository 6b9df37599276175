// A process that reads files for the daemon, one at a time.
#ifndef DAEMONS_KAVOCONTENTEXTRACTD_WORKER_H_
#define DAEMONS_KAVOCONTENTEXTRACTD_WORKER_H_

#include <cstddef>

#include "daemons/common/sandbox.h"

namespace vexlo::extractd {

// Gives up what a reader of files does not need: `memory` MiB of address space remain (0 for no
// limit), a superuser becomes the account, and ForbidPaths() and AllowReadingOnly() hold, where
// daemon::kCanBeConfined.
// Then says on kWorkerSocket that it is ready, by an empty message, and answers there until the
// daemon closes it. A message that is not empty says why it cannot be confined; then it ends. The
// exit status.
//
// A request is {"name":BASE_NAME} with the file's descriptor, the reply is that of the daemon.
int RunWorker(size_t memory, const daemon::Account& account);

}  // namespace vexlo::extractd

#endif  // DAEMONS_KAVOCONTENTEXTRACTD_WORKER_H_
