// The platform's access rights. Safe to call from several threads.
#ifndef KAVO_ACL_H_
#define KAVO_ACL_H_

#ifdef __cplusplus
extern "C" {
#endif

// Bits of a permission mask.
enum {
  KAVO_ACL_EXECUTE = 1,
  KAVO_ACL_WRITE = 2,
  KAVO_ACL_READ = 4,
};

// Sets `*mask` to what the effective user of the calling process may do with the file itself (the
// folders on the way are not looked at): mode and POSIX access ACL, and the privileges of root.
// Returns 0, or -1 with errno when the path cannot be looked at; `*mask` is 0 then.
int KAVOACLPermGet(const char* path, unsigned* mask);

#ifdef __cplusplus
}  // extern "C"
#endif

#endif  // KAVO_ACL_H_
