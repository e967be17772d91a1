#include "internal/folder_conf_view.h"

#include <cstring>

#ifdef __SSE2__
#include <emmintrin.h>
#endif

namespace TAVO {
namespace FILEINDEX {
namespace internal {

namespace {

// Well below the JSON library's own nesting limit, which it enforces by throwing.
const int kMaxDepth = 64;
// Integers of up to 18 digits fit the JSON library's 64-bit integers; longer ones go
// through its floating-point conversion, which depends on the stream's locale.
const size_t kMaxDigits = 18;
// The JSON library throws on member names of 2^30 bytes and more.
const size_t kMaxName = size_t(1) << 30;

#define FIDX_HOT inline __attribute__((always_inline))

FIDX_HOT bool IsSpace(char c) { return c == ' ' || c == '\n' || c == '\t' || c == '\r'; }
FIDX_HOT bool IsDigit(char c) { return c >= '0' && c <= '9'; }
bool IsHex(char c) { return IsDigit(c) || (c >= 'a' && c <= 'f') || (c >= 'A' && c <= 'F'); }

// Whether a sorts before b in the parsed object's order: bytes compared unsigned, then
// the shorter first.
bool Before(const FolderConfName& a, const FolderConfName& b) {
  const int c = std::memcmp(a.data, b.data, a.size < b.size ? a.size : b.size);
  return c < 0 || (c == 0 && a.size < b.size);
}

// Every step takes the position and returns the one after what it read, or null when
// it gives up.
class Reader {
 public:
  explicit Reader(const char* end) : end_(end) {}

  const char* Root(const char* p, std::vector<FolderConfRecord>& records) const {
    p = SkipSpaces(p);
    if (!At(p, '{')) return nullptr;
    return Elements(
        p, '}', true, [&](const FolderConfName& path, bool escaped, const char* value) -> const char* {
          // An escaped name would have to be decoded to be compared.
          if (escaped || path.size >= kMaxName || (!records.empty() && !Before(records.back().path, path)))
            return nullptr;
          FolderConfRecord record{path, nullptr, 0, {-1, -1, -1, -1}};
          value = At(value, '{') ? Record(value, record) : Value(value, 1);
          if (value != nullptr) records.push_back(record);
          return value;
        });
  }

  FIDX_HOT const char* SkipSpaces(const char* p) const {
    while (p < end_ && IsSpace(*p)) ++p;
    return p;
  }

 private:
  FIDX_HOT bool At(const char* p, char c) const { return p < end_ && *p == c; }

  // The first quote, backslash or control character in [p, end_), or end_.
  FIDX_HOT const char* FindStringStop(const char* p) const {
#ifdef __SSE2__
    const __m128i quote = _mm_set1_epi8('"');
    const __m128i backslash = _mm_set1_epi8('\\');
    const __m128i control = _mm_set1_epi8(0x1F);
    while (end_ - p >= 16) {
      const __m128i bytes = _mm_loadu_si128(reinterpret_cast<const __m128i*>(p));
      const __m128i stops =
          _mm_or_si128(_mm_or_si128(_mm_cmpeq_epi8(bytes, quote), _mm_cmpeq_epi8(bytes, backslash)),
                       _mm_cmpeq_epi8(_mm_max_epu8(bytes, control), control));
      const unsigned mask = static_cast<unsigned>(_mm_movemask_epi8(stops));
      if (mask != 0) return p + __builtin_ctz(mask);
      p += 16;
    }
#endif
    while (p < end_ && *p != '"' && *p != '\\' && static_cast<unsigned char>(*p) >= 0x20) ++p;
    return p;
  }

  // n hex digits at p.
  const char* Hex(const char* p, int n) const {
    if (end_ - p < n) return nullptr;
    for (int i = 0; i < n; ++i)
      if (!IsHex(p[i])) return nullptr;
    return p + n;
  }

  // At a backslash: one escape the JSON library decodes. A high surrogate must be
  // followed by a second \u escape, whatever its value.
  const char* Escape(const char* p) const {
    ++p;
    if (p == end_) return nullptr;
    switch (*p) {
      case '"':
      case '\\':
      case '/':
      case 'b':
      case 'f':
      case 'n':
      case 'r':
      case 't':
        return p + 1;
      case 'u': {
        const char* digits = p + 1;
        p = Hex(digits, 4);
        if (p == nullptr) return nullptr;
        const bool high = (digits[0] == 'd' || digits[0] == 'D') &&
                          (digits[1] == '8' || digits[1] == '9' || digits[1] == 'a' || digits[1] == 'A' ||
                           digits[1] == 'b' || digits[1] == 'B');
        if (!high) return p;
        if (!At(p, '\\') || !At(p + 1, 'u')) return nullptr;
        return Hex(p + 2, 4);
      }
      default:
        return nullptr;
    }
  }

  // At the opening quote; escaped tells whether the text holds escapes.
  FIDX_HOT const char* String(const char* p, bool& escaped) const {
    ++p;
    escaped = false;
    for (;;) {
      p = FindStringStop(p);
      if (p == end_) return nullptr;
      if (*p == '"') return p + 1;
      if (*p != '\\') return nullptr;  // a raw control character
      escaped = true;
      p = Escape(p);
      if (p == nullptr) return nullptr;
    }
  }

