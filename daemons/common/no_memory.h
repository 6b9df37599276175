// What a lack of memory looks like.
#ifndef DAEMONS_COMMON_NO_MEMORY_H_
#define DAEMONS_COMMON_NO_MEMORY_H_

#include <exception>

namespace vexlo::daemon {

// Whether it tells of no memory, which says nothing about the work that it was wanted for:
// std::bad_alloc, or what jsoncpp throws for a string.
bool IsLackOfMemory(const std::exception& error);

}  // namespace vexlo::daemon

#endif  // DAEMONS_COMMON_NO_MEMORY_H_
