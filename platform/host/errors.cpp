// The platform error channel: per thread, like errno.
#include <tavo/host.h>
#include <tavo/platform.h>

#include <string>

#include "host_common.h"

namespace {
thread_local int t_code = 0;
thread_local std::string t_file;
thread_local int t_line = 0;
}  // namespace

extern "C" int VLIBCErrGet(void) { return t_code; }

extern "C" void VLIBCErrSetEx(int code, const char* szFile, int line) {
  t_code = code;
  t_file = szFile != nullptr ? szFile : "";
  t_line = line;
}

extern "C" const char* VLIBCErrorGetFile(void) { return t_file.c_str(); }

extern "C" int VLIBCErrorGetLine(void) { return t_line; }

extern "C" const char* TAVOHostErrorText(int code) {
  switch (code) {
    case tavo_host::kErrNone:
      return "no error";
    case tavo_host::kErrSystem:
      return "system call failed";
    case tavo_host::kErrBadArgument:
      return "invalid argument";
    case tavo_host::kErrNoSuchShare:
      return "no such share";
    case tavo_host::kErrShareTable:
      return "share table missing or malformed";
    case tavo_host::kErrBufferTooSmall:
      return "buffer too small";
    case tavo_host::kErrShareNameMismatch:
      return "share directory not named after the share";
    case tavo_host::kErrQuotaExceeded:
      return "share quota exceeded";
    case tavo_host::kErrNoSpace:
      return "not enough space on the volume";
    case tavo_host::kErrService:
      return "service hook failed";
    case tavo_host::kErrServiceHook:
      return "service hook not executable or service name invalid";
    case tavo_host::kErrSamba:
      return "Samba configuration unreadable or unwritable";
    case tavo_host::kErrExec:
      return "program could not be run";
    case tavo_host::kErrExecStatus:
      return "program exited with a non-zero status";
    case tavo_host::kErrMonitorQueue:
      return "watch list could not be written";
    default:
      return "unknown platform error";
  }
}
