// The edge between the C functions of the platform and the C++ behind them. Not installed.
#ifndef PLATFORM_LOCAL_BOUNDARY_H_
#define PLATFORM_LOCAL_BOUNDARY_H_

#include <cerrno>
#include <exception>
#include <new>

#include "platform/local/last_error.h"

namespace kavo::local {

// What `body()` returns; -1 with errno and the last error when it throws.
template <typename Body>
int AtBoundary(Body body) noexcept {
  try {
    return body();
  } catch (const std::bad_alloc&) {
    errno = ENOMEM;
  } catch (const std::exception&) {
    errno = EIO;
  }
  return SetLastError(KAVO_ERR_SYSTEM);
}

}  // namespace kavo::local

#endif  // PLATFORM_LOCAL_BOUNDARY_H_
