#include "query_string.h"

#include <cctype>
#include <cstdlib>
#include <ctime>
#include <limits>
#include <vector>

namespace fileindexd {

namespace {

using fileindex_store::Condition;
using Type = Condition::Type;

struct Token {
  enum Kind { kEnd, kOpen, kClose, kOpenRange, kCloseRange, kColon, kTerm, kPhrase, kAnd, kOr, kNot, kPlus };
  Kind kind = kEnd;
  std::string literal;  // the text with escapes resolved
  std::string glob;     // the text as a glob: unescaped wildcards, other text literal
  bool wildcard = false;
  bool inclusive = false;  // brackets: '[' and ']' rather than '{' and '}'
};

bool IsSpecial(char c) {
  return c == '(' || c == ')' || c == '[' || c == ']' || c == '{' || c == '}' || c == ':' || c == '"' ||
         c == '^' || c == '~' || c == '\\';
}

class Lexer {
 public:
  explicit Lexer(const std::string& text) : m_text(text) {}

  bool Next(Token& token, std::string& error) {
    token = Token();
    while (m_at < m_text.size() && std::isspace(static_cast<unsigned char>(m_text[m_at]))) ++m_at;
    if (m_at == m_text.size()) return true;
    char c = m_text[m_at];
    switch (c) {
      case '(':
        return Single(token, Token::kOpen);
      case ')':
        return Single(token, Token::kClose);
      case '[':
      case '{':
        token.inclusive = c == '[';
        return Single(token, Token::kOpenRange);
      case ']':
      case '}':
        token.inclusive = c == ']';
        return Single(token, Token::kCloseRange);
      case ':':
        return Single(token, Token::kColon);
      case '"':
        return Phrase(token, error);
      case '^':
      case '~':
        error = std::string("'") + c + "' (boosts and fuzzy matches) is not supported";
        return false;
      default:
        break;
    }
    if (m_text.compare(m_at, 2, "&&") == 0 || m_text.compare(m_at, 2, "||") == 0) {
      token.kind = c == '&' ? Token::kAnd : Token::kOr;
      m_at += 2;
      return true;
    }
    if (c == '!' || c == '-' || c == '+') {
      token.kind = c == '+' ? Token::kPlus : Token::kNot;
      ++m_at;
      return true;
    }
    return Term(token, error);
  }

 private:
  bool Single(Token& token, Token::Kind kind) {
    token.kind = kind;
    ++m_at;
    return true;
  }

  bool Phrase(Token& token, std::string& error) {
    token.kind = Token::kPhrase;
    for (++m_at; m_at < m_text.size() && m_text[m_at] != '"'; ++m_at) {
      if (m_text[m_at] == '\\' && m_at + 1 < m_text.size()) ++m_at;
      token.literal += m_text[m_at];
    }
    if (m_at == m_text.size()) {
      error = "unterminated phrase";
      return false;
    }
    ++m_at;
    return Bounded(token, error);
  }

  bool Term(Token& token, std::string& error) {
    token.kind = Token::kTerm;
    while (m_at < m_text.size()) {
      char c = m_text[m_at];
      if (std::isspace(static_cast<unsigned char>(c)) || (IsSpecial(c) && c != '\\')) break;
      if (c == '\\') {
        if (m_at + 1 == m_text.size()) {
          error = "the query ends with an escape";
          return false;
        }
        c = m_text[++m_at];
        token.literal += c;
        if (c == '*' || c == '?' || c == '\\') token.glob += '\\';
        token.glob += c;
      } else {
        token.literal += c;
        token.glob += c;
        token.wildcard = token.wildcard || c == '*' || c == '?';
      }
      ++m_at;
    }
    if (!token.wildcard) {
      if (token.literal == "AND") token.kind = Token::kAnd;
      if (token.literal == "OR") token.kind = Token::kOr;
      if (token.literal == "NOT") token.kind = Token::kNot;
    }
    return Bounded(token, error);
  }

  static bool Bounded(const Token& token, std::string& error) {
    if (token.literal.size() <= kMaxTermBytes) return true;
    error = "a term is longer than " + std::to_string(kMaxTermBytes) + " bytes";
    return false;
  }

