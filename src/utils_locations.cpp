// Where each share keeps its event queue and its index database: inside the share's
// "@eaDir" directory. These C entry points report through the platform's error channel
// only, and their log lines do not consult LOG_LEVEL.
#include <fcntl.h>
#include <fileindex/fileindex_c.h>
#include <sys/stat.h>
#include <tavo/platform.h>
#include <unistd.h>

#include <cerrno>
#include <cstdio>
#include <cstring>
#include <string>

#include "internal/log.h"
#include "internal/share_record.h"

namespace {
const char kLogUnit[] = "utils";
const int kFullPathSize = 4096;
const int kBadArgumentError = 0xD00;
const char kEaDirName[] = "@eaDir";
const char kQueueFileName[] = "TAVO@file_index_queue";
const char kDbDirName[] = "TAVO@.fileindexdb";

// Logs the failed condition and records it on the platform error channel, both with the
// line of the check.
#define FIDX_BAD_ARGUMENT(text)                            \
  do {                                                     \
    FIDX_LOG_RAW("Invaild Argument (%s)=[%d]\n", text, 0); \
    VLIBCErrSetEx(kBadArgumentError, kLogUnit, __LINE__);  \
  } while (0)

// mkdir(path, mode), except that the directory holding it is not reached through a
// symbolic link in its last component. The database directory goes into the share's
// "@eaDir", which a share user could replace by a link to a directory elsewhere; the
// library runs as root and must not create anything there. For a real "@eaDir" the
// result and errno are those of mkdir; through a link it fails (ENOTDIR).
int MakeDirBesideNoLink(const char* path, mode_t mode) {
  const char* slash = std::strrchr(path, '/');
  if (slash == nullptr || slash == path || slash[1] == '\0') return ::mkdir(path, mode);
  const std::string parent(path, static_cast<size_t>(slash - path));
  int dirFd = ::open(parent.c_str(), O_RDONLY | O_DIRECTORY | O_NOFOLLOW | O_CLOEXEC);
  if (dirFd < 0) return -1;
  int rc = ::mkdirat(dirFd, slash + 1, mode);
  int savedErrno = errno;
  ::close(dirFd);
  errno = savedErrno;
  return rc;
}

// The "@eaDir" of the share is made (best effort) and the path written into the caller's
// buffer, cut as snprintf cuts it. The share record is freed on every way out.
int SharePathGet(const char* name, char* out, int outLen, const char* lastComponent) {
  TAVO::FILEINDEX::internal::ShareRecord record;
  if (TAVO::FILEINDEX::internal::GetShareRecord(name, record) < 0) {
    FIDX_LOG_RAW("TAVOShareGet failed, name=%s, code=%d", name, VLIBCErrGet());
    return -1;
  }
  const char* shareDir = record->szPath != nullptr ? record->szPath : "";
  char eaDir[kFullPathSize];
  std::memset(eaDir, 0, sizeof(eaDir));
  std::snprintf(eaDir, sizeof(eaDir), "%s/%s", shareDir, kEaDirName);
  if (TAVOEAMKDir(0, eaDir) < 0) {
    FIDX_LOG_RAW("TAVOEAMKDir failed, path=%s, code=%d", eaDir, VLIBCErrGet());
  }
  std::snprintf(out, static_cast<size_t>(outLen), "%s/%s/%s", shareDir, kEaDirName, lastComponent);
  return static_cast<int>(std::strlen(out));
}
}  // namespace

int FILEIDXQueuePathGet(const char* szName, char* szOutQueuePath, int cbOutLen) {
  if (szName == nullptr) {
    FIDX_BAD_ARGUMENT("__null != szName");
    return -1;
  }
  if (szOutQueuePath == nullptr) {
    FIDX_BAD_ARGUMENT("__null != szOutQueuePath");
    return -1;
  }
  if (!(cbOutLen > 0)) {
    FIDX_BAD_ARGUMENT("cbOutLen > 0");
    return -1;
  }
  return SharePathGet(szName, szOutQueuePath, cbOutLen, kQueueFileName);
}

int FILEIDXDBPathGet(const char* szName, char* szOutDBPath, int cbOutLen) {
  if (szName == nullptr) {
    FIDX_BAD_ARGUMENT("__null != szName");
    return -1;
  }
  if (szOutDBPath == nullptr) {
    FIDX_BAD_ARGUMENT("__null != szOutDBPath");
    return -1;
  }
  if (!(cbOutLen > 0)) {
    FIDX_BAD_ARGUMENT("cbOutLen > 0");
    return -1;
  }
  int length = SharePathGet(szName, szOutDBPath, cbOutLen, kDbDirName);
  if (length < 0) return length;
  // Another process making the same directory at the same time is harmless.
  if (MakeDirBesideNoLink(szOutDBPath, 0777) != 0 && errno != EEXIST) {
    FIDX_LOG_RAW("mkdir failed, path=%s, reason=%m", szOutDBPath);
  }
  return length;
}
