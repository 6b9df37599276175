// Programs run by the platform: without a shell, without the caller's descriptors (standard input
// is /dev/null, standard output and error are the caller's), with the caller's environment and ids,
// with no signal blocked or ignored. All are safe to call from several threads.
#ifndef KAVO_EXEC_H_
#define KAVO_EXEC_H_

#ifdef __cplusplus
extern "C" {
#endif

// Options of KLIBCExecl(). This is the only value that callers pass; the local platform takes any
// for it.
enum { KLIBC_EXEC_DEFAULT = 187 };

// Runs the program at `path` with the arguments that follow, up to a null pointer, and waits for
// its end; the program's own name is put before them. Returns its exit status, 128 and the signal's
// number when a signal ended it, or -1 with errno when it could not be started.
//
// In a program that ignores SIGCHLD, or itself waits for any child, the exit status is lost: 0 then
// for all that could be started.
int KLIBCExec(const char* path, ...) __attribute__((sentinel));
int KLIBCExecl(const char* path, int options, ...) __attribute__((sentinel));

#ifdef __cplusplus
}  // extern "C"
#endif

#endif  // KAVO_EXEC_H_
