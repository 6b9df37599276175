// The reader of films.
#include "daemons/kavocontentextractd/formats.h"
#include "fuzz/format.h"

FUZZ_READER(vexlo::extractd::ReadMedia, "video/mp4")
