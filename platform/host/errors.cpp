// The platform error channel: per thread, like errno.
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
