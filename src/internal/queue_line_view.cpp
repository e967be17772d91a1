#include "internal/queue_line_view.h"

#include <climits>
#include <cstddef>
#include <cstdint>
#include <cstring>
#include <initializer_list>

#ifdef __SSE2__
#include <emmintrin.h>
#endif
#if defined(__x86_64__) && defined(__GNUC__)
#include <immintrin.h>
#endif

namespace TAVO {
namespace FILEINDEX {
namespace internal {

namespace {

// Well below the JSON library's own nesting limit, which it enforces by throwing.
const int kMaxDepth = 64;
// The JSON library throws on member names of 2^30 bytes and more; no shorter line holds one.
const size_t kMaxLine = size_t(1) << 30;
// Integers of up to 18 digits fit the JSON library's 64-bit integers; longer ones go
// through its floating-point conversion, which depends on the stream's locale.
const int kMaxDigits = 18;

#define FIDX_HOT inline __attribute__((always_inline))

// A line holds no newline, so the blanks between tokens are these three.
inline bool IsSpace(char c) { return c == ' ' || c == '\t' || c == '\r'; }
inline bool IsDigit(char c) { return c >= '0' && c <= '9'; }

int HexDigit(char c) {
  if (c >= '0' && c <= '9') return c - '0';
  if (c >= 'a' && c <= 'f') return c - 'a' + 10;
  if (c >= 'A' && c <= 'F') return c - 'A' + 10;
  return -1;
}

// Four hex digits at p (which has at least four bytes).
bool Hex4(const char* p, unsigned& out) {
  out = 0;
  for (int i = 0; i < 4; ++i) {
    const int digit = HexDigit(p[i]);
    if (digit < 0) return false;
    out = out * 16 + static_cast<unsigned>(digit);
  }
  return true;
}

// Whether the n bytes at p (which has at least n) are those of the literal, 8 <= n <= 16:
// two overlapping words, where the library's memcmp would be an out-of-line call.
template <size_t N>
FIDX_HOT bool Equals(const char* p, const char (&literal)[N]) {
  constexpr size_t n = N - 1;
  static_assert(n >= 8 && n <= 16, "two words cover the literal");
  uint64_t a, b, c, d;
  std::memcpy(&a, p, 8);
  std::memcpy(&b, literal, 8);
  std::memcpy(&c, p + n - 8, 8);
  std::memcpy(&d, literal + n - 8, 8);
  return ((a ^ b) | (c ^ d)) == 0;
}

// The value of the n digits at p, 1 <= n <= 8; the 8 bytes at p may be read. The digits
// are converted at once, without a branch per digit: their count differs from line to line.
FIDX_HOT uint64_t EightDigits(const char* p, size_t n) {
  uint64_t v;
  std::memcpy(&v, p, 8);
  // The first digit is the lowest byte: shifting the digits to the top leaves zeros,
  // leading zero digits, below them and drops what follows them.
  v = (v & 0x0F0F0F0F0F0F0F0FULL) << (8 * (8 - n));
  v = (v * 10 + (v >> 8)) & 0x00FF00FF00FF00FFULL;
  v = (v * 100 + (v >> 16)) & 0x0000FFFF0000FFFFULL;
  return (v * 10000 + (v >> 32)) & 0xFFFFFFFFULL;
}

// How many of the 16 bytes at p are digits before the first that is not; 16 when all are.
FIDX_HOT size_t Digits16(const char* p) {
#ifdef __SSE2__
  const __m128i bytes = _mm_loadu_si128(reinterpret_cast<const __m128i*>(p));
  const unsigned other = static_cast<unsigned>(_mm_movemask_epi8(
      _mm_or_si128(_mm_cmplt_epi8(bytes, _mm_set1_epi8('0')), _mm_cmpgt_epi8(bytes, _mm_set1_epi8('9')))));
  return static_cast<size_t>(__builtin_ctz(other | 0x10000u));
#else
  size_t n = 0;
  while (n < 16 && IsDigit(p[n])) ++n;
  return n;
#endif
}

bool IsHighSurrogate(unsigned code) { return code >= 0xD800 && code <= 0xDBFF; }

// Whether the escape "\c" is one of those that stand for a single byte.
bool IsShortEscape(char c) { return c != '\0' && std::strchr("\"\\/bfnrt", c) != nullptr; }

// The position after the escape whose backslash is at p, checked as the general reading
// checks it; null when the escape is not one (the general reading then tells why). Reads
// at most 12 bytes from p.
const char* SkipEscape(const char* p) {
  if (p[1] != 'u') return IsShortEscape(p[1]) ? p + 2 : nullptr;
  unsigned code;
  if (!Hex4(p + 2, code)) return nullptr;
  if (!IsHighSurrogate(code)) return p + 6;
  // The partner's form is checked, not its value.
  return p[6] == '\\' && p[7] == 'u' && Hex4(p + 8, code) ? p + 12 : nullptr;
}

// The first quote, backslash or newline in [p, end), or end; the bytes from lineBegin on
// may be read. Inside a string the quote and the backslash are the only bytes with a
// meaning (the JSON library keeps raw control characters and any other byte as they
// are), and a newline ends the line before the string.
#ifdef __SSE2__
// Where the 64 bytes at p hold a quote, a backslash or a newline, one bit a byte.
FIDX_HOT uint64_t StopMask64(const char* p) {
  const __m128i quote = _mm_set1_epi8('"');
  const __m128i backslash = _mm_set1_epi8('\\');
  const __m128i newline = _mm_set1_epi8('\n');
  uint64_t mask = 0;
  for (int i = 0; i < 4; ++i) {
    const __m128i bytes = _mm_loadu_si128(reinterpret_cast<const __m128i*>(p + 16 * i));
    const __m128i hits =
        _mm_or_si128(_mm_or_si128(_mm_cmpeq_epi8(bytes, quote), _mm_cmpeq_epi8(bytes, backslash)),
                     _mm_cmpeq_epi8(bytes, newline));
    mask |= uint64_t(static_cast<unsigned>(_mm_movemask_epi8(hits))) << (16 * i);
  }
  return mask;
}
#endif

FIDX_HOT const char* FindStringStop(const char* p, const char* end, const char* lineBegin) {
#ifdef __SSE2__
  const __m128i quote = _mm_set1_epi8('"');
  const __m128i backslash = _mm_set1_epi8('\\');
  const __m128i newline = _mm_set1_epi8('\n');
  auto stops = [&](const char* at) {
    const __m128i bytes = _mm_loadu_si128(reinterpret_cast<const __m128i*>(at));
    return static_cast<unsigned>(_mm_movemask_epi8(
        _mm_or_si128(_mm_or_si128(_mm_cmpeq_epi8(bytes, quote), _mm_cmpeq_epi8(bytes, backslash)),
                     _mm_cmpeq_epi8(bytes, newline))));
  };
  // 64 bytes a step: most names and paths end within one or two steps, so the step
  // count, and with it the branch that ends the search, is mostly the same.
  while (end - p >= 64) {
    const uint64_t mask = StopMask64(p);
    if (mask != 0) return p + __builtin_ctzll(mask);
    p += 64;
  }
  while (end - p >= 16) {
    const unsigned mask = stops(p);
    if (mask != 0) return p + __builtin_ctz(mask);
    p += 16;
  }
  if (p < end && end - lineBegin >= 16) {
    // The last 16 bytes, overlapping what was searched already.
    const char* window = end - 16;
    const unsigned mask = stops(window) >> (p - window);
    return mask != 0 ? p + __builtin_ctz(mask) : end;
  }
#else
  static_cast<void>(lineBegin);
#endif
  while (p < end && *p != '"' && *p != '\\' && *p != '\n') ++p;
  return p;
}

// The same for a string that is likely long, a path: its first 128 bytes are searched
// before the one branch on the result, so that a path's length does not decide it.
FIDX_HOT const char* FindPathStop(const char* p, const char* end, const char* lineBegin) {
#ifdef __SSE2__
  if (end - p >= 128) {
    const uint64_t low = StopMask64(p);
    const uint64_t high = StopMask64(p + 64);
    const int at = low != 0 ? __builtin_ctzll(low) : 64 + __builtin_ctzll(high | (uint64_t(1) << 63));
    if ((low | high) != 0) return p + at;
    p += 128;
  }
#endif
  return FindStringStop(p, end, lineBegin);
}

void AppendUtf8(std::string& out, unsigned code) {
  if (code <= 0x7F) {
    out += static_cast<char>(code);
  } else if (code <= 0x7FF) {
    out += static_cast<char>(0xC0 | (code >> 6));
    out += static_cast<char>(0x80 | (code & 0x3F));
  } else if (code <= 0xFFFF) {
    out += static_cast<char>(0xE0 | (code >> 12));
    out += static_cast<char>(0x80 | ((code >> 6) & 0x3F));
    out += static_cast<char>(0x80 | (code & 0x3F));
  } else {
    out += static_cast<char>(0xF0 | (code >> 18));
    out += static_cast<char>(0x80 | ((code >> 12) & 0x3F));
    out += static_cast<char>(0x80 | ((code >> 6) & 0x3F));
    out += static_cast<char>(0x80 | (code & 0x3F));
  }
}

// The value of a string's text whose escapes Reader::String has checked, decoded the
// way the JSON library decodes it. A high surrogate takes the next \u escape as its
// partner whatever that escape's value (the library checks only its form), and a lone
// low surrogate is encoded as it stands.
void Decode(const char* p, const char* end, std::string& out) {
  out.clear();
  for (;;) {
    const char* backslash = static_cast<const char*>(std::memchr(p, '\\', static_cast<size_t>(end - p)));
    if (backslash == nullptr) {
      out.append(p, end);
      return;
    }
    out.append(p, backslash);
    p = backslash + 2;
    switch (backslash[1]) {
      case 'b':
        out += '\b';
        break;
      case 'f':
        out += '\f';
        break;
      case 'n':
        out += '\n';
        break;
      case 'r':
        out += '\r';
        break;
      case 't':
        out += '\t';
        break;
      case 'u': {
        unsigned code;
        Hex4(p, code);
        p += 4;
        if (IsHighSurrogate(code)) {
          unsigned low;
          Hex4(p + 2, low);
          p += 6;
          code = 0x10000 + ((code & 0x3FF) << 10) + (low & 0x3FF);
        }
        AppendUtf8(out, code);
        break;
      }
      default:  // '"', '\\' and '/' stand for themselves
        out += backslash[1];
        break;
    }
  }
}

// Reads only a strict subset of JSON whose every line the JSON library reads the same
// way: RFC grammar, integers of at most 18 digits, plain member names. Every step takes
// the position and returns the one after what it read (the position stays in a
// register), or null when it gives up; giving up because the line ended is remembered,
// since the JSON library refuses a text that ends before its value does.
class Reader {
 public:
  // The line starts at begin and ends at the first newline before limit, or at limit.
  Reader(const char* begin, const char* limit) : begin_(begin), end_(limit) {}

