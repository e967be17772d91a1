#include "support/log_capture.h"

#include <syslog.h>

#include <cerrno>
#include <cstdarg>
#include <cstdio>
#include <cstring>
#include <mutex>

namespace logcap {

namespace {
std::mutex g_mutex;
std::vector<Line>* g_lines = new std::vector<Line>();

void Capture(int priority, const char* fmt, va_list ap) {
  const int savedErrno = errno;
  std::string format;  // syslog expands %m itself: do the same before formatting
  for (const char* p = fmt; *p; ++p) {
    if (p[0] == '%' && p[1] == 'm') {
      for (const char* e = std::strerror(savedErrno); *e; ++e)
        format += *e == '%' ? "%%" : std::string(1, *e);
      ++p;
    } else {
      format += *p;
      if (p[0] == '%' && p[1] == '%') format += *++p;
    }
  }
  char buffer[16384];
  std::vsnprintf(buffer, sizeof(buffer), format.c_str(), ap);
  std::lock_guard<std::mutex> guard(g_mutex);
  g_lines->push_back(Line{priority, buffer});
  errno = savedErrno;
}
}  // namespace

const std::vector<Line>& Lines() { return *g_lines; }

std::vector<std::string> Texts() {
  std::vector<std::string> out;
  for (const Line& line : *g_lines) out.push_back(line.text);
  return out;
}

void Clear() {
  std::lock_guard<std::mutex> guard(g_mutex);
  g_lines->clear();
}

bool Contains(const std::string& fragment) { return Count(fragment) > 0; }

int Count(const std::string& fragment) {
  int n = 0;
  for (const Line& line : *g_lines) n += line.text.find(fragment) != std::string::npos;
  return n;
}

}  // namespace logcap

extern "C" {

void vsyslog(int priority, const char* fmt, va_list ap) { logcap::Capture(priority, fmt, ap); }
void __vsyslog_chk(int priority, int, const char* fmt, va_list ap) { logcap::Capture(priority, fmt, ap); }

void syslog(int priority, const char* fmt, ...) {
  va_list ap;
  va_start(ap, fmt);
  logcap::Capture(priority, fmt, ap);
  va_end(ap);
}

void __syslog_chk(int priority, int, const char* fmt, ...) {
  va_list ap;
  va_start(ap, fmt);
  logcap::Capture(priority, fmt, ap);
  va_end(ap);
}

}  // extern "C"
