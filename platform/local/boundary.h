// What the platform's C functions share: none of them lets an exception out. Not installed.
#ifndef PLATFORM_LOCAL_BOUNDARY_H_
#define PLATFORM_LOCAL_BOUNDARY_H_

#include <cerrno>
#include <new>

#include "platform/local/last_error.h"

namespace kavo::local {

// Sets both and returns -1.
inline int Fail(int kavo_error, int error) noexcept {
  errno = error;
  return SetLastError(kavo_error);
}

// What `body` returns; -1 when it throws.
template <typename Body>
int Guarded(Body body) noexcept {
  try {
    return body();
  } catch (const std::bad_alloc&) {
    return Fail(KAVO_ERR_SYSTEM, ENOMEM);
  } catch (...) {  // A caller's own function; ours throw nothing else that gets here.
    return Fail(KAVO_ERR_SYSTEM, EIO);
  }
}

}  // namespace kavo::local

#endif  // PLATFORM_LOCAL_BOUNDARY_H_
