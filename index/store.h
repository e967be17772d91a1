// The per-share index store: one SQLite database (WAL mode) in the share's database
// directory, with a full-text index over file and directory names.
//
// fileindexd is its only writer (IndexWriter); searches open it read-only (IndexReader).
// Paths inside the store are relative to the share directory ("" is the share itself),
// so a share whose name changes keeps its index as it is.
#ifndef FILEINDEX_INDEX_STORE_H
#define FILEINDEX_INDEX_STORE_H

#include <sqlite3.h>

#include <cstdint>
#include <map>
#include <memory>
#include <string>
#include <unordered_map>
#include <vector>

#include "search_condition.h"

namespace fileindex_store {

// The kinds of file a folder's four flags switch on and off, and the rest.
enum class Kind : int { kOther = 0, kDocument = 1, kAudio = 2, kVideo = 3, kPhoto = 4 };

const char* KindName(Kind kind);
bool KindFromName(const std::string& name, Kind& kind);
// The extension of a file name, lower-cased ASCII, without the dot; "" when none.
std::string ExtensionOf(const std::string& name);
// The kind of a file, decided by its extension.
Kind KindOfExtension(const std::string& extension);

struct Content;
struct ContentCandidate;

struct Entry {
  std::string parent;  // directory holding the entry, relative to the share ("" at its top)
  std::string name;
  bool isDir = false;
  std::int64_t size = 0;
  std::int64_t mtime = 0;  // seconds since the epoch
  Kind kind = Kind::kOther;
  std::string folder;  // the indexed folder governing the entry, relative to the share
};

// A folder as the index last applied it.
struct FolderState {
  std::string path;  // relative to the share
  bool document = false, audio = false, video = false, photo = false;
  bool crawled = false;  // its first full crawl completed
};

std::string JoinPath(const std::string& parent, const std::string& name);

// The database file inside a share's database directory.
std::string IndexFilePath(const std::string& dbDir);

// A prepared statement, reset for each use; binds left to right.
class Statement {
 public:
  Statement(sqlite3* db, const char* sql) {
    m_ok = sqlite3_prepare_v3(db, sql, -1, SQLITE_PREPARE_PERSISTENT, &m_stmt, nullptr) == SQLITE_OK;
  }
  Statement(const Statement&) = delete;
  Statement& operator=(const Statement&) = delete;
  ~Statement() { sqlite3_finalize(m_stmt); }
  bool ok() const { return m_ok; }
  Statement& Reset() {
    sqlite3_reset(m_stmt);
    sqlite3_clear_bindings(m_stmt);
    m_index = 0;
    return *this;
  }
  Statement& Bind(const std::string& text) {
    sqlite3_bind_text(m_stmt, ++m_index, text.data(), static_cast<int>(text.size()), SQLITE_TRANSIENT);
    return *this;
  }
  Statement& Bind(std::int64_t value) {
    sqlite3_bind_int64(m_stmt, ++m_index, value);
    return *this;
  }
  Statement& Bind(double value) {
    sqlite3_bind_double(m_stmt, ++m_index, value);
    return *this;
  }
  Statement& BindNull() {
    sqlite3_bind_null(m_stmt, ++m_index);
    return *this;
  }
  bool IsNull(int column) const { return sqlite3_column_type(m_stmt, column) == SQLITE_NULL; }
  sqlite3_stmt* Raw() const { return m_stmt; }
  // SQLITE_ROW, SQLITE_DONE or an error code.
  int Step() { return sqlite3_step(m_stmt); }
  std::string Text(int column) const {
    const unsigned char* text = sqlite3_column_text(m_stmt, column);
    return text != nullptr ? std::string(reinterpret_cast<const char*>(text),
                                         static_cast<std::size_t>(sqlite3_column_bytes(m_stmt, column)))
                           : std::string();
  }
  std::int64_t Int(int column) const { return sqlite3_column_int64(m_stmt, column); }

 private:
  sqlite3_stmt* m_stmt = nullptr;
  bool m_ok = false;
  int m_index = 0;
};

class Database {
 public:
  ~Database();
  Database(const Database&) = delete;
  Database& operator=(const Database&) = delete;
  const std::string& LastError() const { return m_error; }
  // Whether the last failure found the file damaged: not a database, or corrupt pages.
  bool IsDamaged() const { return m_damaged; }

 protected:
  explicit Database(sqlite3* db) : m_db(db) {}
  // An existing index opened read-only, with the matching functions every connection
  // needs; null with error set (and nothing left open) on failure.
  static sqlite3* OpenReadOnly(const std::string& dbDir, std::string& error);
  bool Exec(const char* sql);
  Statement* Prepare(const char* sql);
  bool Fail(const char* what);

