#include "extraction.h"

#include <fcntl.h>
#include <signal.h>
#include <spawn.h>
#include <sys/epoll.h>
#include <sys/socket.h>
#include <sys/wait.h>
#include <syslog.h>
#include <unistd.h>

#include <cerrno>
#include <climits>
#include <cstdlib>
#include <cstring>

extern char** environ;

namespace fileindexd {

using fileindex_daemon::Log;
using fileindex_store::Content;
using fileindex_store::ContentCandidate;
using fileindex_store::ExtractState;
using fileindex_store::Kind;
using std::chrono::milliseconds;

namespace {

const char kWorkerName[] = "fileindex-extract";
const std::size_t kBatch = 64;
// Windows of ids (a few thousand each) looked through per share before the loop gets a turn.
const int kWindowsPerLook = 8;
// Results wait at most this long, or until there are this many or this much text, and are
// then written in one transaction.
const milliseconds kFlushDelay(200);
const std::size_t kFlushCount = 64;
const std::size_t kFlushBytes = 4u << 20;
const milliseconds kRespawnDelay(1000);
const milliseconds kReapInterval(50);
const int kQuickDeathsBeforeDelay = 3;

std::string DescribeStatus(int status) {
  if (WIFSIGNALED(status)) {
    int signal = WTERMSIG(status);
    return std::string("killed by signal ") + std::to_string(signal) + " (" + strsignal(signal) + ")";
  }
  if (WIFEXITED(status)) return "exited with status " + std::to_string(WEXITSTATUS(status));
  return "stopped";
}

}  // namespace

Extraction::Extraction(fileindex_daemon::EventLoop& loop, Shares shares)
    : m_loop(loop), m_shares(std::move(shares)) {}

Extraction::~Extraction() {
  Flush();
  for (std::uint64_t timer : {m_limitTimer, m_retryTimer, m_flushTimer, m_reapTimer, m_pumpTimer})
    if (timer != 0) m_loop.Cancel(timer);
  if (m_fd >= 0) {
    m_loop.Unwatch(m_fd);
    ::close(m_fd);  // the worker reads its end of file and leaves
  }
  if (m_pid > 0) m_dying.push_back(m_pid);
  for (pid_t pid : m_dying) {
    ::kill(pid, SIGKILL);
    ::waitpid(pid, nullptr, 0);
  }
}

void Extraction::Start() {
  if (const char* seconds = ::secure_getenv("FILEINDEXD_EXTRACT_TIME_LIMIT")) {
    double value = std::atof(seconds);
    if (value > 0) m_limits.perFile = milliseconds(static_cast<long long>(value * 1000));
  }
  if (const char* mib = ::secure_getenv("FILEINDEXD_EXTRACT_MEMORY_LIMIT")) {
    unsigned long value = std::strtoul(mib, nullptr, 10);
    if (value > 0) m_limits.memoryMiB = value;
  }
  // Beside the daemon's own program (a build tree or a package), else where it is installed.
  char self[PATH_MAX];
  ssize_t n = ::readlink("/proc/self/exe", self, sizeof(self) - 1);
  if (n > 0) {
    std::string dir(self, static_cast<std::size_t>(n));
    dir.resize(dir.rfind('/'));
    if (::access((dir + "/" + kWorkerName).c_str(), X_OK) == 0) m_program = dir + "/" + kWorkerName;
  }
#ifdef FILEINDEXD_EXTRACT_WORKER
  if (m_program.empty()) m_program = FILEINDEXD_EXTRACT_WORKER;
#endif
  m_started = true;
  Log(LOG_INFO, "content extraction by %s, %lld ms and %lu MiB per file",
      m_program.empty() ? "(no worker found)" : m_program.c_str(),
      static_cast<long long>(m_limits.perFile.count()), m_limits.memoryMiB);
}

void Extraction::Wake() {
  // A share whose pass ended may have new files now; it is looked at again from the start.
  for (auto& entry : m_shares()) {
    ShareCursor& cursor = m_cursors[entry.first];
    if (cursor.exhausted && entry.second->changes() != cursor.writtenAtEnd) {
      // New files have ids above the cursor; a changed file keeps its id and is found by
      // the pass from the start that follows.
      cursor.exhausted = false;
      cursor.fromStart = true;
    }
  }
  Pump();
}

bool Extraction::Spawn() {
  if (m_program.empty()) return false;
  int pair[2];
  if (::socketpair(AF_UNIX, SOCK_STREAM | SOCK_CLOEXEC, 0, pair) != 0) {
    Log(LOG_ERR, "extraction worker: socketpair: %s", std::strerror(errno));
    return false;
  }
  posix_spawn_file_actions_t actions;
  posix_spawn_file_actions_init(&actions);
  posix_spawn_file_actions_adddup2(&actions, pair[1], 0);
  posix_spawnattr_t attributes;
  posix_spawnattr_init(&attributes);
  // The daemon's signals are blocked for its signalfd; the worker gets the defaults.
  sigset_t none, defaults;
  sigemptyset(&none);
  sigemptyset(&defaults);
  for (int signal : {SIGTERM, SIGINT, SIGHUP, SIGPIPE, SIGCHLD}) sigaddset(&defaults, signal);
  posix_spawnattr_setsigmask(&attributes, &none);
  posix_spawnattr_setsigdefault(&attributes, &defaults);
  posix_spawnattr_setflags(&attributes, POSIX_SPAWN_SETSIGMASK | POSIX_SPAWN_SETSIGDEF);
  const std::string memory = std::to_string(m_limits.memoryMiB);
  char* argv[] = {const_cast<char*>(kWorkerName), const_cast<char*>("--memory-limit"),
                  const_cast<char*>(memory.c_str()), nullptr};
  pid_t pid = -1;
  int rc = ::posix_spawn(&pid, m_program.c_str(), &actions, &attributes, argv, environ);
  posix_spawn_file_actions_destroy(&actions);
  posix_spawnattr_destroy(&attributes);
  ::close(pair[1]);
  if (rc != 0) {
    Log(LOG_ERR, "extraction worker %s: %s", m_program.c_str(), std::strerror(rc));
    ::close(pair[0]);
    return false;
  }
  ::fcntl(pair[0], F_SETFL, ::fcntl(pair[0], F_GETFL) | O_NONBLOCK);
  m_pid = pid;
  m_fd = pair[0];
  m_ready = false;
  m_reader.Clear();
  m_loop.Watch(m_fd, EPOLLIN | EPOLLRDHUP, [this](std::uint32_t) { OnReadable(); });
  ++m_workersStarted;
  Log(LOG_INFO, "extraction worker %ld started", static_cast<long>(pid));
  return true;
}

bool Extraction::NextCandidate(std::string& shareName, ContentCandidate& candidate, std::string& path) {
  std::map<std::string, ShareIndexer*> shares = m_shares();
  if (shares.empty()) return false;
  auto it = shares.upper_bound(m_lastShare);
  for (std::size_t tried = 0; tried < shares.size(); ++tried, ++it) {
    if (it == shares.end()) it = shares.begin();
    ShareIndexer& indexer = *it->second;
    ShareCursor& cursor = m_cursors[it->first];
    int windows = 0;
    while (!cursor.exhausted) {
      if (cursor.next == cursor.batch.size()) {
        if (++windows > kWindowsPerLook) {
          // A long stretch of files already done: go on from here after the loop's next turn.
          if (m_pumpTimer == 0) {
            m_pumpTimer = m_loop.After(milliseconds(0), [this]() {
              m_pumpTimer = 0;
              Pump();
            });
          }
          break;
        }
        cursor.batch.clear();
        cursor.next = 0;
        bool atEnd = false;
        if (!indexer.Store().PendingContent(cursor.afterId, kBatch, cursor.batch, cursor.afterId, atEnd)) {
          Log(LOG_ERR, "share %s: %s", it->first.c_str(), indexer.Store().LastError().c_str());
          break;
        }
        if (cursor.batch.empty() && !atEnd) continue;
        if (cursor.batch.empty() && cursor.fromStart) {
          cursor.fromStart = false;
          cursor.afterId = 0;
          continue;
        }
        if (cursor.batch.empty()) {
          cursor.exhausted = true;
          cursor.writtenAtEnd = indexer.changes();
          break;
        }
      }
      ContentCandidate& next = cursor.batch[cursor.next++];
      if (!indexer.AllowsKind(next.entry.folder, next.entry.kind)) continue;  // switched off meanwhile
      if (Waiting(it->first, next)) continue;  // done, its result not written yet
      shareName = it->first;
      candidate = std::move(next);
      path = indexer.PathOnDisk(fileindex_store::JoinPath(candidate.entry.parent, candidate.entry.name));
      m_lastShare = shareName;
      return true;
    }
  }
  return false;
}

bool Extraction::Waiting(const std::string& share, const ContentCandidate& candidate) const {
  for (const Result& result : m_results) {
    if (result.candidate.id == candidate.id && result.candidate.entry.mtime == candidate.entry.mtime &&
        result.candidate.entry.size == candidate.entry.size && result.share == share)
      return true;
  }
  return false;
}

void Extraction::Pump() {
  std::size_t inline_ = 0;
  while (m_started && !m_busy) {
    if (m_pid < 0) {
      if (m_retryTimer != 0) return;  // waiting to start a worker again
      if (!Spawn()) {
        m_retryTimer = m_loop.After(kRespawnDelay * 5, [this]() {
          m_retryTimer = 0;
          Pump();
        });
        return;
      }
    }
    if (!m_ready) return;  // its first words come through OnReadable
    std::string share, path;
    ContentCandidate candidate;
    if (!NextCandidate(share, candidate, path)) return;
    if (candidate.entry.size == 0) {
      // Nothing inside to read: no need to trouble the worker.
      Result result{share, std::move(candidate), Content(), ""};
      result.content.mime = "inode/x-empty";
      result.content.kind = result.candidate.entry.kind;
      if (result.content.kind == Kind::kOther) result.content.state = ExtractState::kSkipped;  // of no kind
      Record(std::move(result));
      // A few at a time: the loop has sockets and slices to serve.
      if (++inline_ >= kBatch) {
        if (m_pumpTimer == 0) {
          m_pumpTimer = m_loop.After(milliseconds(0), [this]() {
            m_pumpTimer = 0;
            Pump();
          });
        }
        return;
      }
      continue;
    }
    const std::string request = EncodeRequest(path, candidate.entry.kind);
    ssize_t n = ::send(m_fd, request.data(), request.size(), MSG_NOSIGNAL | MSG_DONTWAIT);
    m_busy = true;
    m_busyShare = share;
    m_busyCandidate = std::move(candidate);
    m_busyPath = path;
    if (n != static_cast<ssize_t>(request.size())) {
      // The worker is gone already (or wedged with a full socket): start another.
      WorkerLost("the extraction worker did not take the request");
      continue;
    }
    m_limitTimer = m_loop.After(m_limits.perFile, [this]() {
      m_limitTimer = 0;
      WorkerLost("took longer than the limit of " + std::to_string(m_limits.perFile.count()) + " ms");
      Pump();
    });
  }
}

void Extraction::OnReadable() {
  char buffer[65536];
  bool closed = false;
  for (;;) {
    ssize_t n = ::read(m_fd, buffer, sizeof(buffer));
    if (n > 0) {
      m_reader.Append(buffer, static_cast<std::size_t>(n));
      continue;
    }
    if (n < 0 && errno == EINTR) continue;
    closed = n == 0 || (errno != EAGAIN && errno != EWOULDBLOCK);
    break;
  }
  std::string json, text;
  FrameReader::Status status;
  while ((status = m_reader.Next(json, text)) == FrameReader::Status::kFrame) {
    if (!m_ready && !m_busy) {
      m_ready = true;  // its greeting
      continue;
    }
    Content content;
    if (!m_busy || !DecodeResult(json, content)) {
      WorkerLost("the extraction worker sent a malformed answer");
      Pump();
      return;
    }
    if (m_limitTimer != 0) m_loop.Cancel(m_limitTimer);
    m_limitTimer = 0;
    m_busy = false;
    m_quickDeaths = 0;
    Record({m_busyShare, std::move(m_busyCandidate), std::move(content), std::move(text)});
  }
  if (status == FrameReader::Status::kInvalid) {
    WorkerLost("the extraction worker sent an oversized answer");
  } else if (closed) {
    WorkerLost("");
  }
  Pump();
}

void Extraction::WorkerLost(const std::string& why) {
  if (m_limitTimer != 0) m_loop.Cancel(m_limitTimer);
  m_limitTimer = 0;
  if (m_fd >= 0) {
    m_loop.Unwatch(m_fd);
    ::close(m_fd);
    m_fd = -1;
  }
  std::string reason = why;
  if (m_pid > 0) {
    int status = 0;
    pid_t done = 0;
    if (reason.empty()) {
      // Its socket closed: it is on its way out (it dumps no core). A moment's wait tells
      // how it ended, which is the file's reason.
      for (int i = 0; i < 20 && (done = ::waitpid(m_pid, &status, WNOHANG)) == 0; ++i) ::usleep(5000);
    }
    if (done != m_pid) {
      ::kill(m_pid, SIGKILL);
      // Usually gone by now; otherwise it is reaped a moment later.
      done = ::waitpid(m_pid, &status, WNOHANG);
    }
    if (reason.empty()) {
      reason = done == m_pid ? "the extraction worker " + DescribeStatus(status)
                             : std::string("the extraction worker closed its socket");
    }
    if (done != m_pid) m_dying.push_back(m_pid);
    Log(m_busy ? LOG_WARNING : LOG_ERR, "extraction worker %ld stopped: %s%s%s", static_cast<long>(m_pid),
        reason.c_str(), m_busy ? " on " : "", m_busy ? m_busyPath.c_str() : "");
    m_pid = -1;
  }
  Reap();
  if (m_busy) {
    m_busy = false;
    Result result{m_busyShare, std::move(m_busyCandidate), Content(), ""};
    result.content.state = ExtractState::kFailed;
    result.content.kind = result.candidate.entry.kind;
    result.content.reason = reason;
    Record(std::move(result));
    m_quickDeaths = 0;
  } else if (++m_quickDeaths >= kQuickDeathsBeforeDelay && m_retryTimer == 0) {
    // A worker that dies without a file in hand is broken: try again after a while.
    m_retryTimer = m_loop.After(kRespawnDelay, [this]() {
      m_retryTimer = 0;
      Wake();
    });
  }
}

void Extraction::Reap() {
  for (auto it = m_dying.begin(); it != m_dying.end();) {
    if (::waitpid(*it, nullptr, WNOHANG) != 0) {
      it = m_dying.erase(it);
    } else {
      ++it;
    }
  }
  if (!m_dying.empty() && m_reapTimer == 0) {
    m_reapTimer = m_loop.After(kReapInterval, [this]() {
      m_reapTimer = 0;
      Reap();
    });
  }
}

void Extraction::Record(Result result) {
  ++m_extracted;
  if (result.content.state == ExtractState::kFailed) {
    Log(LOG_INFO, "share %s: cannot extract /%s: %s", result.share.c_str(),
        fileindex_store::JoinPath(result.candidate.entry.parent, result.candidate.entry.name).c_str(),
        result.content.reason.c_str());
  }
  m_resultBytes += result.text.size();
  m_results.push_back(std::move(result));
  if (m_results.size() >= kFlushCount || m_resultBytes >= kFlushBytes) {
    Flush();
  } else if (m_flushTimer == 0) {
    m_flushTimer = m_loop.After(kFlushDelay, [this]() {
      m_flushTimer = 0;
      Flush();
    });
  }
}

void Extraction::Flush() {
  if (m_flushTimer != 0) m_loop.Cancel(m_flushTimer);
  m_flushTimer = 0;
  if (m_results.empty()) return;
  std::vector<Result> results;
  results.swap(m_results);
  m_resultBytes = 0;
  std::map<std::string, ShareIndexer*> shares = m_shares();
  std::map<std::string, std::vector<Result*>> byShare;
  for (Result& result : results) byShare[result.share].push_back(&result);
  for (auto& entry : byShare) {
    auto it = shares.find(entry.first);
    if (it == shares.end()) {
      m_cursors.erase(entry.first);  // stopped or paused: its files come back in a new pass
      continue;
    }
    ShareIndexer& indexer = *it->second;
    fileindex_store::IndexWriter& store = indexer.Store();
    bool ok = store.Begin();
    for (Result* result : entry.second) {
      if (!ok) break;
      Content& content = result->content;
      Kind& kind = result->candidate.entry.kind;  // the name's hint until here
      // The content decides the kind; a folder that does not index that kind keeps the
      // file by its name only, as the kind its name suggests.
      if (content.kind != Kind::kOther && content.kind != kind &&
          !indexer.AllowsKind(result->candidate.entry.folder, content.kind)) {
        Content skipped;
        skipped.state = ExtractState::kSkipped;
        skipped.mime = content.mime;
        skipped.kind = content.kind;
        skipped.reason = std::string("its content is ") + fileindex_store::KindName(content.kind) + " (" +
                         content.mime + "), which this folder does not index";
        content = skipped;
        result->text.clear();
      } else if (content.kind != Kind::kOther) {
        kind = content.kind;
      }
      bool stored = false;
      ok = store.PutContent(result->candidate, content, result->text, stored);
    }
    if (ok) ok = store.Commit();
    if (!ok) {
      Log(LOG_ERR, "share %s: cannot write extracted content: %s", entry.first.c_str(),
          store.LastError().c_str());
      store.Rollback();
      m_cursors.erase(entry.first);
    }
  }
}

}  // namespace fileindexd
