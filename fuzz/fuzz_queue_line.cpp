// Queue lines and queue files: the strict reader, the fast readers (line by line and over a
// run of lines), the line splitting, the folder status and the absorption of events by a
// pending reindex.
#include "fuzz_target.h"

namespace {
std::string Check(const fuzzh::Env& env, const uint8_t* data, size_t size) {
  // The whole input as one line first: JSON spread over several lines is still JSON.
  std::string problem = fuzzh::CheckQueueLine(std::string(reinterpret_cast<const char*>(data), size));
  if (!problem.empty()) return problem;
#ifdef FILEINDEX_FUZZ_HAVE_LINE_VIEW
  problem = fuzzh::CheckQueueRun(data, size);
  if (!problem.empty()) return problem;
#endif
  return fuzzh::CheckQueueFile(env, data, size);
}
}  // namespace

FILEINDEX_FUZZ_TARGET(Check)
