#include "internal/log.h"

#include <fileindex/error.h>
#include <syslog.h>

#include <cstdarg>

namespace TAVO {
namespace FILEINDEX {

int LOG_LEVEL = LOG_ERR;

namespace internal {

void LogWrite(LogKind kind, const char* fmt, ...) {
  // Ordinary lines compare with LOG_DEBUG only to pick the debug form, which is the
  // same line: the level never hides them.
  if (kind == LogKind::kDebug && LOG_LEVEL != LOG_DEBUG) return;
  va_list ap;
  va_start(ap, fmt);
  vsyslog(LOG_ERR, fmt, ap);
  va_end(ap);
}

}  // namespace internal
}  // namespace FILEINDEX
}  // namespace TAVO
