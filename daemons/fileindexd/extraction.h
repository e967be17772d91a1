// The extraction of file contents, driven from fileindexd's event loop: one worker process
// (fileindex-extract) at a time, one file at a time, its socket watched by the loop so the
// daemon never waits for it. A file that takes longer than the time limit gets the worker
// killed; a file during which the worker dies is recorded as failed with the reason, and
// the worker is started again. Results are written in batches, each one transaction.
#ifndef FILEINDEXD_EXTRACTION_H
#define FILEINDEXD_EXTRACTION_H

#include <content.h>
#include <daemon_support.h>
#include <sys/types.h>

#include <chrono>
#include <functional>
#include <map>
#include <string>
#include <vector>

#include "extract_protocol.h"
#include "share_indexer.h"

namespace fileindexd {

struct ExtractionLimits {
  std::chrono::milliseconds perFile{30000};
  unsigned long memoryMiB = 512;
};

class Extraction {
 public:
  // The shares whose files may be extracted now (none while paused), by name.
  using Shares = std::function<std::map<std::string, ShareIndexer*>()>;

  Extraction(fileindex_daemon::EventLoop& loop, Shares shares);
  ~Extraction();
  Extraction(const Extraction&) = delete;
  Extraction& operator=(const Extraction&) = delete;

  // Reads the limits (FILEINDEXD_EXTRACT_TIME_LIMIT in seconds, FILEINDEXD_EXTRACT_MEMORY_LIMIT
  // in MiB, for tests and small machines) and finds the worker program.
  void Start();
  // There may be new work: files written to an index, a share resumed or reconfigured.
  void Wake();
  // Writes what is waiting to be written (before an index is closed).
  void Flush();

  // Figures for logs and tests.
  std::uint64_t filesExtracted() const { return m_extracted; }
  std::uint64_t workersStarted() const { return m_workersStarted; }

 private:
  struct ShareCursor {
    std::int64_t afterId = 0;
    bool exhausted = false;
    bool fromStart = false;          // after the new files, the whole index once more (changed files)
    std::uint64_t writtenAtEnd = 0;  // the share's changes() when its pass ended
    std::vector<fileindex_store::ContentCandidate> batch;
    std::size_t next = 0;
  };
  struct Result {
    std::string share;
    fileindex_store::ContentCandidate candidate;
    fileindex_store::Content content;
    std::string text;
  };

  void Pump();
  bool NextCandidate(std::string& share, fileindex_store::ContentCandidate& candidate, std::string& path);
  // Whether the file's result waits in m_results to be written.
  bool Waiting(const std::string& share, const fileindex_store::ContentCandidate& candidate) const;
  bool Spawn();
  void OnReadable();
  // The worker is gone or must go: the file in hand is recorded as failed with reason.
  void WorkerLost(const std::string& reason);
  void Reap();
  void Record(Result result);

  fileindex_daemon::EventLoop& m_loop;
  Shares m_shares;
  ExtractionLimits m_limits;
  std::string m_program;
  bool m_started = false;

  pid_t m_pid = -1;
  int m_fd = -1;
  FrameReader m_reader;
  bool m_ready = false;  // the worker said it has started
  bool m_busy = false;
  std::string m_busyShare;
  fileindex_store::ContentCandidate m_busyCandidate;
  std::string m_busyPath;
  std::uint64_t m_limitTimer = 0;
  std::uint64_t m_retryTimer = 0;
  std::uint64_t m_flushTimer = 0;
  std::uint64_t m_pumpTimer = 0;
  std::vector<pid_t> m_dying;  // killed, not reaped yet
  std::uint64_t m_reapTimer = 0;
  int m_quickDeaths = 0;  // deaths in a row without a file in hand

  std::map<std::string, ShareCursor> m_cursors;
  std::string m_lastShare;  // round robin
  std::vector<Result> m_results;
  std::size_t m_resultBytes = 0;
  std::uint64_t m_extracted = 0;
  std::uint64_t m_workersStarted = 0;
};

}  // namespace fileindexd

#endif
