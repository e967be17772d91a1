// What is inside the indexed files: the metadata and text that the extraction worker found,
// kept beside the entries of the same index (keyed by the entry's id).
//
// fileindexd writes it through IndexWriter (content.cpp holds those methods); searches read
// it through ContentReader, a read-only connection of its own.
#ifndef FILEINDEX_INDEX_CONTENT_H
#define FILEINDEX_INDEX_CONTENT_H

#include <cstdint>
#include <memory>
#include <string>
#include <vector>

#include "store.h"

namespace fileindex_store {

// The layout of the index file, as PRAGMA user_version. An index of an older layout is
// migrated when the writer opens it; one of a newer layout is rebuilt. Readers refuse any
// other layout rather than misread it.
constexpr int kLayoutVersion = 3;

// At most this much text is kept per file, and per share in all.
constexpr std::size_t kMaxTextPerFile = 1 << 20;
constexpr std::int64_t kMaxTextPerShare = std::int64_t(1) << 30;

enum class ExtractState : int { kDone = 1, kFailed = 2, kSkipped = 3 };
const char* ExtractStateName(ExtractState state);

// The metadata of one file. Empty strings and zeros mean "not found in the file".
struct Content {
  ExtractState state = ExtractState::kDone;
  std::string mime;          // the content's type, as libmagic names it
  Kind kind = Kind::kOther;  // the kind the content turned out to be
  std::string reason;        // why extraction failed or was skipped
  std::string title, artist, album, genre;
  std::int64_t year = 0;
  std::int64_t durationMs = 0;
  std::int64_t width = 0, height = 0;
  std::string taken;  // "YYYY-MM-DD HH:MM:SS", the camera's clock
  std::string make, model;
  bool hasPosition = false;
  double latitude = 0, longitude = 0;
  std::string codecs;  // "h264, aac"
  std::string author;
  std::int64_t textBytes = 0;  // text kept in the full-text table
  bool textTruncated = false;
};

// A file whose content is still to be extracted (never done, or done for another version).
// entry.kind is the kind its name suggests; PutContent stores there the kind decided.
struct ContentCandidate {
  std::int64_t id = 0;
  Entry entry;
};

// Field filters of a content search; empty fields do not filter. Text fields match when
// the field holds the text (case-insensitive); `text` are words of the file's text.
struct ContentQuery {
  Query names;  // words of the name, kind, limit (names.words may be empty)
  std::string title, artist, album, genre, camera;
  std::string takenAfter, takenBefore;  // "YYYY-MM-DD[ HH:MM:SS]", inclusive
  std::int64_t year = 0;
  std::vector<std::string> text;
  bool Filters() const {
    return !title.empty() || !artist.empty() || !album.empty() || !genre.empty() || !camera.empty() ||
           !takenAfter.empty() || !takenBefore.empty() || year != 0 || !text.empty();
  }
};

// In a snippet, each matching word of the text stands between these two characters (which
// the stored text never holds), and a cut is marked by an ellipsis.
constexpr char kSnippetOpen = '\x02';
constexpr char kSnippetClose = '\x03';

struct ContentHit {
  Hit hit;
  bool hasContent = false;
  Content content;
  std::string snippet;  // a few words of the text around the matches, when text was searched
};

class ContentReader : public Database {
 public:
  // Opens an existing index read-only; null with error set when there is none or when
  // its layout is not this program's.
  static std::unique_ptr<ContentReader> Open(const std::string& dbDir, std::string& error);

  // Newest first, at most query.names.limit hits, each with its content when extracted.
  bool Search(const ContentQuery& query, std::vector<ContentHit>& hits);
  // The entry at a path relative to the share and its content, if any.
  bool Lookup(const std::string& path, Entry& entry, bool& found, Content& content, bool& hasContent);

 private:
  using Database::Database;
};

}  // namespace fileindex_store

#endif
