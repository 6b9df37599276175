#include "platform/local/last_error.h"

namespace {

thread_local int last_error = KAVO_ERR_NONE;

}  // namespace

namespace kavo::local {

int SetLastError(int error) noexcept {
  last_error = error;
  return -1;
}

}  // namespace kavo::local

int KLIBCErrGet(void) { return last_error; }
