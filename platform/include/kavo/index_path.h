// Where the index of a share and the queue of its changes lie. All are safe to call from several
// threads.
//
// Each writes a NUL-terminated text that is never empty into `buffer` and returns 0; negative with
// errno when it does not fit (ERANGE) or cannot be made up (EINVAL: an empty name, a path that is
// not absolute; ENAMETOOLONG: a path that makes too long a file name), and the buffer is as it was.
// What is composed need not exist, and is not made.
#ifndef KAVO_INDEX_PATH_H_
#define KAVO_INDEX_PATH_H_

#include <stddef.h>

#ifdef __cplusplus
extern "C" {
#endif

// The queue file of the share whose directory is `share_path`. Two shares never have the same, and
// it lies outside of every share that may be watched, as its own changes would be queued else.
int FILEIDXQueuePathCompose(const char* share_path, char* buffer, size_t bytes);

// The folder of the share's index database.
int FILEIDXDBPathCompose(const char* share_path, char* buffer, size_t bytes);

// The name under which the search engine knows the index of the share `share_name`.
int FILEIDXGetIndexID(const char* share_name, char* buffer, size_t bytes);

#ifdef __cplusplus
}  // extern "C"
#endif

#endif  // KAVO_INDEX_PATH_H_
