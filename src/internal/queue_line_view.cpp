#include "internal/queue_line_view.h"

#include <climits>
#include <cstdint>
#include <cstring>

namespace TAVO {
namespace FILEINDEX {
namespace internal {

namespace {

// Well below the JSON library's own nesting limit, which it enforces by throwing.
const int kMaxDepth = 64;

// The bytes that end an ordinary run inside a string: the quote, the backslash and the
// control characters.
struct SpecialInString {
  bool table[256];
  constexpr SpecialInString() : table() {
    for (int c = 0; c < 0x20; ++c) table[c] = true;
    table[static_cast<unsigned char>('"')] = true;
    table[static_cast<unsigned char>('\\')] = true;
  }
  bool operator[](unsigned char c) const { return table[c]; }
};
constexpr SpecialInString kSpecialInString;

// Accepts only a strict subset of JSON whose every line the JSON library also accepts
// with the same values: RFC grammar, integer numbers only, escapes only outside the
// members that are read. Every method answers false for "not certain".
class Reader {
 public:
  Reader(const char* p, const char* end) : p_(p), end_(end) {}

  bool Line(QueueEventView& out) {
    SkipSpaces();
    if (!Peek('{')) return false;
    ++p_;
    SkipSpaces();
    bool haveEvent = false;
    bool havePath = false;
    QueueEventView view;
    // An empty object has no event: the caller's parser logs it.
    while (Peek('"')) {
      const char* key;
      size_t keySize;
      bool plain;
      if (!String(key, keySize, plain) || !plain) return false;
      SkipSpaces();
      if (!Peek(':')) return false;
      ++p_;
      SkipSpaces();
      // A repeated member replaces the earlier one, as the JSON library does.
      if (Is(key, keySize, "event")) {
        if (!Unsigned(view.event)) return false;
        haveEvent = true;
      } else if (Is(key, keySize, "path")) {
        if (!Peek('"') || !String(view.path, view.pathSize, plain) || !plain) return false;
        havePath = true;
      } else if (Is(key, keySize, "path_old")) {
        if (Peek('"')) {
          if (!String(view.pathOld, view.pathOldSize, plain) || !plain) return false;
        } else {
          if (!Value(1)) return false;
          view.pathOld = nullptr;
          view.pathOldSize = 0;
        }
      } else if (!Value(1)) {
        return false;
      }
      SkipSpaces();
      if (Peek(',')) {
        ++p_;
        SkipSpaces();
        if (!Peek('"')) return false;
        continue;
      }
      if (!Peek('}')) return false;
      ++p_;
      SkipSpaces();
      if (p_ != end_ || !haveEvent || !havePath) return false;
      out = view;
      return true;
    }
    return false;
  }

 private:
  bool Peek(char c) const { return p_ < end_ && *p_ == c; }

  void SkipSpaces() {
    while (p_ < end_ && (*p_ == ' ' || *p_ == '\t' || *p_ == '\r' || *p_ == '\n')) ++p_;
  }

  static bool Is(const char* key, size_t size, const char* name) {
    return size == std::strlen(name) && std::memcmp(key, name, size) == 0;
  }

  // Skips whole 8-byte words that hold no special byte, tested all at once: a byte is
  // zero after XOR with '"' or '\\', or below 0x20 (the word tricks are exact about
  // whether such a byte exists). The byte loop then finds where it is.
  void SkipOrdinaryWords() {
    const uint64_t ones = 0x0101010101010101ULL;
    const uint64_t highs = 0x8080808080808080ULL;
    while (end_ - p_ >= 8) {
      uint64_t word;
      std::memcpy(&word, p_, sizeof(word));
      const uint64_t quote = word ^ (ones * '"');
      const uint64_t backslash = word ^ (ones * '\\');
      const uint64_t special =
          ((quote - ones) & ~quote) | ((backslash - ones) & ~backslash) | ((word - ones * 0x20) & ~word);
      if ((special & highs) != 0) return;
      p_ += 8;
    }
  }

  static int Hex(char c) {
    if (c >= '0' && c <= '9') return c - '0';
    if (c >= 'a' && c <= 'f') return c - 'a' + 10;
    if (c >= 'A' && c <= 'F') return c - 'A' + 10;
    return -1;
  }

