// The effective identity of the process.
#ifndef KAVO_CREDENTIALS_H_
#define KAVO_CREDENTIALS_H_

#include <stdbool.h>

#ifdef __cplusplus
extern "C" {
#endif

// Gives the process the effective user, group and supplementary groups of the named user; the real
// and saved ids stay, so that it can come back. True at once when user and group are those already.
// False with errno when there is no such user or the process may not; the identity is as it was
// then. All threads of the process change together, and callers serialise the calls. `keep_saved`
// is passed as true by all callers.
//
// On a local platform with a root folder of its own "root" names the owner of that folder, who is
// the administrator of all below it, and is so with whatever group: true at once when the user is
// that already.
bool ResetCredentialsByName(const char* name, bool keep_saved);

#ifdef __cplusplus
}  // extern "C"
#endif

#endif  // KAVO_CREDENTIALS_H_
