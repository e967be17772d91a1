// The library's one log function. Every line goes to syslog at LOG_ERR and begins
// with "unit:line ". Each source file names its unit once:
//   static const char kLogUnit[] = "utils";
#ifndef FILEINDEX_INTERNAL_LOG_H
#define FILEINDEX_INTERNAL_LOG_H

namespace TAVO {
namespace FILEINDEX {
namespace internal {

enum class LogKind {
  kOrdinary,  // always written; LOG_LEVEL changes nothing observable
  kDebug,     // written only when LOG_LEVEL is exactly 7
  kRaw,       // written without consulting LOG_LEVEL at all
};

// fmt already holds the "%s:%d " prefix; its first two arguments are unit and line.
// "%m" is left for syslog to expand.
void LogWrite(LogKind kind, const char* fmt, ...) __attribute__((format(printf, 2, 3)));

}  // namespace internal
}  // namespace FILEINDEX
}  // namespace TAVO

#define FIDX_LOG_AT(line, fmt, ...)                                                          \
  ::TAVO::FILEINDEX::internal::LogWrite(::TAVO::FILEINDEX::internal::LogKind::kOrdinary, \
                                        "%s:%d " fmt, kLogUnit, (line), ##__VA_ARGS__)
#define FIDX_LOG(fmt, ...) FIDX_LOG_AT(__LINE__, fmt, ##__VA_ARGS__)
#define FIDX_DEBUG(fmt, ...)                                                              \
  ::TAVO::FILEINDEX::internal::LogWrite(::TAVO::FILEINDEX::internal::LogKind::kDebug,  \
                                        "%s:%d " fmt, kLogUnit, __LINE__, ##__VA_ARGS__)
#define FIDX_LOG_RAW(fmt, ...)                                                         \
  ::TAVO::FILEINDEX::internal::LogWrite(::TAVO::FILEINDEX::internal::LogKind::kRaw, \
                                        "%s:%d " fmt, kLogUnit, __LINE__, ##__VA_ARGS__)

#endif
