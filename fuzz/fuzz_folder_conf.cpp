// Arbitrary folder.conf bytes through the path queries' fast reader: its names against
// the strict parse, and each query's answer, log lines and error code against the full load.
#include "fuzz_target.h"

FILEINDEX_FUZZ_TARGET(fuzzh::CheckFolderConfView)
