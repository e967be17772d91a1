#include "queue_file.h"

#include <fcntl.h>
#include <sys/file.h>
#include <sys/stat.h>
#include <unistd.h>

#include <cerrno>
#include <cstdlib>

#include "queue_events.h"

namespace fileindex_queue {

namespace {

const int kLockTries = 3;

void SleepBeforeRetry() { ::usleep(static_cast<useconds_t>(std::rand() % 10) * 1000); }

// Opens path and takes its exclusive lock with the writers' bounded tries. The lock is on
// the file the path names at the moment it is held: a descriptor whose file was renamed
// or removed meanwhile is dropped and the path opened again.
int OpenLocked(const std::string& path, int flags, bool& busy) {
  busy = false;
  for (int attempt = 0; attempt < kLockTries; ++attempt) {
    int fd = ::open(path.c_str(), flags | O_CLOEXEC | O_NOFOLLOW | O_NONBLOCK, 0600);
    if (fd < 0) return -1;
    struct stat held;
    if (::fstat(fd, &held) != 0 || !S_ISREG(held.st_mode)) {
      ::close(fd);
      errno = EINVAL;
      return -1;
    }
    if (::flock(fd, LOCK_EX | LOCK_NB) == 0) {
      struct stat named;
      bool named_ok = ::lstat(path.c_str(), &named) == 0;
      int named_errno = errno;
      if (::fstat(fd, &held) == 0 && named_ok && held.st_ino == named.st_ino && held.st_dev == named.st_dev &&
          held.st_nlink > 0) {
        return fd;
      }
      ::close(fd);
      if (!named_ok && !(flags & O_CREAT)) {
        errno = named_errno;
        return -1;
      }
      continue;  // renamed away under us: the path names a new file now
    }
    int saved = errno;
    ::close(fd);
    if (saved != EWOULDBLOCK && saved != EINTR) {
      errno = saved;
      return -1;
    }
    SleepBeforeRetry();
  }
  busy = true;
  errno = EWOULDBLOCK;
  return -1;
}

bool Exists(const std::string& path) {
  struct stat st;
  return ::lstat(path.c_str(), &st) == 0;
}

}  // namespace

AppendResult AppendQueueLines(const std::string& queuePath, const std::vector<std::string>& lines,
                              std::size_t& appended) {
  appended = 0;
  if (lines.empty()) return AppendResult::kWritten;
  bool busy = false;
  int fd = OpenLocked(queuePath, O_WRONLY | O_CREAT | O_APPEND, busy);
  if (fd < 0) return busy ? AppendResult::kBusy : AppendResult::kFailed;
  AppendResult result = AppendResult::kWritten;
  for (const std::string& line : lines) {
    struct stat before;
    if (::fstat(fd, &before) != 0) {
      result = AppendResult::kFailed;
      break;
    }
    ssize_t n = ::write(fd, line.data(), line.size());
    if (n == static_cast<ssize_t>(line.size())) {
      ++appended;
      continue;
    }
    int saved = n < 0 ? errno : ENOSPC;
    // A partial line would glue the next one onto it: cut the file back.
    if (n > 0 && ::ftruncate(fd, before.st_size) != 0) saved = errno;
    errno = saved;
    result = AppendResult::kFailed;
    break;
  }
  int saved = errno;
  ::flock(fd, LOCK_UN);
  ::close(fd);
  errno = saved;
  return result;
}

TakeResult TakeQueue(const std::string& queuePath) {
  const std::string tmp = TmpCompanion(queuePath);
  if (Exists(tmp)) return TakeResult::kTaken;
  bool busy = false;
  int fd = OpenLocked(queuePath, O_RDONLY, busy);
  if (fd < 0) {
    if (busy) return TakeResult::kBusy;
    return errno == ENOENT ? TakeResult::kEmpty : TakeResult::kFailed;
  }
  TakeResult result =
      ::rename(queuePath.c_str(), tmp.c_str()) == 0 ? TakeResult::kTaken : TakeResult::kFailed;
  int saved = errno;
  ::flock(fd, LOCK_UN);
  ::close(fd);
  errno = saved;
  return result;
}

FinishResult FinishQueue(const std::string& queuePath, std::size_t consumed) {
  const std::string tmp = TmpCompanion(queuePath);
  bool busy = false;
  int fd = OpenLocked(tmp, O_RDONLY, busy);
  if (fd < 0) {
    if (busy) return FinishResult::kBusy;
    return errno == ENOENT ? FinishResult::kRemoved : FinishResult::kFailed;
  }
  struct stat st;
  FinishResult result;
  if (::fstat(fd, &st) != 0) {
    result = FinishResult::kFailed;
  } else if (static_cast<std::size_t>(st.st_size) > consumed) {
    result = FinishResult::kMore;
  } else {
    result = ::unlink(tmp.c_str()) == 0 ? FinishResult::kRemoved : FinishResult::kFailed;
  }
  int saved = errno;
  ::flock(fd, LOCK_UN);
  ::close(fd);
  errno = saved;
  return result;
}

}  // namespace fileindex_queue
