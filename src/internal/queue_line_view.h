// A fast reading of the common queue line: one strict pass over the bytes that finds
// "event", "path" and "path_old" without building a JSON document. Lines it cannot
// decide with certainty are left to ParseQueueLine (queue_scan.h), which remains the
// authority on what a queue line is.
#ifndef FILEINDEX_INTERNAL_QUEUE_LINE_VIEW_H
#define FILEINDEX_INTERNAL_QUEUE_LINE_VIEW_H

#include <cstddef>
#include <cstdint>
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

// Whether the caller reads an event's paths, or only needs to know that the line is one:
// decoding a path with escapes is then left out.
enum class QueuePaths { kRead, kUnread };

// How the run reader reads a flat object of numbers ("data" as the daemons write it): at
// once, with the processor's widest vectors where it has them, or member by member.
enum class FlatObjectReading {
  kMemberByMember,
  kCompared,  // AVX-512BW: each byte's class found by comparisons
  kLookedUp,  // AVX-512VBMI as well: by one table lookup
};
// The best this processor has, used unless a test asks for another.
FlatObjectReading BestFlatObjectReading();
// For tests, which read their lines each way the processor can: at most the best.
void UseFlatObjectReading(FlatObjectReading reading);

// ClassifyQueueLine for each line of a run of whole lines, as QueueLineReader::NextLines
// hands them out, asked front to back. The line as the daemon writes it is read from bit
// masks of the run's quotes, backslashes and newlines, computed a few kilobytes at a time
// over the bytes at once; any other line goes to ClassifyQueueLine.
class QueueRunClassifier {
 public:
  // The run is [data, end); nothing outside it is read.
  QueueRunClassifier(const char* data, const char* end) : end_(end), window_(data), windowEnd_(data) {}

  // What ClassifyQueueLine(line, end, out, lineEnd) answers, for line at the start of a
  // line of the run; asked front to back, the masks are computed once. With kUnread, out's
  // paths may be left null.
  QueueLineKind Classify(const char* line, QueueEventView& out, const char*& lineEnd,
                         QueuePaths paths = QueuePaths::kRead) {
    if (Common(line, out, lineEnd, paths)) return QueueLineKind::kEvent;
    return ClassifyQueueLine(line, end_, out, lineEnd);
  }

 private:
  // The masks cover this many 64-byte words from window_.
  static const size_t kWords = 128;

  // True when the line is compact, with "event" first or with its members in the order
  // of their names (as the JSON library writes them), and escapes only in its paths; out
  // is then read. False leaves the line to ClassifyQueueLine.
  bool Common(const char* line, QueueEventView& out, const char*& lineEnd, QueuePaths paths);
  // Masks for the bytes from at on, as many words as the run has left.
  void Fill(const char* at);

  const char* const end_;
  const char* window_;
  const char* windowEnd_;
  uint64_t masks_[kWords + 1];
};

}  // namespace internal
}  // namespace FILEINDEX
}  // namespace TAVO

#endif
