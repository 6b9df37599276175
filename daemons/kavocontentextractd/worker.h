// A process that reads files for the daemon, one at a time.
#ifndef DAEMONS_KAVOCONTENTEXTRACTD_WORKER_H_
#define DAEMONS_KAVOCONTENTEXTRACTD_WORKER_H_

#include <cstddef>

namespace vexlo::extractd {

// Gives up what a reader of files does not need: `memory` MiB of address space remain (0 for no
// limit), nothing can be written to files, no core is dumped, no program can raise its privileges,
// and a superuser becomes the user "nobody".
// Then says on kWorkerSocket that it is ready, by an empty message, and answers there until the
// daemon closes it. The exit status.
//
// A request is {"name":BASE_NAME} with the file's descriptor, the reply is that of the daemon.
int RunWorker(size_t memory);

}  // namespace vexlo::extractd

#endif  // DAEMONS_KAVOCONTENTEXTRACTD_WORKER_H_
