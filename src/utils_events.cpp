// Custom events appended to a share's queue file for the indexing daemon.
#include <fcntl.h>
#include <fileindex/fileindex_c.h>
#include <fileindex/status_mgr.h>
#include <fileindex/utils.h>
#include <sys/file.h>
#include <tavo/platform.h>
#include <unistd.h>

#include <cerrno>
#include <cstdlib>
#include <cstring>

#include "internal/json_io.h"
#include "internal/log.h"
#include "internal/queue_scan.h"

namespace TAVO {
namespace FILEINDEX {

namespace {
const char kLogUnit[] = "utils";
const int kShareNameSize = 492;
const int kPathSize = 4096;
const unsigned kReindexEvent = 65536;
const int kQueueLockTries = 3;

std::string FromBuffer(const char* buffer, size_t size) { return std::string(buffer, strnlen(buffer, size)); }

// Whether the file holds a pending reindex of exactly this full path. Read without a
// lock: the daemon may be appending meanwhile, and a torn last line just does not parse.
bool QueueHasReindexEvent(const std::string& full, const std::string& queuePath) {
  if (!IsFileExist(queuePath)) return false;
  bool found = false;
  internal::QueueEvent event;
  bool opened = internal::ForEachQueueLine(queuePath, [&](const char* data, size_t size) {
    // Without a backslash the line's strings are their raw bytes, so a line that does not
    // contain the path cannot carry it; skipping it spares the JSON parse of most lines.
    if (std::memchr(data, '\\', size) == nullptr && memmem(data, size, full.data(), full.size()) == nullptr) {
      return true;
    }
    if (internal::ParseQueueLine(data, size, event) && event.event == kReindexEvent && event.path == full) {
      found = true;
      return false;
    }
    return true;
  });
  if (!opened) {
    FIDX_LOG("Failed to open queue=%s, reason=%m", queuePath.c_str());
    return false;
  }
  return found;
}

void Sleep0To9Ms() { ::usleep(static_cast<useconds_t>((std::rand() % 10) * 1000)); }

enum class AppendResult { kWritten, kBusy, kFailed };

// Appends the line under a non-blocking exclusive lock of the queue file itself, the
// lock the daemon and other writers take.
AppendResult AppendLocked(const std::string& queuePath, const std::string& line) {
  int lockErrno = 0;
  for (int attempt = 0; attempt < kQueueLockTries; ++attempt) {
    int fd = ::open(queuePath.c_str(), O_WRONLY | O_CREAT | O_APPEND | O_CLOEXEC | O_NOFOLLOW, 0644);
    if (fd < 0) return AppendResult::kFailed;
    if (::flock(fd, LOCK_EX | LOCK_NB) == 0) {
      ssize_t written = ::write(fd, line.data(), line.size());
      if (written < 0 || static_cast<size_t>(written) < line.size()) {
        FIDX_DEBUG("write fail, (%ld, %ld)", static_cast<long>(written), static_cast<long>(line.size()));
      }
      ::flock(fd, LOCK_UN);
      ::close(fd);
      return AppendResult::kWritten;
    }
    lockErrno = errno;
    if (lockErrno != EINTR && lockErrno != EAGAIN) {
      FIDX_DEBUG("flock fail, path=%s, reason=%m", queuePath.c_str());
      ::close(fd);
      return AppendResult::kFailed;
    }
    ::close(fd);
    Sleep0To9Ms();
  }
  errno = lockErrno;
  FIDX_DEBUG("try lock too many times, path=%s, reason=%m", queuePath.c_str());
  return AppendResult::kBusy;
}
}  // namespace

bool AddCustomEvent(const int& event, const std::string& full, const Json::Value& data) {
  char nameBuffer[kShareNameSize];
  char shareDir[kPathSize];
  char queueBuffer[kPathSize];
  std::memset(nameBuffer, 0, sizeof(nameBuffer));
  std::memset(shareDir, 0, sizeof(shareDir));
  std::memset(queueBuffer, 0, sizeof(queueBuffer));

  std::string share;
  AppendResult result = AppendResult::kFailed;
  if (TAVOShareNamePathGet(full.c_str(), nameBuffer, sizeof(nameBuffer), shareDir, sizeof(shareDir)) < 0) {
    FIDX_LOG("TAVOShareNamePathGet failed, path=%s", full.c_str());
  } else {
    share = FromBuffer(nameBuffer, sizeof(nameBuffer));
    if (FILEIDXQueuePathGet(share.c_str(), queueBuffer, sizeof(queueBuffer)) < 0) {
      FIDX_LOG("FILEIDXQueuePathGet failed, share=%s", share.c_str());
    } else {
      const std::string queuePath = FromBuffer(queueBuffer, sizeof(queueBuffer));
      // A pending reindex of the same path covers any event on it, a settings update as
      // well as a repeated reindex.
      if (QueueHasReindexEvent(full, queuePath) || QueueHasReindexEvent(full, queuePath + ".tmp"))
        return true;

      Json::Value record(Json::objectValue);
      record["event"] = event;
      record["path"] = full;
      record["data"] = data;
      result = AppendLocked(queuePath, internal::JsonToString(record) + "\n");
    }
  }
  // A busy queue drops the event without marking the share; only a queue that cannot
  // be written at all makes the whole share due for reindexing.
  if (result != AppendResult::kFailed) return true;
  if (!StatusMgr::ShareSetNeedReindex(share, true)) {
    FIDX_LOG("ShareSetNeedReindex failed, share=%s", share.c_str());
  }
  return false;
}

}  // namespace FILEINDEX
}  // namespace TAVO
