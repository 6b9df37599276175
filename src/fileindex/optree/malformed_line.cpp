#include "fileindex/optree/malformed_line.h"

#include <cerrno>

#include "common/check.h"

namespace vexlo::fileindex {

std::string Excerpt(std::string_view start, uint64_t length) {
  const std::string text(start);
  return start.size() == length ? text
                                : text + "... (a line of " + std::to_string(length) + " bytes)";
}

void FailMalformed(std::string_view start, uint64_t length) {
  const int error = errno;
  FailCheck({"optree", 50, "Event", "!data.fromString(event_raw)"}, ERR_BAD_EVENT,
            "Malformed event_raw: " + Excerpt(start, length), error);
}

}  // namespace vexlo::fileindex
