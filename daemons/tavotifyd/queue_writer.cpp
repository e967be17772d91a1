#include "queue_writer.h"

#include <syslog.h>
#include <unistd.h>

#include <cerrno>
#include <cstring>
#include <utility>

#include "queue_events.h"
#include "queue_file.h"

namespace tavotifyd {

using fileindex_daemon::Log;

namespace {
// A writer holding the queue's lock appends a few lines and lets go: retry soon.
const std::chrono::milliseconds kBusyRetry(50);
// A queue that cannot be written (no such directory, disk full) will not heal in
// milliseconds; retrying each second keeps the log and the disk quiet.
const std::chrono::milliseconds kFailedRetry(1000);
}  // namespace

QueueWriter::QueueWriter(fileindex_daemon::EventLoop& loop, FoldersOfQueue foldersOf,
                         std::size_t maxHeldPerQueue)
    : m_loop(loop), m_foldersOf(std::move(foldersOf)), m_maxHeld(maxHeldPerQueue) {}

void QueueWriter::Add(const std::string& queue, std::string line) {
  HeldLines& held = m_held[queue];
  // The reindex lines that replaced this queue's lines cover every later change too,
  // until they are written.
  if (held.collapsed) return;
  if (held.lines.size() >= m_maxHeld) {
    Collapse(queue, held);
    return;
  }
  held.lines.push_back(std::move(line));
}

void QueueWriter::AddReindex(const std::string& queue, const std::string& folder) {
  HeldLines& held = m_held[queue];
  if (!held.reindexFolders.insert(folder).second) return;
  held.lines.push_back(fileindex_queue::FormatQueueLine(fileindex_queue::kReindex, folder));
}

void QueueWriter::Collapse(const std::string& queue, HeldLines& held) {
  std::vector<std::string> folders = m_foldersOf(queue);
  Log(LOG_WARNING,
      "queue %s: %zu lines held (the queue could not be written); replacing them by %zu reindex lines",
      queue.c_str(), held.lines.size(), folders.size());
  held.lines.clear();
  held.reindexFolders.clear();
  held.collapsed = true;
  for (const std::string& folder : folders) AddReindex(queue, folder);
}

void QueueWriter::ScheduleRetry(const std::string& queue, HeldLines& held, std::chrono::milliseconds delay) {
  if (held.retryTimer != 0) return;
  held.retryTimer = m_loop.After(delay, [this, queue] {
    auto it = m_held.find(queue);
    if (it == m_held.end()) return;
    it->second.retryTimer = 0;
    Outcome outcome = Write(queue, it->second);
    if (outcome != Outcome::kDone)
      ScheduleRetry(queue, it->second, outcome == Outcome::kRetrySoon ? kBusyRetry : kFailedRetry);
  });
}

QueueWriter::Outcome QueueWriter::Write(const std::string& queue, HeldLines& held) {
  if (held.lines.empty()) return Outcome::kDone;
  std::size_t appended = 0;
  fileindex_queue::AppendResult result = fileindex_queue::AppendQueueLines(queue, held.lines, appended);
  int error = errno;
  held.lines.erase(held.lines.begin(), held.lines.begin() + static_cast<std::ptrdiff_t>(appended));
  switch (result) {
    case fileindex_queue::AppendResult::kWritten:
      if (held.failing) Log(LOG_INFO, "queue %s is written again", queue.c_str());
      held.lines.clear();
      held.reindexFolders.clear();
      held.collapsed = false;
      held.failing = false;
      return Outcome::kDone;
    case fileindex_queue::AppendResult::kBusy:
      return Outcome::kRetrySoon;
    case fileindex_queue::AppendResult::kFailed:
      break;
  }
  if (m_foldersOf(queue).empty()) {
    // No list names this queue any more (its share went away): nobody will read it.
    Log(LOG_WARNING, "queue %s: %s; dropping %zu lines, no watch list uses it any more", queue.c_str(),
        std::strerror(error), held.lines.size());
    held = HeldLines();
    return Outcome::kDone;
  }
  if (!held.failing)
    Log(LOG_ERR, "queue %s: %s; keeping %zu lines and retrying", queue.c_str(), std::strerror(error),
        held.lines.size());
  held.failing = true;
  return Outcome::kRetryLater;
}

void QueueWriter::Flush() {
  for (auto& [queue, held] : m_held) {
    if (held.retryTimer != 0 || held.lines.empty()) continue;
    Outcome outcome = Write(queue, held);
    if (outcome != Outcome::kDone)
      ScheduleRetry(queue, held, outcome == Outcome::kRetrySoon ? kBusyRetry : kFailedRetry);
  }
}

std::size_t QueueWriter::FlushBeforeExit(std::chrono::milliseconds budget) {
  auto deadline = fileindex_daemon::Clock::now() + budget;
  for (;;) {
    std::size_t left = 0;
    for (auto& [queue, held] : m_held) {
      if (held.retryTimer != 0) {
        m_loop.Cancel(held.retryTimer);
        held.retryTimer = 0;
      }
      Write(queue, held);
      left += held.lines.size();
    }
    if (left == 0 || fileindex_daemon::Clock::now() >= deadline) return left;
    ::usleep(static_cast<useconds_t>(kBusyRetry.count()) * 1000);
  }
}

std::size_t QueueWriter::HeldCount() const {
  std::size_t total = 0;
  for (const auto& entry : m_held) total += entry.second.lines.size();
  return total;
}

}  // namespace tavotifyd
