// Arbitrary folder.conf bytes: loading, the flag carry-over, saving back and a listing page.
#include "fuzz_target.h"

FILEINDEX_FUZZ_TARGET(fuzzh::CheckFolderConf)