  sqlite3* m_db;
  std::string m_error;
  bool m_damaged = false;
  std::map<const char*, std::unique_ptr<Statement>> m_statements;
};

class IndexWriter : public Database {
 public:
  // Opens (creating when needed) the index in dbDir; the directory is made private to
  // its owner. A damaged index is set aside and a new one started (see SetAside and
  // SetAsideNote). Null with error set on failure.
  static std::unique_ptr<IndexWriter> Open(const std::string& dbDir, std::string& error);
  // Moves the index of dbDir out of the way (as "index.sqlite3.damaged", replacing an
  // earlier one, with its write-ahead log), for a new one to be built from the disk.
  static bool SetAside(const std::string& dbDir, std::string& error);
  // When Open set a damaged index aside: what was wrong with it and where it is kept.
  const std::string& SetAsideNote() const { return m_setAsideNote; }

  bool Begin();
  bool Commit();
  void Rollback();

  bool ListChildren(const std::string& parent, std::vector<Entry>& out);
  bool Find(const std::string& parent, const std::string& name, Entry& out, bool& found);
  bool Put(const Entry& entry);
  // Removes the entry and, when it is a directory, everything below it.
  bool Remove(const std::string& parent, const std::string& name);
  // Removes everything below dir (dir's own entry stays).
  bool RemoveBelow(const std::string& dir);

  bool Folders(std::vector<FolderState>& out);
  bool PutFolder(const FolderState& folder);
  bool RemoveFolder(const std::string& path);

  // Flushes the write-ahead log into the database (at shutdown).
  void Checkpoint();

  // What is inside the files (content.h; defined in content.cpp).
  // Files after afterId (by id) whose content is to be extracted, at most limit, among the
  // next few thousand ids only (so that one call never scans a whole large index).
  // scannedTo is the id to go on after; atEnd says no id above it exists.
  bool PendingContent(std::int64_t afterId, std::size_t limit, std::vector<ContentCandidate>& out,
                      std::int64_t& scannedTo, bool& atEnd);
  // Stores a file's content when its entry is still the version extracted (stored false
  // otherwise), and candidate.entry.kind as the entry's kind; text beyond the caps is
  // dropped and marked truncated.
  bool PutContent(const ContentCandidate& candidate, const Content& content, const std::string& text,
                  bool& stored);
  bool DropContent(std::int64_t id);
  // The entry's content, if any, is forgotten: it is extracted again.
  bool ForgetContent(const std::string& parent, const std::string& name);
  // The files of folder kept by their names only because their content's kind was switched
  // off are extracted again (after the folder's flags changed); changed counts them.
  bool ForgetKindSkipped(const std::string& folder, std::uint64_t& changed);

 private:
  using Database::Database;
  // Takes an entry's name out of the full-text index (before or after its row goes).
  bool UnindexName(std::int64_t id, const std::string& name);
  // The layout version of an open index: 0 for none yet or the first layout.
  int LayoutVersion();
  // Creates the content tables, or moves an older layout's data on, and marks the layout
  // as current.
  bool UpgradeLayout();
  // Rebuilds the folded-name index when it was built with another folding.
  bool KeepFoldedNamesInStep();

  static std::unique_ptr<IndexWriter> OpenFile(const std::string& dbDir, std::string& error, bool& damaged);

  // The number of a type's or reason's text in the index, added when new.
  bool StringId(const std::string& text, std::int64_t& id);

  std::int64_t m_textBytes = -1;                              // text kept in all; -1 until first needed
  std::unordered_map<std::string, std::int64_t> m_stringIds;  // as committed or in this transaction
  std::string m_setAsideNote;
};

struct Query {
  std::vector<std::string> words;  // every word must begin a word of the name
  bool anyKind = true;
  Kind kind = Kind::kOther;  // when !anyKind: only files of this kind
  std::size_t limit = 50;
};

struct Hit {
  std::string path;  // relative to the share
  bool isDir = false;
  std::int64_t size = 0;
  std::int64_t mtime = 0;
  Kind kind = Kind::kOther;
  std::string folder;
};

class IndexReader : public Database {
 public:
  // Opens an existing index read-only; null with error set when there is none.
  static std::unique_ptr<IndexReader> Open(const std::string& dbDir, std::string& error);

  // Newest first, at most query.limit hits.
  bool Search(const Query& query, std::vector<Hit>& hits);
  // Indexed entries per governing folder.
  bool CountByFolder(std::map<std::string, std::uint64_t>& counts);

  struct SelectOptions {
    std::uint64_t from = 0;  // rows skipped
    std::size_t size = 50;   // rows returned at most
    // When set, only entries governed by one of these folders (relative to the share).
    const std::vector<std::string>* folders = nullptr;
  };
  struct Selection {
    std::uint64_t total = 0;  // every entry meeting the condition
    std::vector<Hit> hits;    // one page of them, in an order stable between pages
  };
  bool Select(const Condition& condition, const SelectOptions& options, Selection& out);
  // The folders whose entries the index holds, as the indexer last applied them.
  bool AppliedFolders(std::vector<std::string>& out);

 private:
  using Database::Database;
};

// The full-text query for a list of words: each word a quoted prefix phrase, all required.
// Empty when no word holds a letter or digit.
std::string MatchExpression(const std::vector<std::string>& words);

}  // namespace fileindex_store

#endif
