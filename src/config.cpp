#include <fcntl.h>
#include <fileindex/config.h>
#include <fileindex/error.h>
#include <fileindex/utils.h>
#include <sys/file.h>
#include <sys/stat.h>
#include <unistd.h>

#include <cerrno>
#include <cstdlib>

#include "internal/json_io.h"
#include "internal/log.h"

namespace TAVO {
namespace FILEINDEX {

namespace {
const char kLogUnit[] = "config";
const int kLockTries = 3;
}  // namespace

Config::Config() : m_jsDocument(Json::objectValue), m_fdLock(-1) {}

Config::~Config() {}

bool Config::Lock(bool exclusive) {
  const std::string lockPath = GetLockPath();
  for (int attempt = 0; attempt < kLockTries; ++attempt) {
    // Each try opens the lock file afresh and overwrites the descriptor of the previous
    // try without closing it: an established leak of at most two descriptors per call.
    // O_NOFOLLOW: a link planted at the lock path in /tmp is never followed.
    m_fdLock = ::open(lockPath.c_str(), O_RDWR | O_CREAT | O_CLOEXEC | O_NOFOLLOW, 0644);
    if (m_fdLock < 0) break;
    if (::flock(m_fdLock, (exclusive ? LOCK_EX : LOCK_SH) | LOCK_NB) == 0) return true;
    if (errno != EINTR && errno != EWOULDBLOCK) break;
    ::usleep(static_cast<useconds_t>((std::rand() % 10) * 1000));
  }
  FIDX_LOG("Failed to lock folder");
  ErrorHandler::SetError(FILEINDEX_ERR_LOCK);
  return false;
}

void Config::Unlock() {
  if (m_fdLock < 0) return;
  ::flock(m_fdLock, LOCK_UN);
  ::close(m_fdLock);
}

bool Config::LoadJson() {
  const std::string path = GetPath();
  if (!IsFileExist(path)) return true;
  if (!internal::JsonFromFile(m_jsDocument, path)) {
    FIDX_LOG("Failed to load json from %s", path.c_str());
    ErrorHandler::SetError(FILEINDEX_ERR_LOAD_CONFIG);
    return false;
  }
  return true;
}

bool Config::SaveJson() {
  const std::string path = GetPath();
  if (!internal::JsonToFile(m_jsDocument, path)) {
    FIDX_LOG("Failed to save json to %s", path.c_str());
    ErrorHandler::SetError(FILEINDEX_ERR_SAVE_CONFIG);
    return false;
  }
  if (::chmod(path.c_str(), 0644) == -1) {
    FIDX_LOG("chmod failed, path=%s", path.c_str());
  }
  return true;
}

}  // namespace FILEINDEX
}  // namespace TAVO
