// The reader of PDF.
#include "daemons/kavocontentextractd/formats.h"
#include "fuzz/format.h"
#include "fuzz/target.h"

extern "C" int LLVMFuzzerTestOneInput(const uint8_t* data, size_t size) {
  fuzz::CheckReader(vexlo::extractd::ReadPdf, "application/pdf", fuzz::TextOf(data, size));
  return 0;
}