  // At the opening quote of a string member that is read: the position after its closing
  // quote, or null; value and size as Member gives them, or null and 0 when the member has
  // escapes and is not to be decoded.
  const char* ReadMember(const char* p, const char*& value, size_t& size, std::string& storage,
                         QueuePaths paths) const {
    return Member(p, value, size, storage, paths);
  }

  QueueLineKind Line(QueueEventView& out, const char*& lineEnd) const {
    if (Canonical(out, lineEnd)) return QueueLineKind::kEvent;
    // What the attempt above left is forgotten: the general reading starts afresh.
    ended_ = false;
    bool event = false;
    const char* p = Root(begin_, out, event);
    if (p == nullptr) return ended_ ? QueueLineKind::kNotEvent : QueueLineKind::kUndecided;
    p = SkipSpaces(p);
    if (!AtEnd(p)) {
      // The JSON library takes a NUL byte for the end of the text; anything else after
      // the value is refused.
      return *p == '\0' ? QueueLineKind::kUndecided : QueueLineKind::kNotEvent;
    }
    if (!event) return QueueLineKind::kNotEvent;
    if (static_cast<size_t>(p - begin_) >= kMaxLine) return QueueLineKind::kUndecided;
    lineEnd = p;
    return QueueLineKind::kEvent;
  }

