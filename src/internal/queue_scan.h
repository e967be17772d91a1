// Streaming reader of the per-share event queues: one JSON object a line, files that
// the indexing daemon may grow to hundreds of megabytes.
#ifndef FILEINDEX_INTERNAL_QUEUE_SCAN_H
#define FILEINDEX_INTERNAL_QUEUE_SCAN_H

#include <cstddef>
#include <functional>
#include <string>

namespace TAVO {
namespace FILEINDEX {
namespace internal {

// The members of a queue line that the library reads.
struct QueueEvent {
  unsigned event = 0;
  std::string path;
  std::string pathOld;  // "path_old" when it is a string, else empty
  bool hasPathOld = false;
};

// Called once per line, without its "\n" (a "\r" stays in the line). The data is valid
// only during the call. Returning false ends the scan early.
using QueueLineVisitor = std::function<bool(const char* data, size_t size)>;

// Reads the file in fixed-size blocks and hands every line to visit, the last one also
// when it has no newline; memory use is bounded by the block and the longest line. A
// read error ends the scan like the end of the file. False only when the file cannot be
// opened, with errno left as open() set it.
bool ForEachQueueLine(const std::string& path, const QueueLineVisitor& visit);

// True when the line is a JSON object (strict parse) whose "event" converts to an
// unsigned integer and whose "path" is a string; out is then filled. Other lines are
// not events and leave out in an unspecified state.
bool ParseQueueLine(const char* data, size_t size, QueueEvent& out);

}  // namespace internal
}  // namespace FILEINDEX
}  // namespace TAVO

#endif
