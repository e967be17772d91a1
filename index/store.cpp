#include "store.h"

#include <fcntl.h>
#include <sys/stat.h>
#include <unistd.h>

#include <cctype>
#include <cstring>
#include <unordered_map>

#include "content.h"

namespace fileindex_store {

namespace {

const char kIndexFileName[] = "index.sqlite3";
const int kSchemaVersion = 1;
const int kBusyTimeoutMs = 5000;

const char kSchema[] =
    "CREATE TABLE IF NOT EXISTS meta(key TEXT PRIMARY KEY, value TEXT NOT NULL) WITHOUT ROWID;"
    "CREATE TABLE IF NOT EXISTS entries("
    "  id INTEGER PRIMARY KEY,"
    "  parent TEXT NOT NULL, name TEXT NOT NULL, ext TEXT NOT NULL,"
    "  is_dir INTEGER NOT NULL, size INTEGER NOT NULL, mtime INTEGER NOT NULL,"
    "  kind INTEGER NOT NULL, folder TEXT NOT NULL);"
    "CREATE UNIQUE INDEX IF NOT EXISTS entries_by_place ON entries(parent, name);"
    // Searches by content type count and page through one extension's files at a time.
    "CREATE INDEX IF NOT EXISTS entries_by_type ON entries(ext, is_dir);"
    // Searches by the start of a name, case and accents ignored, take a range of this.
    "CREATE INDEX IF NOT EXISTS entries_by_folded_name ON entries(fi_fold(name));"
    // Names only; the rows live in entries (an external-content index that the writer
    // keeps in step, statement by statement). Not by triggers: a statement that fires a
    // trigger opens a statement savepoint, and the full-text index writes out its pending
    // terms at every savepoint, so a trigger made each row a segment of its own to merge.
    "CREATE VIRTUAL TABLE IF NOT EXISTS names USING fts5(name, content='entries', content_rowid='id',"
    "  tokenize='unicode61 remove_diacritics 2', prefix='2 3');"
    "DROP TRIGGER IF EXISTS entries_added;"
    "DROP TRIGGER IF EXISTS entries_removed;"
    "DROP TRIGGER IF EXISTS entries_renamed;"
    "CREATE TABLE IF NOT EXISTS folders(path TEXT PRIMARY KEY, document INTEGER NOT NULL,"
    "  audio INTEGER NOT NULL, video INTEGER NOT NULL, photo INTEGER NOT NULL,"
    "  crawled INTEGER NOT NULL) WITHOUT ROWID;";

const std::unordered_map<std::string, Kind>& ExtensionKinds() {
  static const std::unordered_map<std::string, Kind> kinds = [] {
    std::unordered_map<std::string, Kind> map;
    for (const char* ext :
         {"txt", "md",  "pdf", "doc",  "docx", "odt", "ods", "odp",  "xls",   "xlsx",    "ppt", "pptx",
          "rtf", "csv", "tex", "epub", "html", "htm", "xml", "json", "pages", "numbers", "key", "log"})
      map[ext] = Kind::kDocument;
    for (const char* ext : {"mp3", "flac", "ogg", "oga", "opus", "wav", "m4a", "aac", "wma", "aiff", "aif",
                            "ape", "alac", "mka", "mid", "midi"})
      map[ext] = Kind::kAudio;
    for (const char* ext : {"mp4", "mkv", "avi", "mov", "wmv", "m4v", "webm", "mpg", "mpeg", "ts", "m2ts",
                            "3gp", "flv", "vob", "ogv"})
      map[ext] = Kind::kVideo;
    for (const char* ext : {"jpg", "jpeg", "png", "gif", "bmp", "tif", "tiff", "webp", "heic", "heif", "raw",
                            "cr2", "cr3", "nef", "arw", "dng", "orf", "rw2", "svg"})
      map[ext] = Kind::kPhoto;
    return map;
  }();
  return kinds;
}

}  // namespace

const char* KindName(Kind kind) {
  switch (kind) {
    case Kind::kDocument:
      return "document";
    case Kind::kAudio:
      return "audio";
    case Kind::kVideo:
      return "video";
    case Kind::kPhoto:
      return "photo";
    case Kind::kOther:
      break;
  }
  return "other";
}

bool KindFromName(const std::string& name, Kind& kind) {
  for (Kind candidate : {Kind::kOther, Kind::kDocument, Kind::kAudio, Kind::kVideo, Kind::kPhoto}) {
    if (name == KindName(candidate)) {
      kind = candidate;
      return true;
    }
  }
  return false;
}

std::string ExtensionOf(const std::string& name) {
  std::string::size_type dot = name.rfind('.');
  if (dot == std::string::npos || dot == 0 || dot + 1 == name.size()) return "";
  std::string ext = name.substr(dot + 1);
  for (char& c : ext) c = static_cast<char>(std::tolower(static_cast<unsigned char>(c)));
  return ext;
}

Kind KindOfExtension(const std::string& extension) {
  auto it = ExtensionKinds().find(extension);
  return it == ExtensionKinds().end() ? Kind::kOther : it->second;
}

std::string JoinPath(const std::string& parent, const std::string& name) {
  return parent.empty() ? name : parent + "/" + name;
}

std::string IndexFilePath(const std::string& dbDir) { return dbDir + "/" + kIndexFileName; }

std::string MatchExpression(const std::vector<std::string>& words) {
  std::string expression;
  for (const std::string& word : words) {
    bool hasWordCharacter = false;
    for (unsigned char c : word) hasWordCharacter = hasWordCharacter || std::isalnum(c) || c >= 0x80;
    if (!hasWordCharacter) continue;
    if (!expression.empty()) expression += " AND ";
    expression += '"';
    for (char c : word) expression += c == '"' ? std::string("\"\"") : std::string(1, c);
    expression += "\"*";
  }
  return expression;
}

Database::~Database() {
  m_statements.clear();
  sqlite3_close_v2(m_db);
}

namespace {
bool IsDamage(int code) {
  code &= 0xff;
  return code == SQLITE_CORRUPT || code == SQLITE_NOTADB;
}
}  // namespace

bool Database::Fail(const char* what) {
  m_error = std::string(what) + ": " + sqlite3_errmsg(m_db);
  m_damaged = IsDamage(sqlite3_errcode(m_db));
  return false;
}

bool Database::Exec(const char* sql) {
  char* message = nullptr;
  if (sqlite3_exec(m_db, sql, nullptr, nullptr, &message) == SQLITE_OK) return true;
  m_error = message != nullptr ? message : sqlite3_errmsg(m_db);
  m_damaged = IsDamage(sqlite3_errcode(m_db));
  sqlite3_free(message);
  return false;
}

// Statements are prepared once per connection, keyed by their text's address.
Statement* Database::Prepare(const char* sql) {
  auto it = m_statements.find(sql);
  if (it == m_statements.end()) {
    auto statement = std::make_unique<Statement>(m_db, sql);
    if (!statement->ok()) {
      Fail("prepare");
      return nullptr;
    }
    it = m_statements.emplace(sql, std::move(statement)).first;
  }
  return &it->second->Reset();
}

std::unique_ptr<IndexWriter> IndexWriter::Open(const std::string& dbDir, std::string& error) {
  bool damaged = false;
  std::unique_ptr<IndexWriter> writer = OpenFile(dbDir, error, damaged);
  if (writer || !damaged) return writer;
  // Everything an index holds can be found again on disk; the damaged file is kept for
  // whoever wants to look into it.
  const std::string why = error;
  if (!SetAside(dbDir, error)) return nullptr;
  writer = OpenFile(dbDir, error, damaged);
  if (writer) writer->m_setAsideNote = why + "; it is kept as " + IndexFilePath(dbDir) + ".damaged";
  return writer;
}

bool IndexWriter::SetAside(const std::string& dbDir, std::string& error) {
  const std::string file = IndexFilePath(dbDir);
  for (const char* suffix : {"", "-wal"}) {
    const std::string from = file + suffix, to = file + ".damaged" + suffix;
    if (::rename(from.c_str(), to.c_str()) != 0 && errno != ENOENT) {
      error = from + ": " + std::strerror(errno);
      return false;
    }
  }
  ::unlink((file + "-shm").c_str());
  return true;
}

std::unique_ptr<IndexWriter> IndexWriter::OpenFile(const std::string& dbDir, std::string& error,
                                                   bool& damaged) {
  // File names are private: only the owner (root) may list or read the index.
  if (::mkdir(dbDir.c_str(), 0700) != 0 && errno != EEXIST) {
    error = dbDir + ": " + std::strerror(errno);
    return nullptr;
  }
  struct stat st;
  if (::lstat(dbDir.c_str(), &st) != 0 || !S_ISDIR(st.st_mode)) {
    error = dbDir + ": not a directory";
    return nullptr;
  }
  if ((st.st_mode & 07777) != 0700 && ::chmod(dbDir.c_str(), 0700) != 0) {
    error = dbDir + ": " + std::strerror(errno);
    return nullptr;
  }
  sqlite3* db = nullptr;
  const std::string file = IndexFilePath(dbDir);
  int rc = sqlite3_open_v2(file.c_str(), &db,
                           SQLITE_OPEN_READWRITE | SQLITE_OPEN_CREATE | SQLITE_OPEN_NOFOLLOW, nullptr);
  std::unique_ptr<IndexWriter> writer(new IndexWriter(db));
  if (rc != SQLITE_OK) {
    error = file + ": " + (db != nullptr ? sqlite3_errmsg(db) : sqlite3_errstr(rc));
    damaged = IsDamage(rc);
    return nullptr;
  }
  sqlite3_busy_timeout(db, kBusyTimeoutMs);
  if (writer->LayoutVersion() > kLayoutVersion) {
    // Written by a newer program: what it holds cannot be trusted to mean what this one
    // thinks, and all of it can be found again on disk.
    writer.reset();
    for (const char* suffix : {"", "-wal", "-shm"}) ::unlink((file + suffix).c_str());
    return OpenFile(dbDir, error, damaged);
  }
  const std::string pragmas = "PRAGMA journal_mode=WAL; PRAGMA synchronous=NORMAL; PRAGMA foreign_keys=OFF;";
  if (!RegisterMatchingFunctions(db)) {
    error = file + ": " + sqlite3_errmsg(db);
    return nullptr;
  }
  if (!writer->Exec(pragmas.c_str()) || !writer->Exec(kSchema) || !writer->UpgradeLayout()) {
    error = file + ": " + writer->LastError();
    damaged = writer->IsDamaged();
    return nullptr;
  }
  Statement* version = writer->Prepare("INSERT OR IGNORE INTO meta(key, value) VALUES ('schema', ?)");
  if (version == nullptr || version->Bind(std::to_string(kSchemaVersion)).Step() != SQLITE_DONE ||
      !writer->KeepFoldedNamesInStep()) {
    error = file + ": " + writer->LastError();
    damaged = writer->IsDamaged();
    return nullptr;
  }
  return writer;
}

bool IndexWriter::KeepFoldedNamesInStep() {
  // The folded-name index holds each name as this ICU folds it. Built by another ICU
  // (an upgrade), its order is not the one searches seek in, and names would be missed:
  // it is built again, once, from the names.
  const std::string folding = FoldingVersion();
  Statement* stored = Prepare("SELECT value FROM meta WHERE key = 'folding'");
  if (stored == nullptr) return false;
  const int rc = stored->Step();
  if (rc == SQLITE_ROW && stored->Text(0) == folding) return true;
  if (rc != SQLITE_ROW && rc != SQLITE_DONE) return Fail("read folding");
  stored->Reset();
  Statement* store = Prepare("INSERT OR REPLACE INTO meta(key, value) VALUES ('folding', ?)");
  if (store == nullptr || !Begin()) return false;
  if (Exec("REINDEX entries_by_folded_name") && store->Bind(folding).Step() == SQLITE_DONE && Commit())
    return true;
  Rollback();
  return false;
}

bool IndexWriter::Begin() { return Exec("BEGIN IMMEDIATE"); }
bool IndexWriter::Commit() { return Exec("COMMIT"); }
void IndexWriter::Rollback() {
  m_textBytes = -1;
  m_stringIds.clear();  // some may have been added by what is undone
  if (!sqlite3_get_autocommit(m_db)) Exec("ROLLBACK");
}

namespace {
const char kEntryColumns[] = "parent, name, is_dir, size, mtime, kind, folder";

Entry EntryFromRow(const Statement& row) {
  Entry entry;
  entry.parent = row.Text(0);
  entry.name = row.Text(1);
  entry.isDir = row.Int(2) != 0;
  entry.size = row.Int(3);
  entry.mtime = row.Int(4);
  entry.kind = static_cast<Kind>(row.Int(5));
  entry.folder = row.Text(6);
  return entry;
}
}  // namespace

bool IndexWriter::ListChildren(const std::string& parent, std::vector<Entry>& out) {
  static const std::string sql = std::string("SELECT ") + kEntryColumns + " FROM entries WHERE parent = ?";
  Statement* statement = Prepare(sql.c_str());
  if (statement == nullptr) return false;
  statement->Bind(parent);
  int rc;
  while ((rc = statement->Step()) == SQLITE_ROW) out.push_back(EntryFromRow(*statement));
  return rc == SQLITE_DONE || Fail("list");
}

bool IndexWriter::Find(const std::string& parent, const std::string& name, Entry& out, bool& found) {
  static const std::string sql =
      std::string("SELECT ") + kEntryColumns + " FROM entries WHERE parent = ? AND name = ?";
  Statement* statement = Prepare(sql.c_str());
  if (statement == nullptr) return false;
  int rc = statement->Bind(parent).Bind(name).Step();
  found = rc == SQLITE_ROW;
  if (found) out = EntryFromRow(*statement);
  return rc == SQLITE_ROW || rc == SQLITE_DONE || Fail("find");
}

// A new entry is inserted together with its name in the full-text index; a known one is
// updated in place (its place, and so its name, never changes).
bool IndexWriter::Put(const Entry& entry) {
  Statement* insert = Prepare(
      "INSERT INTO entries(parent, name, ext, is_dir, size, mtime, kind, folder) VALUES (?, ?, ?, ?, ?, ?, "
      "?, ?) ON CONFLICT(parent, name) DO NOTHING");
  if (insert == nullptr) return false;
  const std::string ext = entry.isDir ? std::string() : ExtensionOf(entry.name);
  insert->Bind(entry.parent)
      .Bind(entry.name)
      .Bind(ext)
      .Bind(static_cast<std::int64_t>(entry.isDir))
      .Bind(entry.size)
      .Bind(entry.mtime)
      .Bind(static_cast<std::int64_t>(entry.kind))
      .Bind(entry.folder);
  if (insert->Step() != SQLITE_DONE) return Fail("put");
  if (sqlite3_changes(m_db) == 1) {
    const std::int64_t id = sqlite3_last_insert_rowid(m_db);
    Statement* name = Prepare("INSERT INTO names(rowid, name) VALUES (?, ?)");
    if (name == nullptr) return false;
    return name->Bind(id).Bind(entry.name).Step() == SQLITE_DONE || Fail("put");
  }
  Statement* update = Prepare(
      "UPDATE entries SET ext = ?, is_dir = ?, size = ?, mtime = ?, kind = ?, folder = ?"
      " WHERE parent = ? AND name = ?");
  if (update == nullptr) return false;
  update->Bind(ext)
      .Bind(static_cast<std::int64_t>(entry.isDir))
      .Bind(entry.size)
      .Bind(entry.mtime)
      .Bind(static_cast<std::int64_t>(entry.kind))
      .Bind(entry.folder)
      .Bind(entry.parent)
      .Bind(entry.name);
  return update->Step() == SQLITE_DONE || Fail("put");
}

bool IndexWriter::UnindexName(std::int64_t id, const std::string& name) {
  Statement* statement = Prepare("INSERT INTO names(names, rowid, name) VALUES ('delete', ?, ?)");
  if (statement == nullptr) return false;
  return statement->Bind(id).Bind(name).Step() == SQLITE_DONE || Fail("remove");
}

bool IndexWriter::Remove(const std::string& parent, const std::string& name) {
  Statement* statement = Prepare("DELETE FROM entries WHERE parent = ? AND name = ? RETURNING id, is_dir");
  if (statement == nullptr) return false;
  int rc = statement->Bind(parent).Bind(name).Step();
  const bool found = rc == SQLITE_ROW;
  const std::int64_t id = found ? statement->Int(0) : 0;
  const bool wasDir = found && statement->Int(1) != 0;
  while (rc == SQLITE_ROW) rc = statement->Step();
  if (rc != SQLITE_DONE) return Fail("remove");
  if (found && (!UnindexName(id, name) || !DropContent(id))) return false;
  return !wasDir || RemoveBelow(JoinPath(parent, name));
}

bool IndexWriter::RemoveBelow(const std::string& dir) {
  if (dir.empty()) {
    m_textBytes = -1;
    return Exec(
        "DELETE FROM entries; INSERT INTO names(names) VALUES ('delete-all'); DELETE FROM contents;"
        " DELETE FROM texts;");
  }
  // Everything in dir, and in directories whose path begins with dir + "/": a range of
  // the (parent, name) index, since "0" sorts right after "/". The names leave the
  // full-text index row by row first (read back as they go, so a huge subtree needs no
  // memory), then the rows go in one statement.
  Statement* rows = Prepare(
      "SELECT id, name FROM entries WHERE parent = ?1 OR (parent >= ?1 || '/' AND parent < ?1 || '0')");
  if (rows == nullptr) return false;
  rows->Bind(dir);
  int rc;
  while ((rc = rows->Step()) == SQLITE_ROW) {
    if (!UnindexName(rows->Int(0), rows->Text(1)) || !DropContent(rows->Int(0))) return false;
  }
  if (rc != SQLITE_DONE) return Fail("remove below");
  Statement* statement =
      Prepare("DELETE FROM entries WHERE parent = ?1 OR (parent >= ?1 || '/' AND parent < ?1 || '0')");
  if (statement == nullptr) return false;
  return statement->Bind(dir).Step() == SQLITE_DONE || Fail("remove below");
}

bool IndexWriter::Folders(std::vector<FolderState>& out) {
  Statement* statement = Prepare("SELECT path, document, audio, video, photo, crawled FROM folders");
  if (statement == nullptr) return false;
  int rc;
  while ((rc = statement->Step()) == SQLITE_ROW) {
    FolderState folder;
    folder.path = statement->Text(0);
    folder.document = statement->Int(1) != 0;
    folder.audio = statement->Int(2) != 0;
    folder.video = statement->Int(3) != 0;
    folder.photo = statement->Int(4) != 0;
    folder.crawled = statement->Int(5) != 0;
    out.push_back(folder);
  }
  return rc == SQLITE_DONE || Fail("folders");
}

bool IndexWriter::PutFolder(const FolderState& folder) {
  Statement* statement = Prepare(
      "INSERT OR REPLACE INTO folders(path, document, audio, video, photo, crawled) VALUES (?, ?, ?, ?, ?, "
      "?)");
  if (statement == nullptr) return false;
  statement->Bind(folder.path)
      .Bind(static_cast<std::int64_t>(folder.document))
      .Bind(static_cast<std::int64_t>(folder.audio))
      .Bind(static_cast<std::int64_t>(folder.video))
      .Bind(static_cast<std::int64_t>(folder.photo))
      .Bind(static_cast<std::int64_t>(folder.crawled));
  return statement->Step() == SQLITE_DONE || Fail("put folder");
}

bool IndexWriter::RemoveFolder(const std::string& path) {
  Statement* statement = Prepare("DELETE FROM folders WHERE path = ?");
  if (statement == nullptr) return false;
  return statement->Bind(path).Step() == SQLITE_DONE || Fail("remove folder");
}

void IndexWriter::Checkpoint() {
  sqlite3_wal_checkpoint_v2(m_db, nullptr, SQLITE_CHECKPOINT_TRUNCATE, nullptr, nullptr);
}

sqlite3* Database::OpenReadOnly(const std::string& dbDir, std::string& error) {
  const std::string file = IndexFilePath(dbDir);
  if (::access(file.c_str(), F_OK) != 0) {
    error = file + ": " + std::strerror(errno);
    return nullptr;
  }
  sqlite3* db = nullptr;
  int rc = sqlite3_open_v2(file.c_str(), &db, SQLITE_OPEN_READONLY | SQLITE_OPEN_NOFOLLOW, nullptr);
  if (rc == SQLITE_OK) {
    sqlite3_busy_timeout(db, kBusyTimeoutMs);
    if (RegisterMatchingFunctions(db)) return db;
  }
  error = file + ": " + (db != nullptr ? sqlite3_errmsg(db) : sqlite3_errstr(rc));
  sqlite3_close_v2(db);
  return nullptr;
}

std::unique_ptr<IndexReader> IndexReader::Open(const std::string& dbDir, std::string& error) {
  sqlite3* db = OpenReadOnly(dbDir, error);
  if (db == nullptr) return nullptr;
  std::unique_ptr<IndexReader> reader(new IndexReader(db));
  Statement layout(db, "PRAGMA user_version");
  if (!layout.ok() || layout.Step() != SQLITE_ROW || layout.Int(0) > kLayoutVersion) {
    error = IndexFilePath(dbDir) + ": index layout " +
            (layout.ok() ? std::to_string(layout.Int(0)) : "unreadable") + " is not this program's (" +
            std::to_string(kLayoutVersion) + "); fileindexd rebuilds it";
    return nullptr;
  }
  return reader;
}

bool IndexReader::Search(const Query& query, std::vector<Hit>& hits) {
  const std::string match = MatchExpression(query.words);
  Statement* statement;
  if (match.empty()) {
    statement = Prepare(
        "SELECT parent, name, is_dir, size, mtime, kind, folder FROM entries"
        " WHERE (?1 OR (kind = ?2 AND is_dir = 0)) ORDER BY mtime DESC LIMIT ?3");
  } else {
    statement = Prepare(
        "SELECT e.parent, e.name, e.is_dir, e.size, e.mtime, e.kind, e.folder"
        " FROM names JOIN entries e ON e.id = names.rowid"
        " WHERE (?1 OR (e.kind = ?2 AND e.is_dir = 0)) AND names MATCH ?4 ORDER BY e.mtime DESC LIMIT ?3");
  }
  if (statement == nullptr) return false;
  statement->Bind(static_cast<std::int64_t>(query.anyKind))
      .Bind(static_cast<std::int64_t>(query.kind))
      .Bind(static_cast<std::int64_t>(query.limit));
  if (!match.empty()) statement->Bind(match);
  int rc;
  while ((rc = statement->Step()) == SQLITE_ROW) {
    Entry entry = EntryFromRow(*statement);
    Hit hit;
    hit.path = JoinPath(entry.parent, entry.name);
    hit.isDir = entry.isDir;
    hit.size = entry.size;
    hit.mtime = entry.mtime;
    hit.kind = entry.kind;
    hit.folder = entry.folder;
    hits.push_back(std::move(hit));
  }
  return rc == SQLITE_DONE || Fail("search");
}

bool IndexReader::CountByFolder(std::map<std::string, std::uint64_t>& counts) {
  Statement* statement = Prepare("SELECT folder, count(*) FROM entries GROUP BY folder");
  if (statement == nullptr) return false;
  int rc;
  while ((rc = statement->Step()) == SQLITE_ROW)
    counts[statement->Text(0)] = static_cast<std::uint64_t>(statement->Int(1));
  return rc == SQLITE_DONE || Fail("count");
}

bool IndexReader::AppliedFolders(std::vector<std::string>& out) {
  Statement* statement = Prepare("SELECT path FROM folders");
  if (statement == nullptr) return false;
  int rc;
  while ((rc = statement->Step()) == SQLITE_ROW) out.push_back(statement->Text(0));
  return rc == SQLITE_DONE || Fail("folders");
}

}  // namespace fileindex_store