  const std::string& m_text;
  std::size_t m_at = 0;
};

// Where a glob's first unescaped wildcard is; npos when it has none.
std::size_t FirstWildcard(const std::string& glob) {
  for (std::size_t i = 0; i < glob.size(); ++i) {
    if (glob[i] == '\\') {
      ++i;
    } else if (glob[i] == '*' || glob[i] == '?') {
      return i;
    }
  }
  return std::string::npos;
}

bool ParseInteger(const std::string& text, long long& value) {
  if (text.empty()) return false;
  char* end = nullptr;
  errno = 0;
  value = std::strtoll(text.c_str(), &end, 10);
  return errno == 0 && *end == '\0';
}

enum class Field { kDefault, kName, kText, kContentType, kSize, kModified, kPath, kUnknown };

Field FieldNamed(const std::string& name) {
  if (name == "*") return Field::kDefault;
  if (name == "file.filename") return Field::kName;
  if (name == "content") return Field::kText;
  if (name == "file.content_type") return Field::kContentType;
  if (name == "file.filesize") return Field::kSize;
  if (name == "file.last_modified") return Field::kModified;
  if (name == "path.real" || name == "path.real.fulltext") return Field::kPath;
  return Field::kUnknown;
}

class Parser {
 public:
  explicit Parser(const std::string& text) : m_lexer(text) {}

  bool Parse(Condition& out, std::string& error) {
    if (!Advance(error) || !Or(Field::kDefault, 0, out, error)) return false;
    if (m_token.kind != Token::kEnd) return Fail("unexpected " + Describe(m_token), error);
    return true;
  }

 private:
  bool Advance(std::string& error) { return m_lexer.Next(m_token, error); }

  static bool Fail(const std::string& message, std::string& error) {
    error = message;
    return false;
  }

  static std::string Describe(const Token& token) {
    switch (token.kind) {
      case Token::kEnd:
        return "end of query";
      case Token::kTerm:
      case Token::kPhrase:
        return "'" + token.literal + "'";
      case Token::kClose:
        return "')'";
      case Token::kColon:
        return "':'";
      case Token::kCloseRange:
        return "end of range";
      default:
        return "operator";
    }
  }

  static bool StartsClause(const Token& token) {
    return token.kind == Token::kOpen || token.kind == Token::kTerm || token.kind == Token::kPhrase ||
           token.kind == Token::kNot || token.kind == Token::kPlus || token.kind == Token::kOpenRange;
  }

  // Alternatives: joined by OR, or simply placed side by side.
  bool Or(Field field, int depth, Condition& out, std::string& error) {
    if (depth > kMaxQueryDepth) return Fail("the query is nested too deeply", error);
    Condition any = Condition::Of(Type::kOr);
    for (;;) {
      Condition part;
      if (!And(field, depth, part, error)) return false;
      any.children.push_back(std::move(part));
      if (m_token.kind == Token::kOr) {
        if (!Advance(error)) return false;
      } else if (!StartsClause(m_token)) {
        break;
      }
    }
    out = any.children.size() == 1 ? std::move(any.children[0]) : std::move(any);
    return true;
  }

  bool And(Field field, int depth, Condition& out, std::string& error) {
    Condition all = Condition::Of(Type::kAnd);
    for (;;) {
      Condition part;
      if (!Clause(field, depth, part, error)) return false;
      all.children.push_back(std::move(part));
      if (m_token.kind != Token::kAnd) break;
      if (!Advance(error)) return false;
    }
    out = all.children.size() == 1 ? std::move(all.children[0]) : std::move(all);
    return true;
  }

  bool Clause(Field field, int depth, Condition& out, std::string& error) {
    if (depth > kMaxQueryDepth) return Fail("the query is nested too deeply", error);
    if (m_token.kind == Token::kNot) {
      if (!Advance(error)) return false;
      Condition negated;
      if (!Clause(field, depth + 1, negated, error)) return false;
      out = Condition::Of(Type::kNot);
      out.children.push_back(std::move(negated));
      return true;
    }
    if (m_token.kind == Token::kPlus) {
      if (!Advance(error)) return false;
      return Clause(field, depth + 1, out, error);
    }
    if (m_token.kind == Token::kOpen) {
      if (!Advance(error) || !Or(field, depth + 1, out, error)) return false;
      if (m_token.kind != Token::kClose) return Fail("expected ')' before " + Describe(m_token), error);
      return Advance(error);
    }
    if (m_token.kind == Token::kOpenRange) return Range(field, out, error);
    if (m_token.kind != Token::kTerm && m_token.kind != Token::kPhrase)
      return Fail("unexpected " + Describe(m_token), error);
    Token value = m_token;
    if (!Advance(error)) return false;
    if (m_token.kind == Token::kColon && value.kind == Token::kTerm) {
      if (!Advance(error)) return false;
      Field named = FieldNamed(value.literal);
      if (m_token.kind == Token::kOpen || m_token.kind == Token::kOpenRange)
        return Clause(named, depth + 1, out, error);
      if (m_token.kind != Token::kTerm && m_token.kind != Token::kPhrase)
        return Fail("expected a value for " + value.literal, error);
      value = m_token;
      if (!Advance(error)) return false;
      return Value(named, value, out, error);
    }
    return Value(field, value, out, error);
  }