 private:
  // The line in the queue format's documented order: "event" with a plain integer,
  // "path" as a string, then at most one "path_old" string or one "data" value,
  // compact, and nothing after the object. Such a line reads the same here as in Root,
  // with fewer steps; false for any other line, which Root then reads.
  FIDX_HOT bool Canonical(QueueEventView& out, const char*& lineEnd) const {
    static const char kEvent[] = "{\"event\":";
    static const char kPath[] = ",\"path\":\"";
    static const char kPathOld[] = ",\"path_old\":\"";
    static const char kData[] = ",\"data\":";
    const char* p = begin_;
    if (end_ - p < 24 || !Equals(p, kEvent)) return false;
    uint64_t value;
    p = EventDigits(p + sizeof(kEvent) - 1, value);
    if (p == nullptr || end_ - p < 10 || !Equals(p, kPath)) return false;
    p = Member(p + sizeof(kPath) - 2, out.path, out.pathSize, out.pathStorage);
    if (p == nullptr) return false;
    out.pathOld = nullptr;
    out.pathOldSize = 0;
    if (At(p, ',')) {
      if (end_ - p > 13 && Equals(p, kPathOld)) {
        p = Member(p + sizeof(kPathOld) - 2, out.pathOld, out.pathOldSize, out.pathOldStorage);
      } else if (end_ - p > 8 && Equals(p, kData)) {
        p = p + sizeof(kData) - 1;
        p = At(p, '{') ? CompactObject(p) : Value(p, 1);
      } else {
        return false;
      }
      if (p == nullptr) return false;
    }
    if (!At(p, '}') || !AtEnd(p + 1) || static_cast<size_t>(p + 1 - begin_) >= kMaxLine) return false;
    out.event = static_cast<unsigned>(value);
    lineEnd = p + 1;
    return true;
  }

  // The value of an "event" written as a plain integer that fits an unsigned int; null
  // for anything else. The digits are converted eight at a time, without a branch per
  // digit: their count differs from line to line.
  FIDX_HOT const char* EventDigits(const char* p, uint64_t& value) const {
    const size_t n = DigitRun(p);
    // At most 10 digits fit; and the conversion reads 8 bytes from p, 16 must follow.
    if (n == 0 || n > 10 || (n > 1 && *p == '0') || end_ - p < 16) return nullptr;
    if (n <= 8) {
      value = EightDigits(p, n);
    } else {
      value = EightDigits(p, n - 8) * 100000000u + EightDigits(p + n - 8, 8);
      if (value > UINT_MAX) return nullptr;
    }
    p += n;
    if (*p == '.' || *p == 'e' || *p == 'E') return nullptr;
    return p;
  }

  // At the "{" of a compact object inside the line's object (at depth 1), as Container
  // reads it: the common members (plain numbers and strings) without a call each.
  // Blanks, or a member of another kind, go to the general reading of that value.
  FIDX_HOT const char* CompactObject(const char* p) const {
    ++p;
    if (At(p, '}')) return p + 1;
    for (;;) {
      if (!At(p, '"')) return Stop(p);
      const char* begin;
      const char* end;
      bool escaped;
      p = String(p, begin, end, escaped);
      if (p == nullptr) return nullptr;
      if (!At(p, ':')) return nullptr;
      ++p;
      if (AtEnd(p)) return Stop(p);
      if (IsDigit(*p)) {
        p = Digits(p, nullptr);
      } else if (*p == '"') {
        p = String(p, begin, end, escaped);
      } else {
        p = Value(p, 2);
      }
      if (p == nullptr) return nullptr;
      if (At(p, ',')) {
        ++p;
        continue;
      }
      return At(p, '}') ? p + 1 : nullptr;
    }
  }

  // The whole value; event tells whether it is an object with an "event" convertible to
  // an unsigned integer and a string "path".
  const char* Root(const char* p, QueueEventView& out, bool& event) const {
    p = SkipSpaces(p);
    if (!At(p, '{')) return AtEnd(p) ? Stop(p) : Value(p, 1);
    p = SkipSpaces(p + 1);
    if (At(p, '}')) return p + 1;
    if (!At(p, '"')) return Stop(p);
    bool haveEvent = false;
    bool havePath = false;
    out.pathOld = nullptr;
    out.pathOldSize = 0;
    for (;;) {
      const char* key;
      const char* keyEnd;
      bool escaped;
      p = String(p, key, keyEnd, escaped);
      if (p == nullptr || escaped) return nullptr;
      p = SkipSpaces(p);
      if (!At(p, ':')) return Stop(p);
      p = SkipSpaces(p + 1);
      // A repeated member replaces the earlier one, as the JSON library does.
      const size_t keySize = static_cast<size_t>(keyEnd - key);
      if (keySize == 5 && std::memcmp(key, "event", 5) == 0) {
        p = Event(p, out.event, haveEvent);
      } else if (keySize == 4 && std::memcmp(key, "path", 4) == 0) {
        // A path that is not a string may still be followed by one that is.
        havePath = At(p, '"');
        p = havePath ? Member(p, out.path, out.pathSize, out.pathStorage) : Value(p, 1);
      } else if (keySize == 8 && std::memcmp(key, "path_old", 8) == 0) {
        if (At(p, '"')) {
          p = Member(p, out.pathOld, out.pathOldSize, out.pathOldStorage);
        } else {
          p = Value(p, 1);
          out.pathOld = nullptr;
          out.pathOldSize = 0;
        }
      } else {
        p = Value(p, 1);
      }
      if (p == nullptr) return nullptr;
      p = SkipSpaces(p);
      if (At(p, ',')) {
        p = SkipSpaces(p + 1);
        if (!At(p, '"')) return Stop(p);
        continue;
      }
      if (!At(p, '}')) return Stop(p);
      event = haveEvent && havePath;
      return p + 1;
    }
  }

