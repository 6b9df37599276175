#include "daemons/common/no_memory.h"

#include <json/value.h>

#include <new>
#include <string_view>

namespace vexlo::daemon {

bool IsLackOfMemory(const std::exception& error) {
  return dynamic_cast<const std::bad_alloc*>(&error) != nullptr ||
         (dynamic_cast<const Json::RuntimeError*>(&error) != nullptr &&
          std::string_view(error.what()).find("allocate") != std::string_view::npos);
}

}  // namespace vexlo::daemon
