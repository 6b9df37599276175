// The reader of PDF.
#include "daemons/kavocontentextractd/formats.h"
#include "fuzz/format.h"

FUZZ_READER(vexlo::extractd::ReadPdf, "application/pdf")
