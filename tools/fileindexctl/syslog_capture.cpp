#include "syslog_capture.h"

#include <dlfcn.h>

#include <cerrno>
#include <cstdarg>
#include <cstdio>
#include <mutex>

namespace fileindexctl {

namespace {

std::mutex g_mutex;
std::vector<std::string>* g_lines = new std::vector<std::string>();  // used until exit
bool g_forward = true;

using VsyslogFn = void (*)(int, const char*, va_list);

void Capture(int priority, const char* fmt, va_list ap) {
  int saved = errno;  // "%m" is the caller's errno, expanded by the C library's printf
  va_list copy;
  va_copy(copy, ap);
  char buffer[4096];
  errno = saved;
  std::vsnprintf(buffer, sizeof(buffer), fmt, copy);
  va_end(copy);
  std::string line = buffer;
  while (!line.empty() && line.back() == '\n') line.pop_back();
  bool forward;
  {
    std::lock_guard<std::mutex> guard(g_mutex);
    g_lines->push_back(line);
    forward = g_forward;
  }
  if (forward) {
    static VsyslogFn next = reinterpret_cast<VsyslogFn>(::dlsym(RTLD_NEXT, "vsyslog"));
    if (next != nullptr) {
      errno = saved;
      next(priority, fmt, ap);
    }
  }
  errno = saved;
}

}  // namespace

size_t LogMark() {
  std::lock_guard<std::mutex> guard(g_mutex);
  return g_lines->size();
}

std::vector<std::string> LogLinesSince(size_t mark) {
  std::lock_guard<std::mutex> guard(g_mutex);
  if (mark >= g_lines->size()) return {};
  return std::vector<std::string>(g_lines->begin() + static_cast<long>(mark), g_lines->end());
}

void SetForwardToSyslog(bool forward) {
  std::lock_guard<std::mutex> guard(g_mutex);
  g_forward = forward;
}

}  // namespace fileindexctl

// The four entry points of the C library's syslog (the fortified ones included). Not
// declared through <syslog.h>, whose declarations carry attributes of their own.
extern "C" {

void vsyslog(int priority, const char* fmt, va_list ap) { fileindexctl::Capture(priority, fmt, ap); }

void syslog(int priority, const char* fmt, ...) {
  va_list ap;
  va_start(ap, fmt);
  fileindexctl::Capture(priority, fmt, ap);
  va_end(ap);
}

void __vsyslog_chk(int priority, int /*flag*/, const char* fmt, va_list ap) {
  fileindexctl::Capture(priority, fmt, ap);
}

void __syslog_chk(int priority, int /*flag*/, const char* fmt, ...) {
  va_list ap;
  va_start(ap, fmt);
  fileindexctl::Capture(priority, fmt, ap);
  va_end(ap);
}

}  // extern "C"