  // [low TO high], {low TO high}, or one of each.
  bool Range(Field field, Condition& out, std::string& error) {
    const bool lowInclusive = m_token.inclusive;
    Token low, high;
    if (!Advance(error)) return false;
    low = m_token;
    if ((low.kind != Token::kTerm && low.kind != Token::kPhrase) || !Advance(error))
      return error.empty() ? Fail("expected the start of a range", error) : false;
    if (m_token.kind != Token::kTerm || m_token.literal != "TO") return Fail("expected TO in a range", error);
    if (!Advance(error)) return false;
    high = m_token;
    if ((high.kind != Token::kTerm && high.kind != Token::kPhrase) || !Advance(error))
      return error.empty() ? Fail("expected the end of a range", error) : false;
    if (m_token.kind != Token::kCloseRange) return Fail("expected the end of a range", error);
    const bool highInclusive = m_token.inclusive;
    if (!Advance(error)) return false;

    if (field != Field::kSize && field != Field::kModified) {
      out = Condition::Of(Type::kNone);  // ranges over names, types or paths: none in the index
      return true;
    }
    Condition range = Condition::Of(field == Field::kSize ? Type::kSize : Type::kModified);
    auto bound = [&](const Token& token, bool isLow, bool inclusive) {
      if (token.kind == Token::kTerm && token.literal == "*") return true;
      long long first = 0, last = 0;
      bool ok = field == Field::kSize ? ParseInteger(token.literal, first) && (last = first, true)
                                      : ParseDate(token.literal, first, last);
      if (!ok)
        return Fail("not a " + std::string(field == Field::kSize ? "number" : "date") + ": " + token.literal,
                    error);
      if (isLow) {
        range.low = inclusive ? first : (last == std::numeric_limits<std::int64_t>::max() ? last : last + 1);
      } else {
        range.high =
            inclusive ? last : (first == std::numeric_limits<std::int64_t>::min() ? first : first - 1);
      }
      return true;
    };
    if (!bound(low, true, lowInclusive) || !bound(high, false, highInclusive)) return false;
    out = std::move(range);
    return true;
  }

  bool Value(Field field, const Token& value, Condition& out, std::string& error) {
    const bool phrase = value.kind == Token::kPhrase;
    switch (field) {
      case Field::kDefault:
        return Words(value, phrase, out);
      case Field::kName:
        out =
            Condition::Of(Type::kNameGlob, phrase ? fileindex_store::EscapeGlob(value.literal) : value.glob);
        return true;
      case Field::kText:
        out = Condition::Of(Type::kText,
                            phrase ? value.literal : fileindex_store::GlobLiteralPrefix(value.glob));
        out.prefix = !phrase && value.wildcard;
        return true;
      case Field::kContentType:
        out = Condition::Of(Type::kContentType, value.literal);
        return true;
      case Field::kPath:
        out = Condition::Of(Type::kUnder, value.literal);
        return true;
      case Field::kSize:
      case Field::kModified: {
        if (!phrase && value.literal == "*") {
          out = Condition::Of(field == Field::kSize ? Type::kSize : Type::kModified);
          return true;
        }
        long long first = 0, last = 0;
        bool ok = field == Field::kSize ? ParseInteger(value.literal, first) && (last = first, true)
                                        : ParseDate(value.literal, first, last);
        if (!ok)
          return Fail(
              "not a " + std::string(field == Field::kSize ? "number" : "date") + ": " + value.literal,
              error);
        out = Condition::Range(field == Field::kSize ? Type::kSize : Type::kModified, first, last);
        return true;
      }
      case Field::kUnknown:
        out = Condition::Of(Type::kNone);
        return true;
    }
    return false;
  }

  // A word of any field: the words of names (and of extracted text). "beach*" finds the
  // names with a word beginning "beach"; wildcards inside a word also hold the name to
  // the whole pattern.
  static bool Words(const Token& value, bool phrase, Condition& out) {
    if (!phrase && value.literal == "*") {
      out = Condition::Of(Type::kAll);
      return true;
    }
    const std::size_t wildcardAt = phrase ? std::string::npos : FirstWildcard(value.glob);
    Condition words =
        Condition::Of(Type::kWords, phrase ? value.literal : fileindex_store::GlobLiteralPrefix(value.glob));
    words.prefix = wildcardAt != std::string::npos;
    Condition text = words;
    text.type = Type::kText;
    Condition either = Condition::Of(Type::kOr);
    either.children.push_back(std::move(words));
    either.children.push_back(std::move(text));
    const bool trailingStarOnly = wildcardAt == std::string::npos ||
                                  (wildcardAt + 1 == value.glob.size() && value.glob[wildcardAt] == '*');
    if (trailingStarOnly) {
      out = std::move(either);
      return true;
    }
    out = Condition::Of(Type::kAnd);
    out.children.push_back(std::move(either));
    out.children.push_back(Condition::Of(Type::kNameGlob, "*" + value.glob + "*"));
    return true;
  }

