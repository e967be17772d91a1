// Conditions answered by the SQLite store: each condition becomes one SQL expression over
// `entries`, with the full-text index narrowing name conditions wherever a word is known.
#include "search_condition.h"

#include <unicode/normalizer2.h>
#include <unicode/uchar.h>
#include <unicode/unistr.h>
#include <unicode/uversion.h>

#include <algorithm>
#include <cctype>
#include <cstring>
#include <unordered_map>
#include <utility>

#include "store.h"

namespace fileindex_store {

const char kDirectoryContentType[] = "text/directory";

namespace {

const char kUnknownContentType[] = "application/octet-stream";

const std::unordered_map<std::string, const char*>& ContentTypes() {
  static const std::unordered_map<std::string, const char*> types = {
      // documents
      {"txt", "text/plain"},
      {"log", "text/plain"},
      {"md", "text/markdown"},
      {"csv", "text/csv"},
      {"html", "text/html"},
      {"htm", "text/html"},
      {"xml", "text/xml"},
      {"rtf", "text/rtf"},
      {"tex", "text/x-tex"},
      {"json", "application/json"},
      {"pdf", "application/pdf"},
      {"epub", "application/epub+zip"},
      {"doc", "application/msword"},
      {"docx", "application/vnd.openxmlformats-officedocument.wordprocessingml.document"},
      {"xls", "application/vnd.ms-excel"},
      {"xlsx", "application/vnd.openxmlformats-officedocument.spreadsheetml.sheet"},
      {"ppt", "application/vnd.ms-powerpoint"},
      {"pptx", "application/vnd.openxmlformats-officedocument.presentationml.presentation"},
      {"odt", "application/vnd.oasis.opendocument.text"},
      {"ods", "application/vnd.oasis.opendocument.spreadsheet"},
      {"odp", "application/vnd.oasis.opendocument.presentation"},
      {"pages", "application/vnd.apple.pages"},
      {"numbers", "application/vnd.apple.numbers"},
      {"key", "application/vnd.apple.keynote"},
      {"eml", "message/rfc822"},
      {"vcf", "text/x-vcard"},
      // audio
      {"mp3", "audio/mpeg"},
      {"flac", "audio/flac"},
      {"ogg", "audio/ogg"},
      {"oga", "audio/ogg"},
      {"opus", "audio/opus"},
      {"wav", "audio/x-wav"},
      {"m4a", "audio/mp4"},
      {"aac", "audio/x-aac"},
      {"wma", "audio/x-ms-wma"},
      {"aiff", "audio/x-aiff"},
      {"aif", "audio/x-aiff"},
      {"ape", "audio/x-ape"},
      {"alac", "audio/mp4"},
      {"mka", "audio/x-matroska"},
      {"mid", "audio/midi"},
      {"midi", "audio/midi"},
      // video
      {"mp4", "video/mp4"},
      {"m4v", "video/mp4"},
      {"mkv", "video/x-matroska"},
      {"avi", "video/x-msvideo"},
      {"mov", "video/quicktime"},
      {"wmv", "video/x-ms-wmv"},
      {"webm", "video/webm"},
      {"mpg", "video/mpeg"},
      {"mpeg", "video/mpeg"},
      {"ts", "video/mp2t"},
      {"m2ts", "video/mp2t"},
      {"3gp", "video/3gpp"},
      {"flv", "video/x-flv"},
      {"vob", "video/mpeg"},
      {"ogv", "video/ogg"},
      // images
      {"jpg", "image/jpeg"},
      {"jpeg", "image/jpeg"},
      {"png", "image/png"},
      {"gif", "image/gif"},
      {"bmp", "image/bmp"},
      {"tif", "image/tiff"},
      {"tiff", "image/tiff"},
      {"webp", "image/webp"},
      {"heic", "image/heic"},
      {"heif", "image/heif"},
      {"svg", "image/svg+xml"},
      {"raw", "image/x-raw"},
      {"cr2", "image/x-canon-cr2"},
      {"cr3", "image/x-canon-cr3"},
      {"nef", "image/x-nikon-nef"},
      {"arw", "image/x-sony-arw"},
      {"dng", "image/x-adobe-dng"},
      {"orf", "image/x-olympus-orf"},
      {"rw2", "image/x-panasonic-rw2"},
      // archives
      {"zip", "application/zip"},
      {"tar", "application/x-tar"},
      {"bz2", "application/x-bzip2"},
      {"7z", "application/x-7z-compressed"},
      {"gz", "application/gzip"},
  };
  return types;
}

std::string LowerAscii(std::string text) {
  for (char& c : text) c = static_cast<char>(std::tolower(static_cast<unsigned char>(c)));
  return text;
}

bool HasWordCharacter(const std::string& text) {
  return std::any_of(text.begin(), text.end(),
                     [](char c) { return std::isalnum(static_cast<unsigned char>(c)); });
}

// A full-text phrase of the words in `text`; the same tokenizer splits it as it split names.
std::string Phrase(const std::string& text) {
  std::string phrase = "\"";
  for (char c : text) phrase += c == '"' ? std::string("\"\"") : std::string(1, c);
  return phrase + "\"";
}

std::string TextOf(sqlite3_value* value) {
  const unsigned char* text = sqlite3_value_text(value);
  return text != nullptr ? std::string(reinterpret_cast<const char*>(text),
                                       static_cast<std::size_t>(sqlite3_value_bytes(value)))
                         : std::string();
}

void FoldFunction(sqlite3_context* context, int, sqlite3_value** values) {
  const std::string folded = FoldForMatching(TextOf(values[0]));
  sqlite3_result_text(context, folded.data(), static_cast<int>(folded.size()), SQLITE_TRANSIENT);
}

void GlobFunction(sqlite3_context* context, int, sqlite3_value** values) {
  const unsigned char* glob = sqlite3_value_text(values[0]);
  const unsigned char* name = sqlite3_value_text(values[1]);
  if (glob == nullptr || name == nullptr) {
    sqlite3_result_int(context, 0);
    return;
  }
  sqlite3_result_int(
      context, GlobMatches(reinterpret_cast<const char*>(glob), FoldForMatching(TextOf(values[1]))) ? 1 : 0);
}

bool IsContinuation(unsigned char c) { return (c & 0xC0) == 0x80; }

// The condition with what can never or always match folded away, so that the SQL keeps
// the shapes SQLite plans with indexes ("0 OR x IN (...)" would be a scan of every row).
Condition Simplified(const Condition& c) {
  using T = Condition::Type;
  if (c.type != T::kAnd && c.type != T::kOr && c.type != T::kNot) return c;
  Condition out = Condition::Of(c.type);
  const T absorbing = c.type == T::kAnd ? T::kNone : T::kAll;  // decides the whole
  const T neutral = c.type == T::kAnd ? T::kAll : T::kNone;    // changes nothing
  for (const Condition& child : c.children) {
    Condition simple = Simplified(child);
    if (c.type == T::kNot) {
      if (simple.type == T::kAll || simple.type == T::kNone)
        return Condition::Of(simple.type == T::kAll ? T::kNone : T::kAll);
      out.children.push_back(std::move(simple));
      continue;
    }
    if (simple.type == absorbing) return Condition::Of(absorbing);
    if (simple.type != neutral) out.children.push_back(std::move(simple));
  }
  if (c.type == T::kNot) return out;
  if (out.children.empty()) return Condition::Of(neutral);
  if (out.children.size() == 1) return std::move(out.children[0]);
  return out;
}

// Builds the SQL of a condition, collecting the values it binds.
class SqlBuilder {
 public:
  std::string Build(const Condition& c) {
    using T = Condition::Type;
    switch (c.type) {
      case T::kAll:
        return "1";
      case T::kNone:
        return "0";
      case T::kAnd:
      case T::kOr: {
        if (c.children.empty()) return c.type == T::kAnd ? "1" : "0";
        std::string sql = "(";
        for (std::size_t i = 0; i < c.children.size(); ++i) {
          if (i > 0) sql += c.type == T::kAnd ? " AND " : " OR ";
          sql += Build(c.children[i]);
        }
        return sql + ")";
      }
      case T::kNot:
        return c.children.size() == 1 ? "(NOT " + Build(c.children[0]) + ")" : "0";
      case T::kNameGlob: {
        // The folded names beginning with the glob's literal start are one range of an
        // index; the glob itself decides only when it holds more than that start and '*'.
        const std::string glob = FoldForMatching(c.text);
        const std::string literal = GlobLiteralPrefix(glob);
        if (glob == EscapeGlob(literal)) return "fi_fold(e.name) = " + Text(literal);
        std::string sql;
        if (!literal.empty())  // no UTF-8 byte reaches 0xff
          sql = "fi_fold(e.name) >= " + Text(literal) + " AND fi_fold(e.name) < " + Text(literal + "\xff");
        if (glob != EscapeGlob(literal) + "*")
          sql += (sql.empty() ? "" : " AND ") + std::string("fi_glob(") + Text(glob) + ", e.name)";
        return sql.empty() ? "1" : "(" + sql + ")";
      }
      case T::kWords:
        if (!HasWordCharacter(c.text) && !HasNonAscii(c.text)) return c.prefix && c.text.empty() ? "1" : "0";
        return NameMatch(Phrase(c.text) + (c.prefix ? "*" : ""));
      case T::kText:
        if (!HasWordCharacter(c.text) && !HasNonAscii(c.text)) return "0";
        return "e.id IN (SELECT rowid FROM texts WHERE texts MATCH " +
               Text(Phrase(c.text) + (c.prefix ? "*" : "")) + ")";
      case T::kContentType:
        return ContentType(c.text);
      case T::kSize:
        return "(e.is_dir = 0 AND e.size BETWEEN " + Int(c.low) + " AND " + Int(c.high) + ")";
      case T::kModified:
        return "(e.mtime BETWEEN " + Int(c.low) + " AND " + Int(c.high) + ")";
      case T::kUnder:
        if (c.text.empty()) return "1";
        return "(e.parent = " + Text(c.text) + " OR (e.parent >= " + Text(c.text + "/") + " AND e.parent < " +
               Text(c.text + "0") + "))";
    }
    return "0";
  }

