// The query strings that Samba's Spotlight service sends to an Elasticsearch backend,
// parsed into a search condition. It is the subset of Lucene's query syntax that Samba
// writes from a Finder query:
//
//   (file.filename:beach* AND NOT file.content_type:(image\/* text\/*)) OR beach*
//   file.filesize:{14 TO *}  file.last_modified:[2020\-01\-01T00\:00\:00Z TO *]
//   content:hello\ world     ... AND path.real.fulltext:"/srv/share"
//
// AND, OR, NOT (and &&, ||, !, +, -), parentheses, field groups, ranges with inclusive
// and exclusive ends, phrases, '*' and '?' wildcards and backslash escapes. Words placed
// side by side are alternatives, as with Elasticsearch's default operator. Fields that
// the index does not hold match nothing, as they would in a cluster without them.
#ifndef FILEINDEXD_SPOTLIGHT_QUERY_STRING_H
#define FILEINDEXD_SPOTLIGHT_QUERY_STRING_H

#include <search_condition.h>

#include <string>

namespace fileindexd {

// Limits on what a query may be: past them it is refused, never worked through.
constexpr std::size_t kMaxQueryBytes = 32 * 1024;
constexpr std::size_t kMaxTermBytes = 1024;
constexpr int kMaxQueryDepth = 32;

// Parses a query. The path scopes (path.real and path.real.fulltext) come out as kUnder
// conditions holding the absolute path; ScopeToShare makes them relative to a share.
bool ParseQueryString(const std::string& query, fileindex_store::Condition& out, std::string& error);

// The absolute path the query is scoped to: the first path scope that every match must
// meet (one joined to the rest with AND). False when there is none.
bool QueryScope(const fileindex_store::Condition& condition, std::string& path);

// Rewrites the path scopes for a share at shareDirectory: inside it they become paths
// relative to it ("" for the share itself), outside it they match nothing.
void ScopeToShare(fileindex_store::Condition& condition, const std::string& shareDirectory);

// Whether text is well-formed UTF-8.
bool IsUtf8(const std::string& text);

// A date as Elasticsearch reads one ("2020-01-01", "2020-01-01T10:00:00Z", with an
// optional fraction and offset): the first and last second it covers.
bool ParseDate(const std::string& text, long long& first, long long& last);

}  // namespace fileindexd

#endif
