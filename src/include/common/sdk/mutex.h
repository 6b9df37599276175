// The one lock around the platform library.
#ifndef COMMON_SDK_MUTEX_H_
#define COMMON_SDK_MUTEX_H_

#include "common/export.h"
#include "common/lock.h"

namespace vexlo::sdk {

// Guards every call into the platform's share and user library, which is not safe to call from two
// threads. Not recursive: a holder calls nothing that takes it.
VEXLO_EXPORT Mutex& SDKMutex();

}  // namespace vexlo::sdk

#endif  // COMMON_SDK_MUTEX_H_
