// What kind of file system a path lies on. All are safe to call from several threads. Where one of
// them fails for errno's reason, KLIBCErrGet() is KAVO_ERR_SYSTEM.
#ifndef KAVO_FILESYSTEM_H_
#define KAVO_FILESYSTEM_H_

#ifdef __cplusplus
extern "C" {
#endif

// The number of the file system's type, for KAVOFSIsRemoteFS() and KAVOFSIsImageFS(): 0 or more,
// and the same for one type as long as the process lives. Negative with errno when the path does
// not exist or cannot be looked at. A symbolic link is followed. `flags` is 0.
int KAVOGetFSType(const char* path, int flags);

// Non-zero for a file system that another machine serves: other clients change it unseen.
int KAVOFSIsRemoteFS(int type);

// Non-zero for the content of a mounted image: a disc, or a compressed read-only file system.
int KAVOFSIsImageFS(int type);

// 1 when a file system is mounted on the directory (a bind mount counts), 0 when none is, -1 with
// errno when the path cannot be looked at. A symbolic link is looked at itself.
int KAVOFSDirIsMntPoint(const char* path);

// Sets `*is_inside` to 1 when the path lies in a snapshot (or is its topmost folder), else to 0.
// Returns 0; negative with errno when the path cannot be looked at. A path that tells by its names
// need not exist. A symbolic link is looked at itself.
int KLIBFhsPathInSnapshot(const char* path, int* is_inside);

// 1 when a file or directory of this name holds the platform's own extended attributes; "" does
// not.
int KAVOEAIsHiddenDir(const char* name);

#ifdef __cplusplus
}  // extern "C"
#endif

#endif  // KAVO_FILESYSTEM_H_
