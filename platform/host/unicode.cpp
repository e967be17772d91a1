// Case-insensitive comparison of UTF-8 strings, code point by code point after
// Unicode simple case folding ("é" equals "É").
#include <strings.h>
#include <tavo/platform.h>

#include <cstring>

#ifdef FILEINDEX_HAVE_ICU
#include <unicode/uchar.h>
#include <unicode/utf8.h>
#endif

extern "C" int VLIBCUnicodeUTF8StrCaseCmp(const char* a, const char* b) {
  if (a == nullptr || b == nullptr) return a == b ? 0 : (a == nullptr ? -1 : 1);
#ifdef FILEINDEX_HAVE_ICU
  int32_t ia = 0, ib = 0;
  const int32_t la = static_cast<int32_t>(std::strlen(a));
  const int32_t lb = static_cast<int32_t>(std::strlen(b));
  for (;;) {
    if (ia >= la || ib >= lb) return (ia < la) - (ib < lb);
    UChar32 ca, cb;
    U8_NEXT(a, ia, la, ca);
    U8_NEXT(b, ib, lb, cb);
    ca = u_foldCase(ca, U_FOLD_CASE_DEFAULT);
    cb = u_foldCase(cb, U_FOLD_CASE_DEFAULT);
    if (ca != cb) return ca < cb ? -1 : 1;
  }
#else
  return strcasecmp(a, b);
#endif
}
