// The platform's shared folders ("shares"). Callers serialise all calls but those marked otherwise.
//
// Unless a comment says otherwise a function returns a negative number when it fails; errno and
// KLIBCErrGet() then tell why, and out-parameters are as they were.
#ifndef KAVO_SHARE_H_
#define KAVO_SHARE_H_

#include <stdint.h>

#include "kavo/string_list.h"

#ifdef __cplusplus
extern "C" {
#endif

struct KAVO_SHARE {
  char* szName;
  char* szPath;           // The share's directory on its volume, absolute: "/volume1/photo".
  uint32_t ftpPrivilege;  // As the administrator set it; its bits are the FTP server's.
};

// Bits of what a user may do in a share.
enum {
  KAVO_SHARE_PRIVILEGE_NONE = 0,
  KAVO_SHARE_PRIVILEGE_READ = 1,
  KAVO_SHARE_PRIVILEGE_WRITE = 2,
};

// Looks up a share by name. 0 and a record that the caller releases with KAVOShareFree; negative
// with `*share` null when there is no such share or the shares cannot be told.
int KAVOShareGet(const char* name, struct KAVO_SHARE** share);

// Releases a record; null is taken.
void KAVOShareFree(struct KAVO_SHARE* share);

// 1 when the share is encrypted and locked at present, so that its files cannot be read; else 0.
int KLIBShareIsEncryptedGet(const struct KAVO_SHARE* share, int* is_encrypted);

// 1 when the share is of the encrypted kind, locked or not; else 0.
int KLIBShareIsEncryptionGet(const struct KAVO_SHARE* share, int* is_encryption);

// 1 when nothing can be written in the share: its setting says so, or its file system is mounted
// read-only; else 0.
int KLIBShareIsReadOnlyGet(const struct KAVO_SHARE* share, int* is_read_only);

// 1 when the share's recycle bin is on, else 0.
int KLIBShareRecycleStatusGet(const struct KAVO_SHARE* share, int* is_enabled);

// 1 when files that a user may not read are hidden from that user, else 0. Safe to call from
// several threads.
int KLIBShareHideUnreadableGet(const struct KAVO_SHARE* share, int* is_hidden);

// What a user may do in the share, KAVO_SHARE_PRIVILEGE_* bits: by mode, owner, groups and ACL of
// the share's directory itself (the folders on the way are not looked at), where both bits want the
// right to enter it, and nobody writes on a file system that is mounted read-only. Negative when
// there is no such user or the rights cannot be told. Safe to call from several threads.
int KAVOShareUserPrivCalc(const char* user, const struct KAVO_SHARE* share);

// Which shares KLIBShareEnum() lists.
struct KLIB_SHARE_ENUM {
  int (*filter)(const struct KAVO_SHARE* share);  // 0 takes the share.
  unsigned reserved;                              // 0.
};

// Appends the names of all shares that the filter takes to `*list`, which may move. The number of
// names appended. Safe to call from several threads.
int KLIBShareEnum(KLIBCSZLIST** list, const struct KLIB_SHARE_ENUM* which);

// The share whose directory a full path is, or lies below: with shares inside each other the
// innermost. Sets name and directory, both NUL-terminated; negative when no share holds the path or
// a buffer is too small (nothing is written then). Looks at the text of the path alone. Safe to
// call from several threads.
int KAVOShareNamePathGet(const char* full_path, char* name, int name_bytes, char* path,
                         int path_bytes);

// 1 when the path is a share's recycle bin or lies in one, 0 when not. Safe to call from several
// threads.
int KAVOShareIsShareRecycle(const char* full_path);

// 1 when the path is a recycle bin in a user's home or lies in one, 0 when not. `kind` is passed as
// 11 by all callers, and no other meaning is known. Safe to call from several threads.
int KAVORecycleUserHomePathIsExist(const char* full_path, int kind);

#ifdef __cplusplus
}  // extern "C"
#endif

#endif  // KAVO_SHARE_H_
