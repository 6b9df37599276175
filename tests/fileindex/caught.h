// What an act throws, as text.
#ifndef FILEINDEX_CAUGHT_H_
#define FILEINDEX_CAUGHT_H_

#include <string>

#include "common/error.h"

// "CODE REASON" of the Error, or "".
template <typename Act>
std::string Caught(const Act& act) {
  try {
    return act(), "";
  } catch (const vexlo::Error& error) {
    return std::to_string(error.GetErrorCode()) + " " + error.what();
  }
}

#endif  // FILEINDEX_CAUGHT_H_