  std::string In(const char* column, const std::vector<std::string>& values) {
    if (values.empty()) return "0";
    std::string list;
    for (const std::string& value : values) list += (list.empty() ? "" : ", ") + Text(value);
    return std::string(column) + " IN (" + list + ")";
  }

  void BindAll(Statement& statement) const {
    for (const Value& value : m_values) {
      if (value.isText) {
        statement.Bind(value.text);
      } else {
        statement.Bind(value.number);
      }
    }
  }

 private:
  static bool HasNonAscii(const std::string& text) {
    return std::any_of(text.begin(), text.end(),
                       [](char c) { return static_cast<unsigned char>(c) >= 0x80; });
  }
  std::string Text(const std::string& value) {
    m_values.push_back(Value{true, value, 0});
    return "?" + std::to_string(m_values.size());
  }
  std::string Int(std::int64_t value) {
    m_values.push_back(Value{false, std::string(), value});
    return "?" + std::to_string(m_values.size());
  }
  std::string NameMatch(const std::string& expression) {
    return "e.id IN (SELECT rowid FROM names WHERE names MATCH " + Text(expression) + ")";
  }
  // Files by the content types of their extensions; directories are text/directory.
  std::string ContentType(const std::string& pattern) {
    std::vector<std::string> extensions;
    for (const auto& type : ContentTypes()) {
      if (ContentTypeMatches(pattern, type.second)) extensions.push_back(type.first);
    }
    std::sort(extensions.begin(), extensions.end());
    std::string files;
    if (ContentTypeMatches(pattern, kUnknownContentType)) {
      // Everything whose extension has no known type, with those of the pattern.
      std::string known;
      for (const auto& type : ContentTypes()) {
        if (std::find(extensions.begin(), extensions.end(), type.first) == extensions.end())
          known += (known.empty() ? "" : ", ") + Text(type.first);
      }
      files = known.empty() ? "1" : "e.ext NOT IN (" + known + ")";
    } else if (!extensions.empty()) {
      std::string list;
      for (const std::string& ext : extensions) list += (list.empty() ? "" : ", ") + Text(ext);
      files = "e.ext IN (" + list + ")";
    }
    std::string sql = files.empty() ? "" : "(e.is_dir = 0 AND " + files + ")";
    // A wildcard pattern ("text/*") means files; only the exact type finds folders.
    if (LowerAscii(pattern) == kDirectoryContentType)
      sql += std::string(sql.empty() ? "" : " OR ") + "e.is_dir = 1";
    return sql.empty() ? "0" : "(" + sql + ")";
  }

