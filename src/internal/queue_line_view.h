// A fast, allocation-free reading of the common queue line: one strict pass over the
// bytes that finds "event", "path" and "path_old" without building a JSON document.
// Lines it cannot decide with certainty are left to ParseQueueLine (queue_scan.h),
// which remains the authority on what a queue line is.
#ifndef FILEINDEX_INTERNAL_QUEUE_LINE_VIEW_H
#define FILEINDEX_INTERNAL_QUEUE_LINE_VIEW_H

#include <cstddef>

namespace TAVO {
namespace FILEINDEX {
namespace internal {

// The members of a queue line as spans into the line; valid while the line is.
struct QueueEventView {
  unsigned event = 0;
  const char* path = nullptr;
  size_t pathSize = 0;
  // Null when "path_old" is absent or not a string.
  const char* pathOld = nullptr;
  size_t pathOldSize = 0;
};

// True when the line is certainly one that ParseQueueLine accepts, and out then holds
// the same values it would give. False means "not decided here", never "malformed":
// escapes in the members read, fractions and exponents, literals that JSON allows
// only loosely, deep nesting and every malformed line all answer false, and the
// caller must ask ParseQueueLine.
bool ViewQueueLine(const char* data, size_t size, QueueEventView& out);

}  // namespace internal
}  // namespace FILEINDEX
}  // namespace TAVO

#endif
