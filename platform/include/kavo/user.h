// The platform's user records.
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

// Looks up a user by name. 0 and a record that the caller releases with KAVOUserFree, or -1 with
// `*user` null when there is no such user or the look-up fails. Callers serialise the calls.
int KAVOUserGet(const char* name, struct KAVO_USER** user);

// Releases a record; null is taken.
void KAVOUserFree(struct KAVO_USER* user);

#ifdef __cplusplus
}  // extern "C"
#endif

#endif  // KAVO_USER_H_
