// Room on a volume.
#ifndef KAVO_QUOTA_H_
#define KAVO_QUOTA_H_

#include <stdint.h>
#include <sys/types.h>

#ifdef __cplusplus
extern "C" {
#endif

// Non-zero when the user may still write `bytes` bytes below `path`. 0 when not: KLIBCErrGet() is
// KAVO_ERR_NO_SPACE when the volume is too full, KAVO_ERR_QUOTA when the user's quota does not
// allow it, and something else when the question cannot be answered. User 0 has no quota, and nor
// has anybody on a file system that keeps none or whose quotas the caller may not see.
int KAVOQuotaIsEnough(uid_t user, const char* path, uint64_t bytes);

#ifdef __cplusplus
}  // extern "C"
#endif

#endif  // KAVO_QUOTA_H_
