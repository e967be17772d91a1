#include "content.h"

#include <unistd.h>

#include <algorithm>
#include <cerrno>
#include <cstring>

namespace fileindex_store {

namespace {

// One row per extracted file, for the version (mtime, size) it was extracted from; the
// text in a full-text table of its own whose rowid is the entry's id. Types and reasons
// repeat from file to file: a row holds the number of its text in content_strings.
const char kContentSchema[] =
    "CREATE TABLE IF NOT EXISTS content_strings(id INTEGER PRIMARY KEY, text TEXT NOT NULL UNIQUE);"
    "CREATE TABLE IF NOT EXISTS contents("
    "  id INTEGER PRIMARY KEY, mtime INTEGER NOT NULL, size INTEGER NOT NULL,"
    "  state INTEGER NOT NULL, mime INTEGER NOT NULL, kind INTEGER NOT NULL, reason INTEGER NOT NULL,"
    "  title TEXT, artist TEXT, album TEXT, genre TEXT, year INTEGER, duration_ms INTEGER,"
    "  width INTEGER, height INTEGER, taken TEXT, make TEXT, model TEXT,"
    "  latitude REAL, longitude REAL, codecs TEXT, author TEXT,"
    "  text_bytes INTEGER NOT NULL, text_truncated INTEGER NOT NULL);"
    "CREATE INDEX IF NOT EXISTS contents_by_taken ON contents(taken) WHERE taken IS NOT NULL;"
    "CREATE VIRTUAL TABLE IF NOT EXISTS texts USING fts5(body, tokenize='unicode61 remove_diacritics 2');";

const char kContentColumns[] =
    "c.state, (SELECT text FROM content_strings WHERE id = c.mime), c.kind,"
    " (SELECT text FROM content_strings WHERE id = c.reason),"
    " c.title, c.artist, c.album, c.genre, c.year, c.duration_ms,"
    " c.width, c.height, c.taken, c.make, c.model, c.latitude, c.longitude, c.codecs, c.author,"
    " c.text_bytes, c.text_truncated";

const int kContentColumnCount = 21;

// The columns of kContentColumns, read from `first` on.
Content ContentFromRow(sqlite3_stmt* row, int first) {
  auto text = [row](int column) {
    const unsigned char* value = sqlite3_column_text(row, column);
    return value != nullptr ? std::string(reinterpret_cast<const char*>(value),
                                          static_cast<std::size_t>(sqlite3_column_bytes(row, column)))
                            : std::string();
  };
  int c = first;
  Content content;
  content.state = static_cast<ExtractState>(sqlite3_column_int(row, c++));
  content.mime = text(c++);
  content.kind = static_cast<Kind>(sqlite3_column_int(row, c++));
  content.reason = text(c++);
  content.title = text(c++);
  content.artist = text(c++);
  content.album = text(c++);
  content.genre = text(c++);
  content.year = sqlite3_column_int64(row, c++);
  content.durationMs = sqlite3_column_int64(row, c++);
  content.width = sqlite3_column_int64(row, c++);
  content.height = sqlite3_column_int64(row, c++);
  content.taken = text(c++);
  content.make = text(c++);
  content.model = text(c++);
  content.hasPosition = sqlite3_column_type(row, c) != SQLITE_NULL;
  content.latitude = sqlite3_column_double(row, c++);
  content.longitude = sqlite3_column_double(row, c++);
  content.codecs = text(c++);
  content.author = text(c++);
  content.textBytes = sqlite3_column_int64(row, c++);
  content.textTruncated = sqlite3_column_int(row, c++) != 0;
  return content;
}

// The longest prefix of text of at most max bytes that does not end inside a UTF-8 sequence.
std::size_t Utf8Prefix(const std::string& text, std::size_t max) {
  if (text.size() <= max) return text.size();
  std::size_t end = max;
  while (end > 0 && (static_cast<unsigned char>(text[end]) & 0xC0) == 0x80) --end;
  return end;
}

std::string LikePattern(const std::string& text) {
  std::string pattern = "%";
  for (char c : text) {
    if (c == '%' || c == '_' || c == '\\') pattern += '\\';
    pattern += c;
  }
  return pattern + "%";
}

}  // namespace

const char* ExtractStateName(ExtractState state) {
  switch (state) {
    case ExtractState::kDone:
      return "extracted";
    case ExtractState::kFailed:
      return "failed";
    case ExtractState::kSkipped:
      return "skipped";
  }
  return "unknown";
}

int IndexWriter::LayoutVersion() {
  Statement statement(m_db, "PRAGMA user_version");
  return statement.ok() && statement.Step() == SQLITE_ROW ? static_cast<int>(statement.Int(0)) : 0;
}

// Layout 1 (entries and names only) gains the content tables; everything it held keeps
// its meaning, and every file's content is then extracted afresh. In layout 2 an entry's
// kind was always its name's; from layout 3 on it is the kind its content was found to be,
// which layout 2 kept beside the content.
bool IndexWriter::UpgradeLayout() {
  const int version = LayoutVersion();
  if (version == kLayoutVersion) return true;
  std::string upgrade = "BEGIN IMMEDIATE;";
  if (version == 2) {
    upgrade +=
        "UPDATE entries SET kind = (SELECT c.kind FROM contents c WHERE c.id = entries.id)"
        " WHERE id IN (SELECT c.id FROM contents c JOIN entries e ON e.id = c.id WHERE c.state != 3"
        " AND c.kind != 0 AND c.kind != e.kind AND c.mtime = e.mtime AND c.size = e.size);"
        "ALTER TABLE contents RENAME TO contents_2;"
        "DROP INDEX IF EXISTS contents_by_taken;";
  }
  upgrade += kContentSchema;
  if (version == 2) {
    upgrade +=
        "INSERT OR IGNORE INTO content_strings(text) SELECT mime FROM contents_2 UNION SELECT reason"
        " FROM contents_2;"
        "INSERT INTO contents SELECT id, mtime, size, state,"
        " (SELECT s.id FROM content_strings s WHERE s.text = o.mime), kind,"
        " (SELECT s.id FROM content_strings s WHERE s.text = o.reason), title, artist, album, genre, year,"
        " duration_ms, width, height, taken, make, model, latitude, longitude, codecs, author, text_bytes,"
        " text_truncated FROM contents_2 o;"
        "DROP TABLE contents_2;";
  }
  upgrade += "PRAGMA user_version=" + std::to_string(kLayoutVersion) + "; COMMIT;";
  if (Exec(upgrade.c_str())) return true;
  Rollback();
  return false;
}

bool IndexWriter::PendingContent(std::int64_t afterId, std::size_t limit, std::vector<ContentCandidate>& out,
                                 std::int64_t& scannedTo, bool& atEnd) {
  const std::int64_t kWindow = 4096;
  Statement* statement = Prepare(
      "SELECT e.id, e.parent, e.name, e.size, e.mtime, e.kind, e.folder FROM entries e"
      " LEFT JOIN contents c ON c.id = e.id"
      " WHERE e.id > ?1 AND e.id <= ?1 + ?3 AND e.is_dir = 0"
      "   AND (c.id IS NULL OR c.mtime != e.mtime OR c.size != e.size)"
      " ORDER BY e.id LIMIT ?2");
  if (statement == nullptr) return false;
  const std::size_t before = out.size();
  statement->Bind(afterId).Bind(static_cast<std::int64_t>(limit)).Bind(kWindow);
  int rc;
  while ((rc = statement->Step()) == SQLITE_ROW) {
    ContentCandidate candidate;
    candidate.id = statement->Int(0);
    candidate.entry.parent = statement->Text(1);
    candidate.entry.name = statement->Text(2);
    candidate.entry.size = statement->Int(3);
    candidate.entry.mtime = statement->Int(4);
    candidate.entry.kind = static_cast<Kind>(statement->Int(5));
    candidate.entry.folder = statement->Text(6);
    out.push_back(std::move(candidate));
  }
  if (rc != SQLITE_DONE) return Fail("pending content");
  Statement* last = Prepare("SELECT coalesce(max(id), 0) FROM entries");
  if (last == nullptr || last->Step() != SQLITE_ROW) return Fail("pending content");
  const std::int64_t maxId = last->Int(0);
  // Never past the last id there is: entries added later get the ids above it.
  scannedTo =
      out.size() - before == limit ? out.back().id : std::min(afterId + kWindow, std::max(maxId, afterId));
  atEnd = scannedTo >= maxId;
  return true;
}

bool IndexWriter::DropContent(std::int64_t id) {
  Statement* statement = Prepare("DELETE FROM contents WHERE id = ? RETURNING text_bytes");
  if (statement == nullptr) return false;
  int rc = statement->Bind(id).Step();
  const std::int64_t bytes = rc == SQLITE_ROW ? statement->Int(0) : 0;
  while (rc == SQLITE_ROW) rc = statement->Step();
  if (rc != SQLITE_DONE) return Fail("drop content");
  if (bytes == 0) return true;
  if (m_textBytes >= 0) m_textBytes -= bytes;
  Statement* text = Prepare("DELETE FROM texts WHERE rowid = ?");
  if (text == nullptr) return false;
  return text->Bind(id).Step() == SQLITE_DONE || Fail("drop content");
}

bool IndexWriter::StringId(const std::string& text, std::int64_t& id) {
  auto known = m_stringIds.find(text);
  if (known != m_stringIds.end()) {
    id = known->second;
    return true;
  }
  Statement* statement = Prepare(
      "INSERT INTO content_strings(text) VALUES (?) ON CONFLICT(text) DO UPDATE SET text = excluded.text"
      " RETURNING id");
  if (statement == nullptr) return false;
  int rc = statement->Bind(text).Step();
  if (rc != SQLITE_ROW) return Fail("put content");
  id = statement->Int(0);
  while (rc == SQLITE_ROW) rc = statement->Step();
  if (rc != SQLITE_DONE) return Fail("put content");
  m_stringIds.emplace(text, id);
  return true;
}

bool IndexWriter::ForgetContent(const std::string& parent, const std::string& name) {
  Statement* statement = Prepare("SELECT id FROM entries WHERE parent = ? AND name = ?");
  if (statement == nullptr) return false;
  int rc = statement->Bind(parent).Bind(name).Step();
  if (rc == SQLITE_DONE) return true;
  if (rc != SQLITE_ROW) return Fail("forget content");
  return DropContent(statement->Int(0));
}

// Such a file is the only kind of skipped one whose content's kind is not its entry's: a
// file's entry takes its content's kind, unless that kind is switched off.
bool IndexWriter::ForgetKindSkipped(const std::string& folder, std::uint64_t& changed) {
  Statement* statement = Prepare(
      "DELETE FROM contents WHERE id IN (SELECT c.id FROM contents c JOIN entries e ON e.id = c.id"
      " WHERE c.state = 3 AND c.kind != 0 AND c.kind != e.kind AND e.folder = ?)");
  if (statement == nullptr) return false;
  if (statement->Bind(folder).Step() != SQLITE_DONE) return Fail("forget skipped content");
  changed = static_cast<std::uint64_t>(sqlite3_changes(m_db));
  return true;
}

bool IndexWriter::PutContent(const ContentCandidate& candidate, const Content& content,
                             const std::string& text, bool& stored) {
  stored = false;
  Statement* current = Prepare("SELECT kind FROM entries WHERE id = ? AND mtime = ? AND size = ?");
  if (current == nullptr) return false;
  int rc = current->Bind(candidate.id).Bind(candidate.entry.mtime).Bind(candidate.entry.size).Step();
  if (rc == SQLITE_DONE) return true;  // changed or gone meanwhile: extracted again or never
  if (rc != SQLITE_ROW) return Fail("put content");
  if (current->Int(0) != static_cast<std::int64_t>(candidate.entry.kind)) {
    Statement* kind = Prepare("UPDATE entries SET kind = ? WHERE id = ?");
    if (kind == nullptr) return false;
    if (kind->Bind(static_cast<std::int64_t>(candidate.entry.kind)).Bind(candidate.id).Step() != SQLITE_DONE)
      return Fail("put content");
  }
  if (!DropContent(candidate.id)) return false;

  if (m_textBytes < 0) {
    Statement total(m_db, "SELECT total(text_bytes) FROM contents");
    if (!total.ok() || total.Step() != SQLITE_ROW) return Fail("put content");
    m_textBytes = total.Int(0);
  }
  std::size_t keep = Utf8Prefix(text, kMaxTextPerFile);
  bool truncated = content.textTruncated || keep < text.size();
  if (m_textBytes + static_cast<std::int64_t>(keep) > kMaxTextPerShare) {
    truncated = truncated || keep > 0;
    keep = 0;
  }
  std::int64_t mime = 0, reason = 0;
  if (!StringId(content.mime, mime) || !StringId(content.reason, reason)) return false;
  Statement* insert = Prepare(
      "INSERT INTO contents(id, mtime, size, state, mime, kind, reason, title, artist, album, genre, year,"
      " duration_ms, width, height, taken, make, model, latitude, longitude, codecs, author, text_bytes,"
      " text_truncated) VALUES (?, ?, ?, ?, ?, ?, ?, NULLIF(?, ''), NULLIF(?, ''), NULLIF(?, ''),"
      " NULLIF(?, ''), NULLIF(?, 0), NULLIF(?, 0), NULLIF(?, 0), NULLIF(?, 0), NULLIF(?, ''), NULLIF(?, ''),"
      " NULLIF(?, ''), ?, ?, NULLIF(?, ''), NULLIF(?, ''), ?, ?)");
  if (insert == nullptr) return false;
  insert->Bind(candidate.id)
      .Bind(candidate.entry.mtime)
      .Bind(candidate.entry.size)
      .Bind(static_cast<std::int64_t>(content.state))
      .Bind(mime)
      .Bind(static_cast<std::int64_t>(content.kind))
      .Bind(reason)
      .Bind(content.title)
      .Bind(content.artist)
      .Bind(content.album)
      .Bind(content.genre)
      .Bind(content.year)
      .Bind(content.durationMs)
      .Bind(content.width)
      .Bind(content.height)
      .Bind(content.taken)
      .Bind(content.make)
      .Bind(content.model);
  // The position is NULL when there is none (0, 0 is a place in the sea).
  if (content.hasPosition) {
    insert->Bind(content.latitude).Bind(content.longitude);
  } else {
    insert->BindNull().BindNull();
  }
  insert->Bind(content.codecs)
      .Bind(content.author)
      .Bind(static_cast<std::int64_t>(keep))
      .Bind(static_cast<std::int64_t>(truncated));
  if (insert->Step() != SQLITE_DONE) return Fail("put content");
  if (keep > 0) {
    Statement* body = Prepare("INSERT INTO texts(rowid, body) VALUES (?, ?)");
    if (body == nullptr) return false;
    if (body->Bind(candidate.id).Bind(text.substr(0, keep)).Step() != SQLITE_DONE) return Fail("put content");
    m_textBytes += static_cast<std::int64_t>(keep);
  }
  stored = true;
  return true;
}

std::unique_ptr<ContentReader> ContentReader::Open(const std::string& dbDir, std::string& error) {
  sqlite3* db = OpenReadOnly(dbDir, error);
  if (db == nullptr) return nullptr;
  const std::string file = IndexFilePath(dbDir);
  std::unique_ptr<ContentReader> reader(new ContentReader(db));
  Statement layout(db, "PRAGMA user_version");
  const int version = layout.ok() && layout.Step() == SQLITE_ROW ? static_cast<int>(layout.Int(0)) : -1;
  if (version != kLayoutVersion) {
    error = file + ": index layout " + std::to_string(version) + " is not this program's (" +
            std::to_string(kLayoutVersion) + "); fileindexd " +
            (version < kLayoutVersion ? "migrates" : "rebuilds") + " it when it opens it";
    return nullptr;
  }
  return reader;
}

bool ContentReader::Search(const ContentQuery& query, std::vector<ContentHit>& hits) {
  // Built for the filters given; each value is bound, never spliced into the text.
  std::string sql =
      std::string("SELECT e.parent, e.name, e.is_dir, e.size, e.mtime, e.kind, e.folder, c.id, ") +
      kContentColumns +
      (query.text.empty() ? " FROM entries e"
                          : ", snippet(texts, 0, char(2), char(3), '…', 10) FROM texts JOIN entries e ON"
                            " e.id = texts.rowid") +
      " LEFT JOIN contents c ON c.id = e.id AND c.mtime = e.mtime AND c.size = e.size"
      " WHERE (? OR (e.kind = ? AND e.is_dir = 0))";
  std::vector<std::string> texts;
  auto like = [&](const char* column, const std::string& value) {
    if (value.empty()) return;
    sql += std::string(" AND ") + column + " LIKE ? ESCAPE '\\'";
    texts.push_back(LikePattern(value));
  };
  const std::string names = MatchExpression(query.names.words);
  if (!names.empty()) {
    sql += " AND e.id IN (SELECT rowid FROM names WHERE names MATCH ?)";
    texts.push_back(names);
  }
  const std::string words = MatchExpression(query.text);
  if (!query.text.empty()) {
    sql += " AND texts MATCH ?";
    texts.push_back(words.empty() ? std::string("\"\"") : words);
  }
  like("c.title", query.title);
  like("c.artist", query.artist);
  like("c.album", query.album);
  like("c.genre", query.genre);
  like("(coalesce(c.make, '') || ' ' || coalesce(c.model, ''))", query.camera);
  if (!query.takenAfter.empty()) {
    sql += " AND c.taken >= ?";
    texts.push_back(query.takenAfter);
  }
  if (!query.takenBefore.empty()) {
    // Inclusive of the whole day (or second) given.
    sql += " AND substr(c.taken, 1, length(?)) <= ?";
    texts.push_back(query.takenBefore);
    texts.push_back(query.takenBefore);
  }
  if (query.year != 0) sql += " AND c.year = " + std::to_string(query.year);
  sql += " ORDER BY e.mtime DESC LIMIT " + std::to_string(query.names.limit);

  Statement statement(m_db, sql.c_str());
  if (!statement.ok()) return Fail("search");
  statement.Bind(static_cast<std::int64_t>(query.names.anyKind))
      .Bind(static_cast<std::int64_t>(query.names.kind));
  for (const std::string& text : texts) statement.Bind(text);
  int rc;
  while ((rc = statement.Step()) == SQLITE_ROW) {
    ContentHit found;
    found.hit.path = JoinPath(statement.Text(0), statement.Text(1));
    found.hit.isDir = statement.Int(2) != 0;
    found.hit.size = statement.Int(3);
    found.hit.mtime = statement.Int(4);
    found.hit.kind = static_cast<Kind>(statement.Int(5));
    found.hit.folder = statement.Text(6);
    found.hasContent = statement.IsNull(7) == false;
    if (found.hasContent) found.content = ContentFromRow(statement.Raw(), 8);
    if (!query.text.empty()) found.snippet = statement.Text(8 + kContentColumnCount);
    hits.push_back(std::move(found));
  }
  return rc == SQLITE_DONE || Fail("search");
}

bool ContentReader::Lookup(const std::string& path, Entry& entry, bool& found, Content& content,
                           bool& hasContent) {
  const std::string::size_type slash = path.rfind('/');
  const std::string parent = slash == std::string::npos ? std::string() : path.substr(0, slash);
  const std::string name = slash == std::string::npos ? path : path.substr(slash + 1);
  const std::string sql = std::string("SELECT e.is_dir, e.size, e.mtime, e.kind, e.folder, c.id, ") +
                          kContentColumns +
                          " FROM entries e LEFT JOIN contents c ON c.id = e.id AND c.mtime = e.mtime"
                          " AND c.size = e.size WHERE e.parent = ? AND e.name = ?";
  Statement statement(m_db, sql.c_str());
  if (!statement.ok()) return Fail("lookup");
  int rc = statement.Bind(parent).Bind(name).Step();
  found = rc == SQLITE_ROW;
  hasContent = false;
  if (found) {
    entry.parent = parent;
    entry.name = name;
    entry.isDir = statement.Int(0) != 0;
    entry.size = statement.Int(1);
    entry.mtime = statement.Int(2);
    entry.kind = static_cast<Kind>(statement.Int(3));
    entry.folder = statement.Text(4);
    hasContent = !statement.IsNull(5);
    if (hasContent) content = ContentFromRow(statement.Raw(), 6);
  }
  return rc == SQLITE_ROW || rc == SQLITE_DONE || Fail("lookup");
}

}  // namespace fileindex_store
