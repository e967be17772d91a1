// The index manager's writers and readers with arbitrary JSON arguments.
#include "fuzz_target.h"

FILEINDEX_FUZZ_TARGET(fuzzh::CheckIndexMgr)
