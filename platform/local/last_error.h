// The number that KLIBCErrGet() gives. Not installed.
#ifndef PLATFORM_LOCAL_LAST_ERROR_H_
#define PLATFORM_LOCAL_LAST_ERROR_H_

#include "kavo/last_error.h"

namespace kavo::local {

// Keeps errno. Returns -1, for "return SetLastError(...)".
int SetLastError(int error) noexcept;

}  // namespace kavo::local

#endif  // PLATFORM_LOCAL_LAST_ERROR_H_
