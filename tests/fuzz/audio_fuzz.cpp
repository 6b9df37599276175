// The reader of music.
#include "daemons/kavocontentextractd/formats.h"
#include "fuzz/format.h"

FUZZ_READER(vexlo::extractd::ReadAudio, "audio/mpeg")
