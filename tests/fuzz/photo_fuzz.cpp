// The reader of photos.
#include "daemons/kavocontentextractd/formats.h"
#include "fuzz/format.h"

FUZZ_READER(vexlo::extractd::ReadPhoto, "image/jpeg")
