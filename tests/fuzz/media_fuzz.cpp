// The reader of films.
#include "daemons/kavocontentextractd/formats.h"
#include "fuzz/format.h"
#include "fuzz/target.h"

extern "C" int LLVMFuzzerTestOneInput(const uint8_t* data, size_t size) {
  fuzz::CheckReader(vexlo::extractd::ReadMedia, "video/mp4", fuzz::TextOf(data, size));
  return 0;
}
