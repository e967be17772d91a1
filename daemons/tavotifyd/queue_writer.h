// Lines waiting for their queue. Each flush appends a queue's held lines under one lock;
// a queue that is busy or failing keeps its lines and is retried on a timer, so a line is
// never dropped while its queue can still be written. What is held per queue is bounded:
// past the bound, the held lines are replaced by one reindex line per folder the queue
// serves, which tells the consumer to reconcile everything those lines described.
#ifndef FILEINDEX_TAVOTIFYD_QUEUE_WRITER_H
#define FILEINDEX_TAVOTIFYD_QUEUE_WRITER_H

#include <chrono>
#include <cstddef>
#include <cstdint>
#include <functional>
#include <map>
#include <set>
#include <string>
#include <vector>

#include "daemon_support.h"

namespace tavotifyd {

class QueueWriter {
 public:
  // The folders whose events a queue receives (for its reindex lines).
  using FoldersOfQueue = std::function<std::vector<std::string>(const std::string& queue)>;

  QueueWriter(fileindex_daemon::EventLoop& loop, FoldersOfQueue foldersOf, std::size_t maxHeldPerQueue);
  QueueWriter(const QueueWriter&) = delete;
  QueueWriter& operator=(const QueueWriter&) = delete;

  // line ends in "\n" (FormatQueueLine).
  void Add(const std::string& queue, std::string line);
  // Held once per folder until written.
  void AddReindex(const std::string& queue, const std::string& folder);
  // Appends what every queue holds, except queues already waiting for a retry.
  void Flush();
  // For shutdown: keeps trying for at most `budget`; returns the number of lines not written.
  std::size_t FlushBeforeExit(std::chrono::milliseconds budget);
  std::size_t HeldCount() const;

 private:
  struct HeldLines {
    std::vector<std::string> lines;
    std::set<std::string> reindexFolders;  // of the reindex lines among `lines`
    bool collapsed = false;                // lines were replaced by reindex lines
    bool failing = false;                  // the last write failed (logged once)
    std::uint64_t retryTimer = 0;
  };
  enum class Outcome { kDone, kRetrySoon, kRetryLater };
  Outcome Write(const std::string& queue, HeldLines& held);
  void ScheduleRetry(const std::string& queue, HeldLines& held, std::chrono::milliseconds delay);
  void Collapse(const std::string& queue, HeldLines& held);

  fileindex_daemon::EventLoop& m_loop;
  FoldersOfQueue m_foldersOf;
  std::size_t m_maxHeld;
  std::map<std::string, HeldLines> m_held;
};

}  // namespace tavotifyd

#endif