  FIDX_HOT bool AtEnd(const char* p) const { return p == end_ || *p == '\n'; }
  FIDX_HOT bool At(const char* p, char c) const { return p < end_ && *p == c; }

  // Gives up at p, remembering whether the line ended there.
  const char* Stop(const char* p) const {
    ended_ = AtEnd(p);
    return nullptr;
  }

  FIDX_HOT const char* SkipSpaces(const char* p) const {
    // Compact lines have no blanks: one comparison rules them out.
    while (p < end_ && static_cast<unsigned char>(*p) <= ' ' && IsSpace(*p)) ++p;
    return p;
  }

  // n hex digits at p, or a stop at the first byte that is not one.
  const char* HexDigits(const char* p, int n, unsigned& out) const {
    out = 0;
    for (int i = 0; i < n; ++i, ++p) {
      if (AtEnd(p)) return Stop(p);
      const int digit = HexDigit(*p);
      if (digit < 0) return Stop(p);
      out = out * 16 + static_cast<unsigned>(digit);
    }
    return p;
  }

  // At a backslash inside a string: one escape the JSON library decodes.
  const char* Escape(const char* p) const {
    ++p;
    if (AtEnd(p)) return Stop(p);
    if (IsShortEscape(*p)) return p + 1;
    if (*p != 'u') return Stop(p);
    unsigned code;
    p = HexDigits(p + 1, 4, code);
    if (p == nullptr || !IsHighSurrogate(code)) return p;
    for (char c : {'\\', 'u'}) {
      if (!At(p, c)) return Stop(p);
      ++p;
    }
    return HexDigits(p, 4, code);
  }

  // At the opening quote. [begin, end) is the text between the quotes; escaped tells
  // whether it holds escapes, so that it is not the value itself. A path is searched
  // for its end in longer steps.
  FIDX_HOT const char* String(const char* p, const char*& begin, const char*& end, bool& escaped,
                              bool path = false) const {
    begin = ++p;
    escaped = false;
    p = path ? FindPathStop(p, end_, begin_) : FindStringStop(p, end_, begin_);
    for (;;) {
      if (AtEnd(p)) return Stop(p);
      if (*p == '"') {
        end = p;
        return p + 1;
      }
      escaped = true;
      p = Escape(p);
      if (p == nullptr) return nullptr;
      p = FindStringStop(p, end_, begin_);
    }
  }

  // A string member that is read: its value, decoded into storage when it has escapes,
  // or null and 0 when it has escapes and its paths are unread.
  FIDX_HOT const char* Member(const char* p, const char*& value, size_t& size, std::string& storage,
                              QueuePaths paths = QueuePaths::kRead) const {
    const char* begin;
    const char* end;
    bool escaped;
    p = String(p, begin, end, escaped, true);
    if (p == nullptr) return nullptr;
    if (escaped && paths == QueuePaths::kUnread) {
      value = nullptr;
      size = 0;
    } else if (escaped) {
      Decode(begin, end, storage);
      value = storage.data();
      size = storage.size();
    } else {
      value = begin;
      size = static_cast<size_t>(end - begin);
    }
    return p;
  }

  // How many digits start at p (at most kMaxDigits + 1 are counted).
  FIDX_HOT size_t DigitRun(const char* p) const {
#ifdef __SSE2__
    if (end_ - p >= 16) {
      const __m128i bytes = _mm_loadu_si128(reinterpret_cast<const __m128i*>(p));
      const unsigned other = static_cast<unsigned>(_mm_movemask_epi8(_mm_or_si128(
          _mm_cmplt_epi8(bytes, _mm_set1_epi8('0')), _mm_cmpgt_epi8(bytes, _mm_set1_epi8('9')))));
      if (other != 0) return static_cast<size_t>(__builtin_ctz(other));
    }
#endif
    size_t n = 0;
    while (p + n < end_ && IsDigit(p[n]) && n <= static_cast<size_t>(kMaxDigits)) ++n;
    return n;
  }

  // Digits with no leading zero, at most kMaxDigits of them, not followed by a fraction
  // or an exponent; their value when asked for.
  FIDX_HOT const char* Digits(const char* p, uint64_t* value) const {
    const size_t n = DigitRun(p);
    if (n == 0) return Stop(p);
    if (n > static_cast<size_t>(kMaxDigits) || (n > 1 && *p == '0')) return nullptr;
    if (value != nullptr) {
      *value = 0;
      for (size_t i = 0; i < n; ++i) *value = *value * 10 + static_cast<unsigned>(p[i] - '0');
    }
    p += n;
    if (p < end_ && (*p == '.' || *p == 'e' || *p == 'E')) return nullptr;
    return p;
  }

  FIDX_HOT const char* Literal(const char* p, const char* word, size_t size) const {
    for (size_t i = 0; i < size; ++i) {
      if (AtEnd(p + i) || p[i] != word[i]) return Stop(p + i);
    }
    return p + size;
  }

  // An "event" value: convertible is set when it converts to an unsigned integer (an
  // integer in range, null as 0, a boolean) with out its value, cleared when it certainly
  // does not (a string, an array, an object, an integer out of range other than -0).
  // Fractions and exponents are left to the JSON library's own conversion.
  const char* Event(const char* p, unsigned& out, bool& convertible) const {
    if (AtEnd(p)) return Stop(p);
    switch (*p) {
      case 'n':
        out = 0;
        convertible = true;
        return Literal(p, "null", 4);
      case 't':
        out = 1;
        convertible = true;
        return Literal(p, "true", 4);
      case 'f':
        out = 0;
        convertible = true;
        return Literal(p, "false", 5);
      case '"':
      case '[':
      case '{':
        convertible = false;
        return Value(p, 1);
      case '-': {
        uint64_t value;
        p = Digits(p + 1, &value);
        if (p == nullptr || value == 0) return nullptr;
        convertible = false;
        return p;
      }
      default: {
        uint64_t value;
        p = Digits(p, &value);
        if (p == nullptr) return nullptr;
        convertible = value <= UINT_MAX;
        out = static_cast<unsigned>(value);
        return p;
      }
    }
  }