  Lexer m_lexer;
  Token m_token;
};

bool Digits(const std::string& text, std::size_t at, std::size_t count, int& value) {
  if (at + count > text.size()) return false;
  value = 0;
  for (std::size_t i = at; i < at + count; ++i) {
    if (!std::isdigit(static_cast<unsigned char>(text[i]))) return false;
    value = value * 10 + (text[i] - '0');
  }
  return true;
}

}  // namespace

bool ParseDate(const std::string& text, long long& first, long long& last) {
  struct tm parts = {};
  int year, month, day;
  if (!Digits(text, 0, 4, year) || text.size() < 10 || text[4] != '-' || !Digits(text, 5, 2, month) ||
      text[7] != '-' || !Digits(text, 8, 2, day) || month < 1 || month > 12 || day < 1 || day > 31)
    return false;
  parts.tm_year = year - 1900;
  parts.tm_mon = month - 1;
  parts.tm_mday = day;
  std::size_t at = 10;
  long long span = 24 * 3600 - 1;  // a date alone covers its whole day
  long long offset = 0;
  if (at < text.size()) {
    int hour, minute, second = 0;
    if (text[at] != 'T' || !Digits(text, at + 1, 2, hour) || text.size() < at + 6 || text[at + 3] != ':' ||
        !Digits(text, at + 4, 2, minute) || hour > 23 || minute > 59)
      return false;
    at += 6;
    span = 59;
    if (at < text.size() && text[at] == ':') {
      if (!Digits(text, at + 1, 2, second) || second > 60) return false;
      at += 3;
      span = 0;
      if (at < text.size() && text[at] == '.') {
        for (++at; at < text.size() && std::isdigit(static_cast<unsigned char>(text[at]));) ++at;
      }
    }
    parts.tm_hour = hour;
    parts.tm_min = minute;
    parts.tm_sec = second;
    if (at < text.size() && text[at] == 'Z') {
      ++at;
    } else if (at < text.size() && (text[at] == '+' || text[at] == '-')) {
      int offsetHours, offsetMinutes;
      if (!Digits(text, at + 1, 2, offsetHours) || text.size() < at + 6 || text[at + 3] != ':' ||
          !Digits(text, at + 4, 2, offsetMinutes))
        return false;
      offset = (offsetHours * 3600LL + offsetMinutes * 60LL) * (text[at] == '+' ? 1 : -1);
      at += 6;
    }
  }
  if (at != text.size()) return false;
  first = static_cast<long long>(timegm(&parts)) - offset;
  last = first + span;
  return true;
}

bool IsUtf8(const std::string& text) {
  for (std::size_t i = 0; i < text.size();) {
    unsigned char c = static_cast<unsigned char>(text[i]);
    std::size_t length = c < 0x80 ? 1 : (c >> 5) == 0x6 ? 2 : (c >> 4) == 0xE ? 3 : (c >> 3) == 0x1E ? 4 : 0;
    if (length == 0 || i + length > text.size()) return false;
    for (std::size_t k = 1; k < length; ++k) {
      if ((static_cast<unsigned char>(text[i + k]) & 0xC0) != 0x80) return false;
    }
    i += length;
  }
  return true;
}

bool ParseQueryString(const std::string& query, Condition& out, std::string& error) {
  if (query.size() > kMaxQueryBytes) {
    error = "the query is longer than " + std::to_string(kMaxQueryBytes) + " bytes";
    return false;
  }
  // Names are matched as text: a query that is not (a NUL, bytes that are not UTF-8) can
  // match nothing and would only confuse what reads it.
  if (query.find('\0') != std::string::npos || !IsUtf8(query)) {
    error = "the query is not UTF-8 text";
    return false;
  }
  return Parser(query).Parse(out, error);
}

bool QueryScope(const Condition& condition, std::string& path) {
  if (condition.type == Type::kUnder) {
    path = condition.text;
    return true;
  }
  if (condition.type != Type::kAnd) return false;
  for (const Condition& child : condition.children) {
    if (QueryScope(child, path)) return true;
  }
  return false;
}

void ScopeToShare(Condition& condition, const std::string& shareDirectory) {
  for (Condition& child : condition.children) ScopeToShare(child, shareDirectory);
  if (condition.type != Type::kUnder) return;
  std::string path = condition.text;
  while (path.size() > 1 && path.back() == '/') path.pop_back();
  if (path == shareDirectory) {
    condition.text.clear();
  } else if (path.size() > shareDirectory.size() &&
             path.compare(0, shareDirectory.size(), shareDirectory) == 0 &&
             path[shareDirectory.size()] == '/') {
    condition.text = path.substr(shareDirectory.size() + 1);
  } else {
    condition = Condition::Of(Type::kNone);
  }
}

}  // namespace fileindexd
