// The reader of RTF.
#include "daemons/kavocontentextractd/formats.h"
#include "fuzz/format.h"

FUZZ_READER(vexlo::extractd::ReadRtf, "application/rtf")