  const char* Value(const char* p, int depth) const {
    if (AtEnd(p)) return Stop(p);
    switch (*p) {
      case '"': {
        const char* begin;
        const char* end;
        bool escaped;
        return String(p, begin, end, escaped);
      }
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
      case '-':
        return Digits(p + 1, nullptr);
      default:
        return Digits(p, nullptr);
    }
  }

  const char* Container(const char* p, int depth, char close, bool object) const {
    if (depth >= kMaxDepth) return nullptr;
    p = SkipSpaces(p + 1);
    if (At(p, close)) return p + 1;
    for (;;) {
      if (object) {
        const char* begin;
        const char* end;
        bool escaped;
        if (!At(p, '"')) return Stop(p);
        p = String(p, begin, end, escaped);
        if (p == nullptr) return nullptr;
        p = SkipSpaces(p);
        if (!At(p, ':')) return Stop(p);
        p = SkipSpaces(p + 1);
      }
      p = Value(p, depth + 1);
      if (p == nullptr) return nullptr;
      p = SkipSpaces(p);
      if (At(p, ',')) {
        p = SkipSpaces(p + 1);
        continue;
      }
      return At(p, close) ? p + 1 : Stop(p);
    }
  }

  const char* const begin_;
  const char* const end_;
  mutable bool ended_ = false;
};

#undef FIDX_HOT

}  // namespace

namespace {

// Where the 64 bytes at p hold a quote, a backslash or a newline; words of them from p on.
void StopMasks(const char* p, size_t words, uint64_t* out) {
  for (size_t w = 0; w < words; ++w, p += 64) {
#ifdef __SSE2__
    out[w] = StopMask64(p);
#else
    uint64_t mask = 0;
    for (int i = 0; i < 64; ++i) {
      if (p[i] == '"' || p[i] == '\\' || p[i] == '\n') mask |= uint64_t(1) << i;
    }
    out[w] = mask;
#endif
  }
}

#if defined(__x86_64__) && defined(__GNUC__)
#define FIDX_HAVE_AVX2_MASKS 1
// The same, 32 bytes a step, on processors that have AVX2 (chosen when the masks are
// computed; the library is built for any x86-64).
__attribute__((target("avx2"))) void StopMasksAvx2(const char* p, size_t words, uint64_t* out) {
  const __m256i quote = _mm256_set1_epi8('"');
  const __m256i backslash = _mm256_set1_epi8('\\');
  const __m256i newline = _mm256_set1_epi8('\n');
  for (size_t w = 0; w < words; ++w, p += 64) {
    uint64_t mask = 0;
    for (int half = 0; half < 2; ++half) {
      const __m256i bytes = _mm256_loadu_si256(reinterpret_cast<const __m256i*>(p + 32 * half));
      const __m256i hits = _mm256_or_si256(
          _mm256_or_si256(_mm256_cmpeq_epi8(bytes, quote), _mm256_cmpeq_epi8(bytes, backslash)),
          _mm256_cmpeq_epi8(bytes, newline));
      mask |= uint64_t(static_cast<uint32_t>(_mm256_movemask_epi8(hits))) << (32 * half);
    }
    out[w] = mask;
  }
}
#endif

void ComputeStopMasks(const char* p, size_t words, uint64_t* out) {
#ifdef FIDX_HAVE_AVX2_MASKS
  static const bool avx2 = __builtin_cpu_supports("avx2");
  if (avx2) return StopMasksAvx2(p, words, out);
#endif
  StopMasks(p, words, out);
}

#if defined(__x86_64__) && defined(__GNUC__)
#define FIDX_HAVE_FLAT_NUMBERS 1
// A flat object of numbers is read at once from its 64 bytes: "{", then members whose
// names are made of letters and "_" and whose values are numbers as the general reading
// takes them (no leading zero, at most 15 digits, no fraction or exponent), then "}".
// Each byte gets a class, and the object is well formed when every byte is followed by
// one that its class allows. With such names a byte's class is known from the byte and
// its neighbour alone, without finding the strings first, so all bytes are checked at
// once, with no step waiting for the one before. Objects with other names are read
// member by member.
namespace flat {

enum Class : char {
  kOther,  // no byte may follow it, and it may follow none
  kOpening,
  kClosing,
  kLetter,
  kColon,
  kComma,
  kMinus,
  kDigit,
  kBrace,
};

// Each class as one bit of a set, and the set of classes that may follow it; repeated in
// each 16-byte lane for the byte shuffle.
struct alignas(64) LaneTables {
  char bit[64];
  char followers[64];
};
constexpr LaneTables MakeLaneTables() {
  LaneTables t{};
  const unsigned char bit[16] = {0, 1, 2, 4, 8, 16, 32, 64, 128};
  const unsigned opening = 1, closing = 2, letter = 4, colon = 8, comma = 16, minus = 32, digit = 64,
                 brace = 128;
  const unsigned char followers[16] = {
      0,                      // kOther
      letter | closing,       // kOpening: a name, or the empty name's end
      colon,                  // kClosing
      letter | closing,       // kLetter
      minus | digit,          // kColon: a number
      opening,                // kComma: the next name
      digit,                  // kMinus
      digit | comma | brace,  // kDigit
      0,                      // kBrace: the end, where the check stops
  };
  for (int i = 0; i < 64; ++i) {
    t.bit[i] = static_cast<char>(bit[i % 16]);
    t.followers[i] = static_cast<char>(followers[i % 16]);
  }
  return t;
}
constexpr LaneTables kLaneTables = MakeLaneTables();

// The class of each ASCII byte, a quote taken as closing (the opening ones are marked
// after).
struct alignas(64) AsciiClasses {
  char of[128];
};
constexpr AsciiClasses MakeAsciiClasses() {
  AsciiClasses t{};
  for (int c = 0; c < 128; ++c) {
    char k = kOther;
    if (c == '"') k = kClosing;
    if (c == ':') k = kColon;
    if (c == ',') k = kComma;
    if (c == '-') k = kMinus;
    if (c >= '0' && c <= '9') k = kDigit;
    if (c == '}') k = kBrace;
    if ((c >= 'a' && c <= 'z') || (c >= 'A' && c <= 'Z') || c == '_') k = kLetter;
    t.of[c] = k;
  }
  return t;
}
constexpr AsciiClasses kAsciiClasses = MakeAsciiClasses();

// The 64 bytes at an object: their classes, and the masks the numbers' rules need.
struct Bytes {
  __m512i classes;
  uint64_t quote, comma, colon, minus, digit, zero, close, newline;
};

#define FIDX_BYTES_EQUAL(c) _mm512_cmpeq_epi8_mask(bytes, _mm512_set1_epi8(c))
__attribute__((target("avx512bw"), always_inline)) inline Bytes Masks(__m512i bytes, __m512i classes,
                                                                      uint64_t digit) {
  return {classes, FIDX_BYTES_EQUAL('"'), FIDX_BYTES_EQUAL(','), FIDX_BYTES_EQUAL(':'), FIDX_BYTES_EQUAL('-'),
          digit,   FIDX_BYTES_EQUAL('0'), FIDX_BYTES_EQUAL('}'), FIDX_BYTES_EQUAL('\n')};
}

// The classes by one comparison each, on processors with AVX-512BW.
__attribute__((target("avx512bw"), always_inline)) inline Bytes ClassifyCompared(const char* object) {
  const __m512i bytes = _mm512_loadu_si512(object);
  const uint64_t digit =
      _mm512_cmplt_epu8_mask(_mm512_sub_epi8(bytes, _mm512_set1_epi8('0')), _mm512_set1_epi8(10));
  const uint64_t letter =
      _mm512_cmplt_epu8_mask(
          _mm512_sub_epi8(_mm512_or_si512(bytes, _mm512_set1_epi8(0x20)), _mm512_set1_epi8('a')),
          _mm512_set1_epi8(26)) |
      FIDX_BYTES_EQUAL('_');
  __m512i classes = _mm512_maskz_mov_epi8(FIDX_BYTES_EQUAL('"'), _mm512_set1_epi8(kClosing));
  classes = _mm512_mask_mov_epi8(classes, FIDX_BYTES_EQUAL(':'), _mm512_set1_epi8(kColon));
  classes = _mm512_mask_mov_epi8(classes, FIDX_BYTES_EQUAL(','), _mm512_set1_epi8(kComma));
  classes = _mm512_mask_mov_epi8(classes, FIDX_BYTES_EQUAL('-'), _mm512_set1_epi8(kMinus));
  classes = _mm512_mask_mov_epi8(classes, digit, _mm512_set1_epi8(kDigit));
  classes = _mm512_mask_mov_epi8(classes, FIDX_BYTES_EQUAL('}'), _mm512_set1_epi8(kBrace));
  classes = _mm512_mask_mov_epi8(classes, letter, _mm512_set1_epi8(kLetter));
  return Masks(bytes, classes, digit);
}

// The classes by one table lookup, on processors that also have AVX-512VBMI.
__attribute__((target("avx512bw,avx512vbmi"), always_inline)) inline Bytes ClassifyLookedUp(
    const char* object) {
  const __m512i bytes = _mm512_loadu_si512(object);
  // The lookup reads seven bits of the byte; the others are no ASCII byte.
  const __m512i classes =
      _mm512_maskz_permutex2var_epi8(~_mm512_movepi8_mask(bytes), _mm512_load_si512(kAsciiClasses.of), bytes,
                                     _mm512_load_si512(kAsciiClasses.of + 64));
  return Masks(bytes, classes, _mm512_cmpeq_epi8_mask(classes, _mm512_set1_epi8(kDigit)));
}
#undef FIDX_BYTES_EQUAL

// Whether the object whose "{" is the first byte and whose "}" is at the bit last is a
// flat object of numbers.
__attribute__((target("avx512bw"), always_inline)) inline bool Valid(const Bytes& b, uint64_t last) {
  // A quote right after "{" or a comma opens a name; every other one closes one.
  const uint64_t opening = b.quote & ((b.comma << 1) | 2);
  const __m512i classes = _mm512_mask_mov_epi8(b.classes, opening, _mm512_set1_epi8(kOpening));
  const __m512i followers = _mm512_shuffle_epi8(_mm512_load_si512(kLaneTables.followers), classes);
  const __m512i bits = _mm512_shuffle_epi8(_mm512_load_si512(kLaneTables.bit), classes);
  // Each byte's class bit moved down onto the byte before it: the next 16-byte lane
  // moved down, then each lane shifted by one byte with the start of the next (the masked
  // form of the lane move, as GCC 12 warns on the plain one).
  const __m512i nextLanes = _mm512_maskz_alignr_epi64(0xFF, _mm512_setzero_si512(), bits, 2);
  const __m512i next = _mm512_alignr_epi8(nextLanes, bits, 1);
  const uint64_t unfollowed = _mm512_testn_epi8_mask(followers, next);
  const uint64_t inner = (last - 1) & ~uint64_t(1);  // between the braces
  const uint64_t digits = b.digit & inner;
  const uint64_t firstDigits = ((b.colon | b.minus) << 1) & digits;
  uint64_t longRuns = digits;  // bits that start 16 digits in a row
  for (int shift = 1; shift < 16; shift *= 2) longRuns &= longRuns >> shift;
  // The "}" at last, each byte before it followed as its class allows, a name first,
  // then the numbers' own rules.
  return (b.close & last) != 0 &&
         ((unfollowed & inner) | (~opening & 2) | ((firstDigits & b.zero) << 1 & digits) | longRuns) == 0;
}

// The end of the object when its first "}" ends it and it is a flat object of numbers;
// null otherwise.
__attribute__((target("avx512bw"), always_inline)) inline const char* End(const char* object,
                                                                          const Bytes& b) {
  const uint64_t last = b.close & (~b.close + 1);
  return Valid(b, last) ? object + __builtin_ctzll(last) + 1 : nullptr;
}

// For an object that must end its line ("}" and the newline right after it): where the
// newline is, taken from its mask alone, so that reading the next line need not wait
// for the object's check; ok tells whether the object and the line's end are as said.
__attribute__((target("avx512bw"), always_inline)) inline const char* LineEnd(const char* object,
                                                                              const Bytes& b, bool& ok) {
  // The object's "}" and the line's are the two bytes before the first newline.
  const uint64_t last = (b.newline & (~b.newline + 1)) >> 2;
  ok = (b.close & (last << 1)) != 0 && Valid(b, last);
  return object + __builtin_ctzll(b.newline | (uint64_t(1) << 63));
}

__attribute__((target("avx512bw"))) const char* EndCompared(const char* object) {
  return End(object, ClassifyCompared(object));
}
__attribute__((target("avx512bw,avx512vbmi"))) const char* EndLookedUp(const char* object) {
  return End(object, ClassifyLookedUp(object));
}
__attribute__((target("avx512bw"))) const char* LineEndCompared(const char* object, bool& ok) {
  return LineEnd(object, ClassifyCompared(object), ok);
}
__attribute__((target("avx512bw,avx512vbmi"))) const char* LineEndLookedUp(const char* object, bool& ok) {
  return LineEnd(object, ClassifyLookedUp(object), ok);
}

}  // namespace flat

// The reading in use; see UseFlatObjectReading.
FlatObjectReading flatReading = BestFlatObjectReading();

const char* FlatNumbersAvx512(const char* object) {
  return flatReading == FlatObjectReading::kLookedUp ? flat::EndLookedUp(object) : flat::EndCompared(object);
}
const char* FlatNumbersLineEndAvx512(const char* object, bool& ok) {
  return flatReading == FlatObjectReading::kLookedUp ? flat::LineEndLookedUp(object, ok)
                                                     : flat::LineEndCompared(object, ok);
}
#endif

// The longest line read from the masks, and what every step below may read after its
// position: no read reaches kSpan bytes past the line's start.
const size_t kSpan = 512;
const size_t kReach = 24;

}  // namespace

void QueueRunClassifier::Fill(const char* at) {
  size_t words = static_cast<size_t>(end_ - at) / 64;
  if (words > kWords) words = kWords;
  ComputeStopMasks(at, words, masks_);
  masks_[words] = 0;  // read with the word before it, never a stop
  window_ = at;
  windowEnd_ = at + words * 64;
}

bool QueueRunClassifier::Common(const char* line, QueueEventView& out, const char*& lineEnd,
                                QueuePaths paths) {
  static const char kEvent[] = "{\"event\":";
  static const char kPath[] = ",\"path\":\"";
  static const char kPathOld[] = ",\"path_old\":\"";
  static const char kData[] = ",\"data\":";
  static const char kDataFirst[] = "{\"data\":";
  static const char kEventNext[] = ",\"event\":";
  // The masks must cover kSpan bytes from the line on (the line may lie past them).
  const ptrdiff_t span = static_cast<ptrdiff_t>(kSpan);
  if (line < window_ || windowEnd_ - line < span) {
    Fill(line);
    if (windowEnd_ - line < span) return false;
  }
  // Each step reads at most kReach bytes from a position before limit.
  const char* const limit = line + kSpan - kReach;
  // The first quote, backslash or newline in [p, limit); stringEnd takes only a quote,
  // the end of a string without escapes. Two words are looked at before any branch:
  // whether a path ends in the word where it starts or in the next one is as good as random.
  auto firstStop = [&](const char* p) -> const char* {
    const size_t at = static_cast<size_t>(p - window_);
    size_t word = at / 64;
    const uint64_t mask = masks_[word] & (~uint64_t(0) << (at % 64));
    const uint64_t next = masks_[word + 1];
    const char* stop;
    if ((mask | next) != 0) {
      stop = window_ + word * 64 + (mask != 0 ? __builtin_ctzll(mask) : 64 + __builtin_ctzll(next));
    } else {
      // A longer path: the words after those two.
      const size_t lastWord = static_cast<size_t>(limit - window_ - 1) / 64;
      uint64_t later;
      ++word;
      do {
        if (++word > lastWord) return nullptr;
        later = masks_[word];
      } while (later == 0);
      stop = window_ + word * 64 + __builtin_ctzll(later);
    }
    return stop < limit ? stop : nullptr;
  };
  auto stringEnd = [&](const char* p) -> const char* {
    const char* stop = firstStop(p);
    return stop != nullptr && *stop == '"' ? stop : nullptr;
  };
  // A number as the general reading takes it: no leading zero, no fraction or exponent,
  // at most 15 digits here.
  auto number = [](const char* p) -> const char* {
    if (*p == '-') ++p;
    const size_t n = Digits16(p);
    if (n == 0 || n > 15 || (n > 1 && *p == '0')) return nullptr;
    p += n;
    return *p == '.' || *p == 'e' || *p == 'E' ? nullptr : p;
  };
  auto literal = [](const char* p) -> const char* {
    if (std::memcmp(p, "null", 4) == 0 || std::memcmp(p, "true", 4) == 0) return p + 4;
    return std::memcmp(p, "false", 5) == 0 ? p + 5 : nullptr;
  };

#ifdef FIDX_HAVE_FLAT_NUMBERS
  // Whether the object whose "{" is at p is read at once: the processor can, and its 64
  // bytes lie within the span.
  auto atOnce = [&](const char* p) {
    return flatReading != FlatObjectReading::kMemberByMember && p + 64 <= line + kSpan;
  };
#endif
  // A flat object of numbers read at once where the processor can, from its "{"; the
  // position after it, or null to read it member by member.
  auto flatNumbers = [&](const char* p) -> const char* {
#ifdef FIDX_HAVE_FLAT_NUMBERS
    if (atOnce(p)) return FlatNumbersAvx512(p);
#else
    static_cast<void>(p);
#endif
    return nullptr;
  };

  // The value of "data" from its first byte: a literal or a flat object of plain members
  // (anything nested or escaped is left to the general reading); the position after it,
  // or null.
  auto data = [&](const char* p) -> const char* {
    if (*p != '{') {
      p = literal(p);
    } else if (p[1] == '}') {
      p += 2;
    } else if (const char* flatEnd = flatNumbers(p)) {
      p = flatEnd;
    } else {
      ++p;
      const char* stop;
      for (;;) {
        if (*p != '"' || (stop = stringEnd(p + 1)) == nullptr || stop[1] != ':') return nullptr;
        p = stop + 2;
        if (*p == '"') {
          stop = stringEnd(p + 1);
          p = stop == nullptr ? nullptr : stop + 1;
        } else {
          p = *p == '-' || IsDigit(*p) ? number(p) : literal(p);
        }
        if (p == nullptr || p >= limit) return nullptr;
        if (*p != ',') break;
        ++p;
      }
      if (*p != '}') return nullptr;
      ++p;
    }
    return p != nullptr && p < limit ? p : nullptr;
  };

  // The members come in one of two orders: "event" first, as the queue format is
  // documented, or in the order of their names ("data" first), as the JSON library
  // writes them, which is how the notification daemon and the library's own events are
  // written.
  const char* p = line;
  const bool dataFirst = Equals(p, kDataFirst);
  if (dataFirst) {
    p = data(p + sizeof(kDataFirst) - 1);
    if (p == nullptr || !Equals(p, kEventNext)) return false;
    p += sizeof(kEventNext) - 1;
  } else {
    if (!Equals(p, kEvent)) return false;
    p += sizeof(kEvent) - 1;
  }
  const size_t digits = Digits16(p);
  // One branch for all three conditions: the count of digits differs from line to line,
  // and a branch on it would be mispredicted as often.
  if ((digits - 1 > 9) | ((digits > 1) & (*p == '0'))) return false;
  uint64_t event = digits <= 8 ? EightDigits(p, digits)
                               : EightDigits(p, digits - 8) * 100000000u + EightDigits(p + digits - 8, 8);
  if (event > UINT_MAX) return false;
  p += digits;
  // A comma here also rules out a fraction or an exponent.
  if (!Equals(p, kPath)) return false;
  p += sizeof(kPath) - 1;
  // A path member from the first byte of its text: the position after its closing quote,
  // or null. One with escapes is read and decoded as the general reading does.
  auto member = [&](const char* p, const char*& value, size_t& size, std::string& storage) -> const char* {
    const char* stop = firstStop(p);
    if (stop == nullptr || *stop == '\n') return nullptr;
    if (*stop == '"') {
      value = p;
      size = static_cast<size_t>(stop - p);
      return stop + 1;
    }
    // Unread, the escapes are only checked, here where they are common ones.
    if (paths == QueuePaths::kUnread) {
      const char* at = stop;
      while (*at == '\\' && (at = SkipEscape(at)) != nullptr && (at = firstStop(at)) != nullptr) {
        if (*at == '"') {
          value = nullptr;
          size = 0;
          return at + 1;
        }
      }
    }
    stop = Reader(line, end_).ReadMember(p - 1, value, size, storage, paths);
    return stop != nullptr && stop < limit ? stop : nullptr;
  };
  out.pathOld = nullptr;
  out.pathOldSize = 0;
  p = member(p, out.path, out.pathSize, out.pathStorage);
  if (p == nullptr) return false;
  if (*p == ',') {
    if (Equals(p, kPathOld)) {
      p = member(p + sizeof(kPathOld) - 1, out.pathOld, out.pathOldSize, out.pathOldStorage);
    } else if (!dataFirst && Equals(p, kData)) {
      p += sizeof(kData) - 1;
#ifdef FIDX_HAVE_FLAT_NUMBERS
      // Last in the line, a flat object of numbers need not hold up the next line.
      if (*p == '{' && p[1] != '}' && atOnce(p)) {
        bool ok;
        const char* newline = FlatNumbersLineEndAvx512(p, ok);
        if (ok && newline < limit) {
          out.event = static_cast<unsigned>(event);
          lineEnd = newline;
          return true;
        }
      }
#endif
      p = data(p);
    } else {
      return false;
    }
    if (p == nullptr) return false;
  }
  if (*p != '}' || p[1] != '\n') return false;
  out.event = static_cast<unsigned>(event);
  lineEnd = p + 1;
  return true;
}

FlatObjectReading BestFlatObjectReading() {
#ifdef FIDX_HAVE_FLAT_NUMBERS
  // Also called from a static initializer: the processor's features may not be read yet.
  // Without AVX-512 objects are read member by member: with narrower vectors, finding
  // the classes costs what reading at once saves.
  __builtin_cpu_init();
  if (__builtin_cpu_supports("avx512bw"))
    return __builtin_cpu_supports("avx512vbmi") ? FlatObjectReading::kLookedUp : FlatObjectReading::kCompared;
#endif
  return FlatObjectReading::kMemberByMember;
}

void UseFlatObjectReading(FlatObjectReading reading) {
#ifdef FIDX_HAVE_FLAT_NUMBERS
  if (reading <= BestFlatObjectReading()) flatReading = reading;
#else
  static_cast<void>(reading);
#endif
}

QueueLineKind ClassifyQueueLine(const char* data, const char* limit, QueueEventView& out,
                                const char*& lineEnd) {
  return Reader(data, limit).Line(out, lineEnd);
}

bool ViewQueueLine(const char* data, size_t size, QueueEventView& out) {
  const char* lineEnd;
  return ClassifyQueueLine(data, data + size, out, lineEnd) == QueueLineKind::kEvent &&
         lineEnd == data + size;
}

}  // namespace internal
}  // namespace FILEINDEX
}  // namespace TAVO
