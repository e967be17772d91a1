// What a search asks of a share's index, independent of how a query was written (the
// Spotlight endpoint's query strings, the command line) and of the store that answers it.
#ifndef FILEINDEX_INDEX_SEARCH_CONDITION_H
#define FILEINDEX_INDEX_SEARCH_CONDITION_H

#include <sqlite3.h>

#include <cstdint>
#include <limits>
#include <string>
#include <vector>

namespace fileindex_store {

struct Condition {
  enum class Type {
    kAll,          // every entry
    kNone,         // no entry (a field the index does not have)
    kAnd,          // every child
    kOr,           // some child
    kNot,          // not the one child
    kNameGlob,     // the whole name matches `text`, a glob: '*' any run, '?' one character,
                   // '\' makes the next character literal; case and accents ignored
    kWords,        // the name holds the words of `text` in order, the last one a prefix
                   // when `prefix`; case and accents ignored
    kText,         // the file's extracted text holds the words of `text` in order, the last
                   // one a prefix when `prefix`
    kContentType,  // the content type matches `text` ("image/jpeg", "image/*")
    kSize,         // files whose size is within the range
    kModified,     // entries modified within the range (seconds since the epoch)
    kUnder,        // entries strictly below the directory `text` (relative to the share;
                   // "" is the share itself)
  };

  Type type = Type::kAll;
  std::vector<Condition> children;
  std::string text;
  bool prefix = false;
  // Ranges: inclusive bounds; the widest values mean "no bound".
  std::int64_t low = std::numeric_limits<std::int64_t>::min();
  std::int64_t high = std::numeric_limits<std::int64_t>::max();

  static Condition Of(Type type, std::string text = std::string()) {
    Condition condition;
    condition.type = type;
    condition.text = std::move(text);
    return condition;
  }
  static Condition Range(Type type, std::int64_t low, std::int64_t high) {
    Condition condition = Of(type);
    condition.low = low;
    condition.high = high;
    return condition;
  }
};

// The content type of a file by its extension (lower case, no dot); "application/octet-stream"
// when unknown. Directories are "text/directory".
const char* ContentTypeOfExtension(const std::string& extension);
extern const char kDirectoryContentType[];

// Whether a content type matches a pattern: equal, or "type/*" for the type's subtypes, or
// "*" / "*/*" for everything (case ignored).
bool ContentTypeMatches(const std::string& pattern, const std::string& contentType);

// Case and accents folded away, for comparing names as people type them.
std::string FoldForMatching(const std::string& utf8);

// Which folding FoldForMatching does: the ICU and Unicode versions it runs with. An index
// built on the folding of other versions has to be rebuilt.
std::string FoldingVersion();

// A glob matching exactly the literal text.
std::string EscapeGlob(const std::string& literal);

// The literal text a glob begins with, up to its first wildcard.
std::string GlobLiteralPrefix(const std::string& glob);

// Adds fi_fold(name) (FoldForMatching) and fi_glob(glob, name) (GlobMatches on the folded
// name) to a connection. Every connection to an index needs them: one of its indexes is
// built on fi_fold.
bool RegisterMatchingFunctions(sqlite3* db);

// Whether a folded name matches a folded glob (see kNameGlob).
bool GlobMatches(const std::string& glob, const std::string& name);

}  // namespace fileindex_store

#endif
