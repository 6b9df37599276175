// The platform's file functions. All are safe to call from several threads.
#ifndef KAVO_FILE_H_
#define KAVO_FILE_H_

#ifdef __cplusplus
extern "C" {
#endif

// How KAVOFileCopy works. Zero the whole record, then set what is wanted.
struct KAVO_FILE_COPY_ARGS {
  int keep_attributes;  // Non-zero: mode, owner where permitted, times, ACLs, extended attributes.
  int remove_source;    // Non-zero: a move; the source is gone when the call returned 0.
};

// Copies or moves the regular file or symbolic link at `from` to the path `to` (not into a folder
// of that name). A target that exists is replaced in one step; on failure it is as it was, and so
// is the source, except that a move on a file system that cannot exchange two names may leave the
// new target beside a source that it could not remove. Shares or copies blocks inside the kernel
// where the file system can. Returns 0, or -1 with errno: EISDIR for a directory (a move within one
// file system takes those too), ENOTSUP for a device, socket or FIFO, or what the failing system
// call said.
int KAVOFileCopy(const char* from, const char* to, const struct KAVO_FILE_COPY_ARGS* args);

#ifdef __cplusplus
}  // extern "C"
#endif

#endif  // KAVO_FILE_H_
