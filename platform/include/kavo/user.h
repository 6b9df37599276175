// The platform's users and groups. Callers serialise the calls.
#ifndef KAVO_USER_H_
#define KAVO_USER_H_

#include <sys/types.h>

#ifdef __cplusplus
extern "C" {
#endif

struct KAVO_USER {
  char* szName;
  uid_t uid;
  gid_t gid;  // The primary group.
};

// Looks up a user. 0 and a record that the caller releases with KAVOUserFree, or -1 with `*user`
// null when there is no such user or the look-up fails.
int KAVOUserGet(const char* name, struct KAVO_USER** user);
int KAVOUserGetByUID(uid_t uid, struct KAVO_USER** user);

// Releases a record; null is taken.
void KAVOUserFree(struct KAVO_USER* user);

// 1 when the user is one of the administrators, 0 when not, negative when there is no such user or
// the groups cannot be told. `flags` is 0. On the local platform the administrators are the members
// of the group "administrators", of "sudo" where there is none, of "wheel" where there is neither.
int KLIBGroupIsAdminGroupMem(const char* user, int flags);

// Sets `path` to the user's home directory. 0; negative with errno when there is no such user or
// the buffer is too small (ERANGE; nothing is written then).
int KAVOServiceHomePathGet(const char* user, char* path, size_t bytes);

#ifdef __cplusplus
}  // extern "C"
#endif

#endif  // KAVO_USER_H_
