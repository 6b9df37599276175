// The reader of RTF.
#include "daemons/kavocontentextractd/formats.h"
#include "fuzz/format.h"
#include "fuzz/target.h"

extern "C" int LLVMFuzzerTestOneInput(const uint8_t* data, size_t size) {
  fuzz::CheckReader(vexlo::extractd::ReadRtf, "application/rtf", fuzz::TextOf(data, size));
  return 0;
}
