// Appending to and taking a share's event queue, under the queue file's own flock.
#ifndef FILEINDEX_DAEMONS_QUEUE_FILE_H
#define FILEINDEX_DAEMONS_QUEUE_FILE_H

#include <cstddef>
#include <string>
#include <vector>

namespace fileindex_queue {

enum class AppendResult {
  kWritten,  // every line was appended
  kBusy,     // the lock stayed busy for three tries; nothing was written, try again later
  kFailed,   // the queue could not be opened or written (errno says why); `appended` lines went in
};

// Appends lines (each ending in "\n") with one write() per line. A short write is cut
// back so the file never holds a partial line. New queue files get mode 0600.
AppendResult AppendQueueLines(const std::string& queuePath, const std::vector<std::string>& lines,
                              std::size_t& appended);

enum class TakeResult {
  kTaken,   // the queue is now the ".tmp" companion (or one was already there)
  kEmpty,   // neither the queue nor its companion exists
  kBusy,    // a writer holds the lock; try again later
  kFailed,  // errno says why
};

// For the consumer: makes the ".tmp" companion the work in progress. A companion left by
// an earlier run is taken as it is (it is finished first); otherwise the queue is renamed
// to it under the queue's lock.
TakeResult TakeQueue(const std::string& queuePath);

enum class FinishResult {
  kRemoved,  // the companion is gone: the share's queued work is done
  kMore,     // lines arrived beyond `consumed`: read them, then finish again
  kBusy,     // a writer holds the lock; try again later
  kFailed,   // errno says why
};

// For the consumer: removes the ".tmp" companion once it holds nothing beyond `consumed`
// bytes. It is checked under the companion's lock, so a writer that opened the queue just
// before it was renamed has finished its line by then.
FinishResult FinishQueue(const std::string& queuePath, std::size_t consumed);

}  // namespace fileindex_queue

#endif
