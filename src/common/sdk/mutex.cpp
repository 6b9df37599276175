#include "common/sdk/mutex.h"

namespace vexlo::sdk {

Mutex& SDKMutex() {
  static Mutex mutex;
  return mutex;
}

}  // namespace vexlo::sdk
