// Shared helpers of the host platform.
#ifndef TAVO_HOST_COMMON_H
#define TAVO_HOST_COMMON_H

#include <sys/types.h>
#include <tavo/platform.h>

#include <string>
#include <vector>

namespace tavo_host __attribute__((visibility("hidden"))) {

  // FILEINDEX_SYSROOT (via secure_getenv) prefixed to an absolute path, or the path. The
  // root is used exactly as given, as the library does, so both build identical paths.
  std::string Rooted(const std::string& path);
  // The system root, empty when unset.
  std::string SystemRoot();
  // path without the system root in front (for names derived from rooted paths).
  std::string Unrooted(const std::string& path);

  // Platform error codes of the host platform (texts in TAVOHostErrorText).
  enum ErrorCode {
    kErrNone = 0,
    kErrSystem = 0x0100,
    kErrBadArgument = 0xD00,
    kErrNoSuchShare = 0x1400,
    kErrShareTable = 0x1401,
    kErrBufferTooSmall = 0x1402,
    kErrShareNameMismatch = 0x1403,
    kErrQuotaExceeded = 0x2400,
    kErrNoSpace = 0x2900,
    kErrService = 0x3000,
    kErrServiceHook = 0x3001,
    kErrSamba = 0x3100,
    kErrExec = 0x3200,
    kErrExecStatus = 0x3201,
    kErrMonitorQueue = 0x3300,
  };

  // The last component of a source file name, for the error channel.
  constexpr const char* BaseName(const char* file) {
    const char* base = file;
    for (const char* p = file; *p != '\0'; ++p) {
      if (*p == '/') base = p + 1;
    }
    return base;
  }

  // Whole file into out; false (errno set) when it cannot be read.
  bool ReadFile(const std::string& path, std::string& out);
  // Writes a temporary file beside path, fsyncs it, renames it over path and fsyncs the
  // directory, so readers never see a torn file.
  bool WriteFileAtomic(const std::string& path, const std::string& content, mode_t mode);
  // mkdir -p.
  bool MakeDirs(const std::string& path, mode_t mode);
  // Whether path is a regular file this process may execute.
  bool IsExecutableFile(const std::string& path);

  // Runs program with argv (argv[0] included) without a shell: the child gets the default
  // SIGPIPE disposition, an empty signal mask and no descriptor but 0, 1 and 2. When wait
  // is true, returns the exit status (0 success, >0 the program's status) or -1 when it
  // could not be run or was killed; when false, returns 0 once the program was started
  // (it is not the caller's child, so it leaves no zombie). Sets the error channel on
  // every non-zero result.
  int Run(const std::string& program, const std::vector<std::string>& argv, bool wait);

}  // namespace )

#define TAVO_HOST_SET_ERROR(code) VLIBCErrSetEx((code), ::tavo_host::BaseName(__FILE__), __LINE__)

#endif
