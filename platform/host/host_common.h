// Shared helpers of the host platform.
#ifndef TAVO_HOST_COMMON_H
#define TAVO_HOST_COMMON_H

#include <string>

namespace tavo_host {

// FILEINDEX_SYSROOT (via secure_getenv) prefixed to an absolute path, or the path.
std::string Rooted(const std::string& path);

// Platform error codes used by the host platform.
enum ErrorCode {
  kErrNone = 0,
  kErrBadArgument = 0xD00,
  kErrNoSuchShare = 0x1400,
  kErrShareTable = 0x1401,
  kErrBufferTooSmall = 0x1402,
  kErrShareNameMismatch = 0x1403,
  kErrNoSpace = 0x2900,
  kErrQuota = 0x2400,
  kErrSystem = 0x0100,
  kErrService = 0x3000,
  kErrSamba = 0x3100,
  kErrExec = 0x3200,
};

}  // namespace tavo_host

#define TAVO_HOST_SET_ERROR(code) VLIBCErrSetEx((code), __FILE__, __LINE__)

#endif
