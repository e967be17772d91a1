// A fast reading of the common queue line: one strict pass over the bytes that finds
// "event", "path" and "path_old" without building a JSON document. Lines it cannot
// decide with certainty are left to ParseQueueLine (queue_scan.h), which remains the
// authority on what a queue line is.
#ifndef FILEINDEX_INTERNAL_QUEUE_LINE_VIEW_H
#define FILEINDEX_INTERNAL_QUEUE_LINE_VIEW_H

#include <cstddef>
#include <string>

namespace TAVO {
namespace FILEINDEX {
namespace internal {

// The members of a queue line. A member written without escapes is a span of the line
// itself; one with escapes is decoded into the view's own storage. Valid while both the
// line and this view are (a copy of the view may point into the original's storage).
struct QueueEventView {
  unsigned event = 0;
  const char* path = nullptr;
  size_t pathSize = 0;
  // Null when "path_old" is absent or not a string.
  const char* pathOld = nullptr;
  size_t pathOldSize = 0;
  // Decoded members; their capacity is kept from line to line.
  std::string pathStorage;
  std::string pathOldStorage;
};

// True when the line is certainly one that ParseQueueLine accepts, and out then holds
// the same values it would give. False means "not decided here", never "malformed":
// fractions and exponents, literals and numbers that JSON allows only loosely, escaped
// member names, deep nesting and every malformed line all answer false, and the caller
// must ask ParseQueueLine.
bool ViewQueueLine(const char* data, size_t size, QueueEventView& out);

enum class QueueLineKind {
  kEvent,      // certainly accepted by ParseQueueLine
  kNotEvent,   // certainly refused by it: a malformed line
  kUndecided,  // ask ParseQueueLine
};

// The same for the line that starts at data and ends at the first "\n" before limit (or
// at limit), for a caller that has not split its lines. A line is also decided when it
// certainly is not an event: blank, cut off before its value ends, a complete value that
// is not an event (not an object, no "event" convertible to an unsigned integer, no
// string "path"), or a value followed by more than blanks (but a NUL byte there, which
// the JSON library takes for the end of the text, is left undecided). For an event,
// lineEnd is set to the line's end (its "\n" or limit) and out holds its values.
QueueLineKind ClassifyQueueLine(const char* data, const char* limit, QueueEventView& out,
                                const char*& lineEnd);

}  // namespace internal
}  // namespace FILEINDEX
}  // namespace TAVO

#endif