  // At the opening quote. The span excludes the quotes; plain is false when the
  // string holds an escape, so that its bytes are not its value.
  bool String(const char*& begin, size_t& size, bool& plain) {
    ++p_;
    begin = p_;
    plain = true;
    for (;;) {
      // Ordinary bytes are skipped in bulk; only a quote, a backslash or a control
      // character stops the scan.
      SkipOrdinaryWords();
      while (p_ < end_ && !kSpecialInString[static_cast<unsigned char>(*p_)]) ++p_;
      if (p_ == end_) return false;
      const char c = *p_;
      if (c == '"') {
        size = static_cast<size_t>(p_ - begin);
        ++p_;
        return true;
      }
      // Raw control characters are tolerated by the JSON library but not by JSON.
      if (c != '\\') return false;
      plain = false;
      if (++p_ == end_) return false;
      if (*p_ == 'u') {
        if (end_ - p_ < 5) return false;
        int code = 0;
        for (int i = 1; i <= 4; ++i) {
          int digit = Hex(p_[i]);
          if (digit < 0) return false;
          code = code * 16 + digit;
        }
        // Surrogate pairs have rules of their own in the JSON library.
        if (code >= 0xD800 && code <= 0xDFFF) return false;
        p_ += 4;
      } else if (*p_ == '\0' || std::strchr("\"\\/bfnrt", *p_) == nullptr) {
        return false;
      }
      ++p_;
    }
  }

  // -?(0|[1-9][0-9]*). Fractions and exponents go to the JSON library, whose reading
  // of them depends on the stream's conversion.
  bool Integer(bool& negative, unsigned long long& value, int& digits) {
    negative = Peek('-');
    if (negative) ++p_;
    if (p_ == end_ || *p_ < '0' || *p_ > '9') return false;
    value = 0;
    digits = 0;
    if (*p_ == '0') {
      ++p_;
      digits = 1;
    } else {
      while (p_ < end_ && *p_ >= '0' && *p_ <= '9') {
        if (digits < 19) value = value * 10 + static_cast<unsigned>(*p_ - '0');
        ++digits;
        ++p_;
      }
    }
    return p_ == end_ || (*p_ != '.' && *p_ != 'e' && *p_ != 'E' && (*p_ < '0' || *p_ > '9'));
  }

  // Only a plain integer in range is decided here; null, booleans, fractions and
  // negative or larger numbers are left to the JSON library's conversion rules.
  bool Unsigned(unsigned& out) {
    if (p_ == end_ || *p_ < '0' || *p_ > '9') return false;
    bool negative;
    unsigned long long value;
    int digits;
    if (!Integer(negative, value, digits) || digits > 10 || value > UINT_MAX) return false;
    out = static_cast<unsigned>(value);
    return true;
  }

  bool Literal(const char* word) {
    size_t n = std::strlen(word);
    if (static_cast<size_t>(end_ - p_) < n || std::memcmp(p_, word, n) != 0) return false;
    p_ += n;
    return true;
  }

  bool Value(int depth) {
    if (p_ == end_) return false;
    switch (*p_) {
      case '{':
        return Container(depth, '}', true);
      case '[':
        return Container(depth, ']', false);
      case '"': {
        const char* begin;
        size_t size;
        bool plain;
        return String(begin, size, plain);
      }
      case 't':
        return Literal("true");
      case 'f':
        return Literal("false");
      case 'n':
        return Literal("null");
      default: {
        bool negative;
        unsigned long long value;
        int digits;
        return Integer(negative, value, digits);
      }
    }
  }

  bool Container(int depth, char close, bool object) {
    if (depth >= kMaxDepth) return false;
    ++p_;
    SkipSpaces();
    if (Peek(close)) {
      ++p_;
      return true;
    }
    for (;;) {
      if (object) {
        const char* key;
        size_t keySize;
        bool plain;
        if (!Peek('"') || !String(key, keySize, plain)) return false;
        SkipSpaces();
        if (!Peek(':')) return false;
        ++p_;
        SkipSpaces();
      }
      if (!Value(depth + 1)) return false;
      SkipSpaces();
      if (Peek(',')) {
        ++p_;
        SkipSpaces();
        continue;
      }
      if (!Peek(close)) return false;
      ++p_;
      return true;
    }
  }

  const char* p_;
  const char* end_;
};

}  // namespace

bool ViewQueueLine(const char* data, size_t size, QueueEventView& out) {
  Reader reader(data, data + size);
  return reader.Line(out);
}

}  // namespace internal
}  // namespace FILEINDEX
}  // namespace TAVO
