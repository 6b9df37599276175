// Helpers on files. Those that answer with a bool leave the cause in errno where it is false. Paths
// are full paths, or relative to the working directory; bytes in any encoding. Any thread may call.
#ifndef COMMON_FILE_H_
#define COMMON_FILE_H_

#include <dirent.h>

#include <string>

#include "common/export.h"

struct KAVO_FILE_COPY_ARGS;

namespace vexlo {

// The C library's realpath; "" when it fails.
VEXLO_EXPORT std::string RealPath(const std::string& path);

// True for a regular file itself: not for a directory, a device or a symbolic link, even to a file.
VEXLO_EXPORT bool IsFileExist(const std::string& path);

// True for a directory. A symbolic link counts only with `follow_link`, when its text names a
// directory in turn; the text is used as it stands, so a relative one is looked up from the working
// directory. A chain of over 40 links is no directory.
VEXLO_EXPORT bool IsDirExist(const std::string& path, bool follow_link);

// True when the entry says that it is a directory. An entry whose type the file system does not
// tell (DT_UNKNOWN) answers false whatever lies at `path`: callers depend on it.
VEXLO_EXPORT bool IsDirentDir(const struct dirent* entry, const std::string& path);

// True when a file system is mounted on the path.
VEXLO_EXPORT bool IsMountPoint(const std::string& path);

// True when the calling user holds any right of `perm` (the KAVO_ACL_* bits of kavo/acl.h) on the
// path; false when the rights cannot be told.
VEXLO_EXPORT bool CheckACLPerm(const std::string& path, unsigned perm);

// True when the path is gone: removed now, or not there to begin with.
VEXLO_EXPORT bool Unlink(const std::string& path);

// Move or copy a file with mode, owner, times and extended attributes; an existing target is
// replaced whole or not at all. True when it is done. What `args` asks for stands in kavo/file.h.
VEXLO_EXPORT bool MVFile(const std::string& from, const std::string& to);
VEXLO_EXPORT bool CPFile(const std::string& from, const std::string& to);
VEXLO_EXPORT bool MVFileImpl(const std::string& from, const std::string& to,
                             const KAVO_FILE_COPY_ARGS& args);

// Hands the file to the package's own user and group, "Vexlo"; false when there is no such user or
// the change is refused. Takes SDKMutex() around the look-up.
VEXLO_EXPORT bool ChownVexlo(const std::string& path);

// Reads a whole file into `content`, whatever its size; false when it cannot be opened or read.
VEXLO_EXPORT bool ReadFile(std::string& content, const std::string& path);

// Replaces a file whole: a reader, or the next start after a power failure, finds the old content
// or the new one, never a part. The new file has mode 0644 and, where permitted, the owner of the
// old one. A symbolic link at the path is replaced, not followed. False at any failure, and nothing
// is left beside the file; the old one stands, unless it was the folder that could not be synced:
// then the new one does, and only a power failure may bring the old one back.
//
// On disk, in order: "PATH.XXXXXX" beside the target is written and synced, renamed over the
// target, and the folder is synced. A kill before the rename leaves that temporary file, which
// nobody reads.
VEXLO_EXPORT bool ReplaceFile(const std::string& path, const std::string& content);

// Appends whole lines (`lines` ends in a newline) to a file that other processes append to and
// rename away, a queue. Holds its LockFile; makes the file with mode 0644 when it is missing;
// closes a line that a writer left torn first, so that it cannot swallow ours. On a failure the
// file is cut back to what it held: Error 502 (or 506 from the lock), and no part of the lines is
// there.
VEXLO_EXPORT void AppendLines(const std::string& path, const std::string& lines);

// The same for those who cannot wait and try again later: false when the lock is held by somebody
// else (errno EWOULDBLOCK), and at any failure. Nothing is logged, but a file that could not be cut
// back.
VEXLO_EXPORT bool TryAppendLines(const std::string& path, const std::string& lines);

}  // namespace vexlo

#endif  // COMMON_FILE_H_
