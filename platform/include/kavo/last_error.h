// Why the platform's last failing call on this thread failed.
#ifndef KAVO_LAST_ERROR_H_
#define KAVO_LAST_ERROR_H_

#ifdef __cplusplus
extern "C" {
#endif

// Callers compare with these numbers: never renumber.
enum {
  KAVO_ERR_NONE = 0,
  KAVO_ERR_BAD_PARAMETER = 0x0D00,
  KAVO_ERR_NOT_FOUND = 0x1400,   // No such share, user or group.
  KAVO_ERR_BAD_CONFIG = 0x1E00,  // The platform's own settings cannot be read.
  KAVO_ERR_SYSTEM = 0x2000,      // A system call failed; errno says how.
  KAVO_ERR_NO_SPACE = 0x2400,    // The volume is full.
  KAVO_ERR_QUOTA = 0x2900,       // The user's quota is used up.
};

// KAVO_ERR_NONE until a call fails on the calling thread. A call that succeeds leaves it alone.
int KLIBCErrGet(void);

#ifdef __cplusplus
}  // extern "C"
#endif

#endif  // KAVO_LAST_ERROR_H_
