// Completes what a process has left undone that was killed while it changed the folders.
#ifndef DAEMONS_FILEINDEXD_SETTLE_H_
#define DAEMONS_FILEINDEXD_SETTLE_H_

namespace vexlo::fileindexd {

// The list of folders says what holds, as each change writes it whole. An indexed share whose
// registration with the notify daemon names other folders is registered anew, and its folders are
// queued to be compared: for some time nobody may have told of changes. A share that is registered
// and has no folder loses its index, its registration with its queue, and its status, unless there
// is no list at all. Shares that are gone stay as they are.
//
// A look without the lock comes first, so that nobody who changes folders waits for this. Nothing
// is done while the lock is held: who has it completes his change, or lets go of it.
//
// Throws the Error of what could not be read or changed; a further call goes on from there.
void SettleFolders();

}  // namespace vexlo::fileindexd

#endif  // DAEMONS_FILEINDEXD_SETTLE_H_
