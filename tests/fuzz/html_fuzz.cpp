// The reader of web pages.
#include "daemons/kavocontentextractd/formats.h"
#include "fuzz/format.h"
#include "fuzz/target.h"

extern "C" int LLVMFuzzerTestOneInput(const uint8_t* data, size_t size) {
  fuzz::CheckReader(vexlo::extractd::ReadHtml, "text/html", fuzz::TextOf(data, size));
  return 0;
}