  // A plain integer: no leading zero, at most kMaxDigits digits, no fraction or exponent.
  const char* Number(const char* p) const {
    if (*p == '-') ++p;
    const char* digits = p;
    while (p < end_ && IsDigit(*p)) ++p;
    const size_t n = static_cast<size_t>(p - digits);
    if (n == 0 || n > kMaxDigits || (n > 1 && *digits == '0')) return nullptr;
    if (p < end_ && (*p == '.' || *p == 'e' || *p == 'E')) return nullptr;
    return p;
  }

  const char* Literal(const char* p, const char* word, size_t size) const {
    if (static_cast<size_t>(end_ - p) < size || std::memcmp(p, word, size) != 0) return nullptr;
    return p + size;
  }

  const char* Value(const char* p, int depth) const {
    if (p == end_) return nullptr;
    bool escaped;
    switch (*p) {
      case '"':
        return String(p, escaped);
      case '{':
        return Container(p, depth, '}', true);
      case '[':
        return Container(p, depth, ']', false);
      case 't':
        return Literal(p, "true", 4);
      case 'f':
        return Literal(p, "false", 5);
      case 'n':
        return Literal(p, "null", 4);
      default:
        return Number(p);
    }
  }

  // A folder's record, an object at depth 1, as Container reads it, noting the members
  // a folder is loaded from.
  const char* Record(const char* p, FolderConfRecord& record) const {
    // Which of the flags and "name" the record has held so far.
    bool seen[5] = {false, false, false, false, false};
    return Elements(p, '}', true, [&](const FolderConfName& member, bool escaped, const char* value) {
      return RecordMember(member, escaped, value, record, seen);
    });
  }

  const char* RecordMember(const FolderConfName& member, bool escaped, const char* value,
                           FolderConfRecord& record, bool (&seen)[5]) const {
    // An escaped member name might spell one of the known ones.
    if (escaped) return nullptr;
    const int known = KnownMember(member);
    if (known < 0) return Value(value, 2);
    // The parsed record keeps the last of repeated members: left to the parse.
    if (seen[known]) return nullptr;
    seen[known] = true;
    if (known < 4) {
      if (At(value, 't') || At(value, 'f')) record.flags[known] = At(value, 't') ? 1 : 0;
      return Value(value, 2);
    }
    if (!At(value, '"')) return Value(value, 2);
    const char* end = String(value, escaped);
    if (end == nullptr || escaped) return nullptr;
    record.name = value + 1;
    record.nameSize = static_cast<size_t>(end - 1 - record.name);
    return end;
  }

  // The member's index in FolderConfRecord::flags, 4 for "name", -1 for any other.
  static int KnownMember(const FolderConfName& name) {
    auto is = [&name](const char* word) { return std::memcmp(name.data, word, name.size) == 0; };
    switch (name.size) {
      case 4:
        return is("name") ? 4 : -1;
      case 5:
        return is("audio") ? 1 : is("video") ? 2 : is("photo") ? 3 : -1;
      case 8:
        return is("document") ? 0 : -1;
      default:
        return -1;
    }
  }

  const char* Container(const char* p, int depth, char close, bool object) const {
    if (depth >= kMaxDepth) return nullptr;
    return Elements(p, close, object,
                    [&](const FolderConfName&, bool, const char* value) { return Value(value, depth + 1); });
  }

  // At the "{" or "[" of a container: each element handed to element(name, escaped,
  // value), name empty in an array and value where the element's value begins, which
  // returns the position after the value.
  template <typename Element>
  const char* Elements(const char* p, char close, bool object, Element&& element) const {
    p = SkipSpaces(p + 1);
    if (At(p, close)) return p + 1;
    for (;;) {
      FolderConfName name{p, 0};
      bool escaped = false;
      if (object) {
        if (!At(p, '"')) return nullptr;
        p = String(p, escaped);
        if (p == nullptr) return nullptr;
        name.data += 1;
        name.size = static_cast<size_t>(p - 1 - name.data);
        p = SkipSpaces(p);
        if (!At(p, ':')) return nullptr;
        p = SkipSpaces(p + 1);
      }
      p = element(name, escaped, p);
      if (p == nullptr) return nullptr;
      p = SkipSpaces(p);
      if (At(p, ',')) {
        p = SkipSpaces(p + 1);
        continue;
      }
      return At(p, close) ? p + 1 : nullptr;
    }
  }

  const char* const end_;
};

#undef FIDX_HOT

}  // namespace

bool ViewFolderConf(const char* data, size_t size, std::vector<FolderConfRecord>& records) {
  records.clear();
  const Reader reader(data + size);
  const char* p = reader.Root(data, records);
  // Only blanks may follow the object (a NUL byte, which the JSON library takes for the
  // end of the text, is left to it).
  if (p == nullptr || reader.SkipSpaces(p) != data + size) {
    records.clear();
    return false;
  }
  return true;
}

}  // namespace internal
}  // namespace FILEINDEX
}  // namespace TAVO
