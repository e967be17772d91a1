// Arbitrary status.conf bytes: every reader answers without throwing, the writers' changes
// read back, and what is saved loads again.
#include "fuzz_target.h"

FILEINDEX_FUZZ_TARGET(fuzzh::CheckStatusConf)
