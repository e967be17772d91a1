// Streaming reader of the per-share event queues: one JSON object a line, files that
// the indexing daemon may grow to hundreds of megabytes.
#ifndef FILEINDEX_INTERNAL_QUEUE_SCAN_H
#define FILEINDEX_INTERNAL_QUEUE_SCAN_H

#include <cstddef>
#include <cstring>
#include <functional>
#include <memory>
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

// Reads a file a block at a time and hands out its lines: each ends at a "\n", which is
// not part of it (a "\r" stays), and a last line without a newline counts too. Memory
// is one block, grown only for a line longer than a block. A read error ends the file.
class QueueLineReader {
 public:
  QueueLineReader();
  ~QueueLineReader();
  QueueLineReader(const QueueLineReader&) = delete;
  QueueLineReader& operator=(const QueueLineReader&) = delete;

  // False when the file cannot be opened, with errno left as open() set it.
  bool Open(const std::string& path);

  // The next line; the bytes stay valid until the next call. False at the end.
  bool NextLine(const char*& data, size_t& size) {
    if (pos_ < filled_) {
      const char* nl = static_cast<const char*>(std::memchr(pos_, '\n', static_cast<size_t>(filled_ - pos_)));
      if (nl != nullptr) {
        data = pos_;
        size = static_cast<size_t>(nl - pos_);
        pos_ = nl + 1;
        return true;
      }
    }
    return NextLineSlow(data, size);
  }

  // The next run of whole lines, each with its "\n" (the file's last line may lack
  // one); for callers that search many lines at once. False at the end.
  bool NextLines(const char*& data, size_t& size);

 private:
  bool NextLineSlow(const char*& data, size_t& size);
  // Keeps the unread bytes and reads more after them; false when nothing was added.
  bool Refill();

  int fd_;
  bool eof_;
  size_t capacity_;
  std::unique_ptr<char[]> block_;
  // The unread bytes of the block.
  const char* pos_;
  const char* filled_;
};

// Called once per line, without its "\n" (a "\r" stays in the line). The data is valid
// only during the call. Returning false ends the scan early.
using QueueLineVisitor = std::function<bool(const char* data, size_t size)>;

// Every line of the file through QueueLineReader. False only when the file cannot be
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
