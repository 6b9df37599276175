// What a failure means for the operation that met it, and for the cycle around it. Pure.
#ifndef DAEMONS_FILEINDEXD_CONSEQUENCE_H_
#define DAEMONS_FILEINDEXD_CONSEQUENCE_H_

#include <chrono>

namespace vexlo::fileindexd {

enum class Consequence {
  kGoOn,         // This operation is at fault: log it, and take the next.
  kRetry,        // Nothing goes at present: end the cycle, keep its snapshot, try again later.
  kNoSpace,      // The same, until the volume has room.
  kUnavailable,  // The share cannot be indexed: the same, until something about it changes.
  kRebuild,      // The share has no index, or a damaged one: make it, and crawl.
};

// For a failure within one operation. `code` is an Error's: the library's, or the engine's own.
// Codes that are not known are the operation's fault, so that none of them can stop a share for
// good.
Consequence OfOperation(int code);

// For a failure of what a cycle is made of: the list of folders, the queue, the commit. There is
// nothing that could be passed over.
Consequence OfCycle(int code);

// How long to wait before the next try, in seconds, after `last` (0 for the first failure in a
// row): 1, 2, 4, ... up to 60.
std::chrono::seconds NextWait(std::chrono::seconds last);

}  // namespace vexlo::fileindexd

#endif  // DAEMONS_FILEINDEXD_CONSEQUENCE_H_
