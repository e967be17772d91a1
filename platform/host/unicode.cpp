// Case-insensitive comparison of UTF-8 strings: Unicode canonical caseless matching
// (NFD, full case folding, NFD again), then code point order. "é" equals "É" whether
// either is precomposed or not, and "ß" equals "SS". Ill-formed bytes compare as U+FFFD.
#include <strings.h>
#include <tavo/platform.h>

#include <cstring>

#ifdef FILEINDEX_HAVE_ICU
#include <unicode/normalizer2.h>
#include <unicode/unistr.h>
#endif

namespace {

bool IsAscii(const char* s) {
  for (; *s != '\0'; ++s) {
    if (static_cast<unsigned char>(*s) >= 0x80) return false;
  }
  return true;
}

int Sign(int v) { return (v > 0) - (v < 0); }

#ifdef FILEINDEX_HAVE_ICU
bool Fold(const char* s, icu::UnicodeString& out) {
  UErrorCode status = U_ZERO_ERROR;
  const icu::Normalizer2* nfd = icu::Normalizer2::getNFDInstance(status);
  if (U_FAILURE(status)) return false;
  icu::UnicodeString text = icu::UnicodeString::fromUTF8(icu::StringPiece(s));
  icu::UnicodeString decomposed = nfd->normalize(text, status);
  if (U_FAILURE(status)) return false;
  decomposed.foldCase(U_FOLD_CASE_DEFAULT);
  out = nfd->normalize(decomposed, status);
  return U_SUCCESS(status);
}
#endif

}  // namespace

extern "C" int VLIBCUnicodeUTF8StrCaseCmp(const char* a, const char* b) {
  if (a == nullptr || b == nullptr) return a == b ? 0 : (a == nullptr ? -1 : 1);
  // ASCII folds to ASCII lower case and byte order is code point order: the same
  // result as the general path, without its allocations.
  if (IsAscii(a) && IsAscii(b)) return Sign(strcasecmp(a, b));
#ifdef FILEINDEX_HAVE_ICU
  icu::UnicodeString fa, fb;
  if (Fold(a, fa) && Fold(b, fb)) return Sign(fa.compareCodePointOrder(fb));
#endif
  return Sign(strcasecmp(a, b));
}
