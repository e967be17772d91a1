// Custom events appended to a share's queue file for the indexing daemon.
#include <fcntl.h>
#include <fileindex/fileindex_c.h>
#include <fileindex/status_mgr.h>
#include <fileindex/utils.h>
#include <sys/file.h>
#include <sys/stat.h>
#include <tavo/platform.h>
#include <unistd.h>

#include <cerrno>
#include <cstdlib>
#include <cstring>

#include "internal/json_io.h"
#include "internal/log.h"
#include "internal/queue_line_view.h"
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
  internal::QueueLineReader reader;
  if (!reader.Open(queuePath)) {
    FIDX_LOG("Failed to open queue=%s, reason=%m", queuePath.c_str());
    return false;
  }
  // Without a backslash a line's strings are their raw bytes, so only a line that holds
  // a backslash or the path in quotes can carry the event. Both are searched for in
  // whole runs of lines, and only the lines they fall in are read.
  const std::string quoted = "\"" + full + "\"";
  internal::QueueEventView view;
  internal::QueueEvent event;
  auto isReindexOfFull = [&](const char* line, size_t lineSize) {
    if (internal::ViewQueueLine(line, lineSize, view)) {
      return view.event == kReindexEvent && view.pathSize == full.size() &&
             std::memcmp(view.path, full.data(), full.size()) == 0;
    }
    return internal::ParseQueueLine(line, lineSize, event) && event.event == kReindexEvent &&
           event.path == full;
  };
  const char* data;
  size_t size;
  while (reader.NextLines(data, size)) {
    const char* p = data;
    const char* const end = data + size;
    const char* backslash = nullptr;
    const char* named = nullptr;
    while (p < end) {
      if (backslash == nullptr || backslash < p) {
        backslash = static_cast<const char*>(std::memchr(p, '\\', static_cast<size_t>(end - p)));
        if (backslash == nullptr) backslash = end;
      }
      if (named == nullptr || named < p) {
        named =
            static_cast<const char*>(memmem(p, static_cast<size_t>(end - p), quoted.data(), quoted.size()));
        if (named == nullptr) named = end;
      }
      const char* hit = backslash < named ? backslash : named;
      if (hit == end) break;
      const char* lineStart = static_cast<const char*>(memrchr(p, '\n', static_cast<size_t>(hit - p)));
      lineStart = lineStart == nullptr ? p : lineStart + 1;
      const char* lineEnd = static_cast<const char*>(std::memchr(hit, '\n', static_cast<size_t>(end - hit)));
      if (lineEnd == nullptr) lineEnd = end;
      if (isReindexOfFull(lineStart, static_cast<size_t>(lineEnd - lineStart))) return true;
      p = lineEnd < end ? lineEnd + 1 : end;
    }
  }
  return false;
}

void Sleep0To9Ms() { ::usleep(static_cast<useconds_t>((std::rand() % 10) * 1000)); }

// Opens the queue for appending, creating it when absent. The queue and its directory
// "@eaDir" lie inside the share, where share users can plant links, so neither is
// followed: the directory is opened with O_NOFOLLOW and the file opened relative to it,
// also with O_NOFOLLOW. O_NONBLOCK keeps a planted FIFO from hanging the caller (which
// may hold folder.conf's lock), and anything but a regular file is refused. A real
// "@eaDir" holding a regular queue (or none yet) opens exactly as a plain open() would.
int OpenQueueForAppend(const std::string& queuePath) {
  const std::string::size_type slash = queuePath.rfind('/');
  if (slash == std::string::npos) {
    errno = EINVAL;
    return -1;
  }
  const std::string dir = slash == 0 ? std::string("/") : queuePath.substr(0, slash);
  int dirFd = ::open(dir.c_str(), O_RDONLY | O_DIRECTORY | O_NOFOLLOW | O_CLOEXEC);
  if (dirFd < 0) return -1;
  int fd = ::openat(dirFd, queuePath.c_str() + slash + 1,
                    O_WRONLY | O_CREAT | O_APPEND | O_CLOEXEC | O_NOFOLLOW | O_NONBLOCK, 0644);
  int openErrno = errno;
  ::close(dirFd);
  if (fd >= 0) {
    struct stat st;
    if (::fstat(fd, &st) != 0 || !S_ISREG(st.st_mode)) {
      ::close(fd);
      fd = -1;
      openErrno = EINVAL;
    }
  }
  errno = openErrno;
  return fd;
}

enum class AppendResult { kWritten, kBusy, kFailed };

// Appends the line under a non-blocking exclusive lock of the queue file itself, the
// lock the daemon and other writers take.
AppendResult AppendLocked(const std::string& queuePath, const std::string& line) {
  int lockErrno = 0;
  for (int attempt = 0; attempt < kQueueLockTries; ++attempt) {
    int fd = OpenQueueForAppend(queuePath);
    if (fd < 0) return AppendResult::kFailed;
    if (::flock(fd, LOCK_EX | LOCK_NB) == 0) {
      // The length before the write, known under the lock, is where a short write is cut
      // back to: a fragment left at the end would glue the next event onto it and both
      // would be lost to every reader.
      struct stat before;
      const bool sized = ::fstat(fd, &before) == 0;
      ssize_t written = ::write(fd, line.data(), line.size());
      if (written < 0 || static_cast<size_t>(written) < line.size()) {
        if (written > 0 && sized) static_cast<void>(::ftruncate(fd, before.st_size));
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
