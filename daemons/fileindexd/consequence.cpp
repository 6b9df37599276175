#include "daemons/fileindexd/consequence.h"

#include <algorithm>

#include "common/error.h"

namespace vexlo::fileindexd {
namespace {

// The engine's, as docs/engine.md lists them.
enum EngineCode {
  kIndexMissing = 2002,
  kIndexPaused = 2004,
  kIndexDamaged = 2005,
  kStorage = 2009,
  kDiskFull = 2010,
  kLost = 2011,
};

}  // namespace

Consequence OfOperation(int code) {
  switch (code) {
    case ERR_ELASTIC_REQUEST:
    case ERR_BAD_RESPONSE:
    case ERR_CREDENTIALS:
    case ERR_LOCK:
    case kIndexPaused:
    case kStorage:
    case kLost:
    case 607:  // Not ready, and busy: the library waits for these itself where it sends.
    case 608:
    case 610:
    case 1400:
    case 1401:
      return Consequence::kRetry;
    case ERR_SPACE_NOT_ENOUGH:
    case kDiskFull:
      return Consequence::kNoSpace;
    case ERR_SHARE_NOT_FOUND:
      return Consequence::kUnavailable;
    case kIndexMissing:
    case kIndexDamaged:
      return Consequence::kRebuild;
    default:
      return Consequence::kGoOn;
  }
}

Consequence OfCycle(int code) {
  const Consequence consequence = OfOperation(code);
  return consequence == Consequence::kGoOn ? Consequence::kRetry : consequence;
}

std::chrono::seconds NextWait(std::chrono::seconds last) {
  constexpr std::chrono::seconds kFirst{1};
  constexpr std::chrono::seconds kLongest{60};
  return std::clamp(2 * last, kFirst, kLongest);
}

}  // namespace vexlo::fileindexd