  struct Value {
    bool isText;
    std::string text;
    std::int64_t number;
  };
  std::vector<Value> m_values;
};

}  // namespace

const char* ContentTypeOfExtension(const std::string& extension) {
  auto it = ContentTypes().find(extension);
  return it == ContentTypes().end() ? kUnknownContentType : it->second;
}

bool ContentTypeMatches(const std::string& pattern, const std::string& contentType) {
  const std::string p = LowerAscii(pattern), type = LowerAscii(contentType);
  if (p == "*" || p == "*/*") return true;
  if (p.size() >= 2 && p.compare(p.size() - 2, 2, "/*") == 0)
    return type.compare(0, p.size() - 1, p, 0, p.size() - 1) == 0;
  return p == type;
}

std::string FoldingVersion() {
  UVersionInfo icu, unicode;
  u_getVersion(icu);
  u_getUnicodeVersion(unicode);
  char icuText[U_MAX_VERSION_STRING_LENGTH], unicodeText[U_MAX_VERSION_STRING_LENGTH];
  u_versionToString(icu, icuText);
  u_versionToString(unicode, unicodeText);
  return std::string("icu ") + icuText + ", unicode " + unicodeText;
}

std::string FoldForMatching(const std::string& utf8) {
  bool ascii = true;
  for (unsigned char c : utf8) ascii = ascii && c < 0x80;
  if (ascii) return LowerAscii(utf8);
  UErrorCode status = U_ZERO_ERROR;
  const icu::Normalizer2* nfd = icu::Normalizer2::getNFDInstance(status);
  icu::UnicodeString text = icu::UnicodeString::fromUTF8(utf8);
  if (U_SUCCESS(status)) {
    icu::UnicodeString decomposed = nfd->normalize(text, status);
    if (U_SUCCESS(status)) text = decomposed;
  }
  icu::UnicodeString folded;
  for (int32_t i = 0; i < text.length();) {
    UChar32 c = text.char32At(i);
    i += U16_LENGTH(c);
    if (u_charType(c) == U_NON_SPACING_MARK) continue;  // accents
    folded.append(u_foldCase(c, U_FOLD_CASE_DEFAULT));
  }
  std::string out;
  folded.toUTF8String(out);
  return out;
}

std::string EscapeGlob(const std::string& literal) {
  std::string glob;
  for (char c : literal) {
    if (c == '*' || c == '?' || c == '\\') glob += '\\';
    glob += c;
  }
  return glob;
}

std::string GlobLiteralPrefix(const std::string& glob) {
  std::string literal;
  for (std::size_t i = 0; i < glob.size(); ++i) {
    if (glob[i] == '*' || glob[i] == '?') break;
    if (glob[i] == '\\' && i + 1 < glob.size()) ++i;
    literal += glob[i];
  }
  return literal;
}

bool GlobMatches(const std::string& glob, const std::string& name) {
  std::size_t g = 0, n = 0;
  std::size_t starG = std::string::npos, starN = 0;
  while (n < name.size()) {
    if (g < glob.size() && glob[g] == '*') {
      starG = ++g;
      starN = n;
      continue;
    }
    if (g < glob.size() && glob[g] == '?') {
      ++g;
      ++n;
      while (n < name.size() && IsContinuation(static_cast<unsigned char>(name[n]))) ++n;
      continue;
    }
    if (g < glob.size()) {
      std::size_t at = glob[g] == '\\' && g + 1 < glob.size() ? g + 1 : g;
      if (glob[at] == name[n]) {
        g = at + 1;
        ++n;
        continue;
      }
    }
    if (starG == std::string::npos) return false;
    // Let the last star take one more character (a whole one) and try again from there.
    g = starG;
    n = ++starN;
    while (n < name.size() && IsContinuation(static_cast<unsigned char>(name[n]))) n = ++starN;
  }
  while (g < glob.size() && glob[g] == '*') ++g;
  return g == glob.size();
}

bool RegisterMatchingFunctions(sqlite3* db) {
  const int flags = SQLITE_UTF8 | SQLITE_DETERMINISTIC | SQLITE_INNOCUOUS;
  return sqlite3_create_function_v2(db, "fi_fold", 1, flags, nullptr, FoldFunction, nullptr, nullptr,
                                    nullptr) == SQLITE_OK &&
         sqlite3_create_function_v2(db, "fi_glob", 2, flags, nullptr, GlobFunction, nullptr, nullptr,
                                    nullptr) == SQLITE_OK;
}

bool IndexReader::Select(const Condition& condition, const SelectOptions& options, Selection& out) {
  SqlBuilder builder;
  std::string where = builder.Build(Simplified(condition));
  if (options.folders != nullptr)
    where = "(" + where + " AND " + builder.In("e.folder", *options.folders) + ")";
  out.total = 0;
  out.hits.clear();
  {
    Statement count(m_db, ("SELECT count(*) FROM entries e WHERE " + where).c_str());
    if (!count.ok()) return Fail("select");
    builder.BindAll(count);
    if (count.Step() != SQLITE_ROW) return Fail("select");
    out.total = static_cast<std::uint64_t>(count.Int(0));
  }
  if (options.size == 0 || options.from >= out.total) return true;
  // Rows come in the order the plan meets them, the same for the same query on the same
  // index, which is all that paging needs.
  Statement page(
      m_db, ("SELECT e.parent, e.name, e.is_dir, e.size, e.mtime, e.kind, e.folder FROM entries e WHERE " +
             where + " LIMIT " + std::to_string(options.size) + " OFFSET " + std::to_string(options.from))
                .c_str());
  if (!page.ok()) return Fail("select");
  builder.BindAll(page);
  int rc;
  while ((rc = page.Step()) == SQLITE_ROW) {
    Hit hit;
    hit.path = JoinPath(page.Text(0), page.Text(1));
    hit.isDir = page.Int(2) != 0;
    hit.size = page.Int(3);
    hit.mtime = page.Int(4);
    hit.kind = static_cast<Kind>(page.Int(5));
    hit.folder = page.Text(6);
    out.hits.push_back(std::move(hit));
  }
  return rc == SQLITE_DONE || Fail("select");
}

}  // namespace fileindex_store
