// The per-share index store: entries kept per directory, subtrees removed on whole path
// components, and name searches by word prefix, case and accents ignored, newest first.
#include <content.h>
#include <gtest/gtest.h>
#include <sqlite3.h>
#include <store.h>
#include <sys/stat.h>

#include <cctype>
#include <cstdlib>
#include <filesystem>
#include <fstream>
#include <set>

namespace fs = std::filesystem;
using namespace fileindex_store;

namespace {

class IndexStoreTest : public ::testing::Test {
 protected:
  void SetUp() override {
    char pattern[] = "/tmp/index_store.XXXXXX";
    ASSERT_NE(::mkdtemp(pattern), nullptr);
    dir_ = pattern;
    ASSERT_NO_FATAL_FAILURE(Reopen());
  }
  void TearDown() override {
    writer_.reset();
    fs::remove_all(dir_);
  }
  void Reopen() {
    writer_.reset();
    writer_ = IndexWriter::Open(dir_ + "/db", error_);
    ASSERT_TRUE(writer_) << error_;
  }
  void Put(const std::string& parent, const std::string& name, std::int64_t mtime = 1, bool isDir = false) {
    const Kind kind = isDir ? Kind::kOther : KindOfExtension(ExtensionOf(name));
    ASSERT_TRUE(writer_->Put(Entry{parent, name, isDir, 0, mtime, kind, "f"})) << writer_->LastError();
  }
  std::set<std::string> All() {
    const std::vector<std::string> paths = Find({}, true, Kind::kOther, 1000);
    return std::set<std::string>(paths.begin(), paths.end());
  }
  std::vector<std::string> Find(const std::vector<std::string>& words, bool anyKind = true,
                                Kind kind = Kind::kOther, std::size_t limit = 50) {
    std::vector<Hit> hits;
    auto reader = IndexReader::Open(dir_ + "/db", error_);
    EXPECT_TRUE(reader && reader->Search(Query{words, anyKind, kind, limit}, hits)) << error_;
    std::vector<std::string> paths;
    for (const Hit& hit : hits) paths.push_back(hit.path);
    return paths;
  }
  // The first column of the first row of a query on the database file itself, or -1.
  int Count(const std::string& sql) {
    sqlite3* db = nullptr;
    sqlite3_stmt* statement = nullptr;
    sqlite3_open_v2((dir_ + "/db/index.sqlite3").c_str(), &db, SQLITE_OPEN_READONLY, nullptr);
    EXPECT_TRUE(RegisterMatchingFunctions(db));
    sqlite3_prepare_v2(db, sql.c_str(), -1, &statement, nullptr);
    int count = sqlite3_step(statement) == SQLITE_ROW ? sqlite3_column_int(statement, 0) : -1;
    sqlite3_finalize(statement);
    sqlite3_close(db);
    return count;
  }
  // Changes the database file with the writer closed.
  void Exec(const std::string& sql, void (*fold)(sqlite3_context*, int, sqlite3_value**) = nullptr) {
    writer_.reset();
    sqlite3* db = nullptr;
    ASSERT_EQ(sqlite3_open((dir_ + "/db/index.sqlite3").c_str(), &db), SQLITE_OK);
    if (fold != nullptr)
      sqlite3_create_function_v2(db, "fi_fold", 1, SQLITE_UTF8 | SQLITE_DETERMINISTIC, nullptr, fold, nullptr,
                                 nullptr, nullptr);
    EXPECT_EQ(sqlite3_exec(db, sql.c_str(), nullptr, nullptr, nullptr), SQLITE_OK) << sqlite3_errmsg(db);
    sqlite3_close(db);
  }
  // "kind mime reason" of a file's content, read as the service reads it.
  std::string Described(const std::string& path, Content& content) {
    auto reader = ContentReader::Open(dir_ + "/db", error_);
    Entry entry;
    bool found = false, has = false;
    content = Content();
    EXPECT_TRUE(reader && reader->Lookup(path, entry, found, content, has) && found && has) << path << error_;
    return std::string(KindName(entry.kind)) + " " + content.mime + " " + content.reason;
  }
  std::string dir_, error_;
  std::unique_ptr<IndexWriter> writer_;
};

TEST_F(IndexStoreTest, RemovesWholeSubtreesOnly) {
  // Siblings whose names begin with the removed directory's name, and the characters
  // that sort just before and after "/", must survive.
  for (const char* name : {"a", "a b", "a.b", "a-b", "ab", "a0"}) Put("", name, 1, true);
  Put("a", "x.jpg");
  Put("a", "sub", 1, true);
  Put("a/sub", "deep.jpg");
  for (const char* parent : {"a b", "a.b", "a0"}) Put(parent, "keep.jpg");
  ASSERT_TRUE(writer_->Remove("", "a"));
  EXPECT_EQ(All(), (std::set<std::string>{"a b", "a.b", "a-b", "ab", "a0", "a b/keep.jpg", "a.b/keep.jpg",
                                          "a0/keep.jpg"}));
  // A file replaced by a directory of the same name and back: one entry, updated in place.
  Put("", "ab", 2, false);
  std::vector<Entry> children;
  ASSERT_TRUE(writer_->ListChildren("", children));
  EXPECT_EQ(children.size(), 5u);
  ASSERT_TRUE(writer_->RemoveBelow(""));
  EXPECT_TRUE(All().empty());
}

TEST_F(IndexStoreTest, SearchesWordPrefixesNewestFirst) {
  Put("", "Beach_Holiday 2019.JPG", 10);
  Put("", "beachfront.mp3", 30);
  Put("", "Café del Mar.flac", 20);
  Put("", "notes \"quoted\".txt", 5);
  Put("", "seabeach.jpg", 40);  // "beach" inside a word is no match
  Put("", "beaches", 50, true);
  EXPECT_EQ(Find({"BEACH"}),
            (std::vector<std::string>{"beaches", "beachfront.mp3", "Beach_Holiday 2019.JPG"}));
  EXPECT_EQ(Find({"beach", "2019"}), (std::vector<std::string>{"Beach_Holiday 2019.JPG"}));
  EXPECT_EQ(Find({"cafe"}), (std::vector<std::string>{"Café del Mar.flac"}));
  EXPECT_EQ(Find({"beach"}, false, Kind::kAudio), (std::vector<std::string>{"beachfront.mp3"}));
  EXPECT_EQ(Find({"beach"}, true, Kind::kOther, 1), (std::vector<std::string>{"beaches"}));
  // Quotes and operators in a word are text, not query syntax; a word of no letters
  // restricts nothing.
  EXPECT_EQ(Find({"\"quoted"}), (std::vector<std::string>{"notes \"quoted\".txt"}));
  EXPECT_EQ(Find({"notes", "OR", "AND"}).size(), 0u);
  EXPECT_EQ(Find({"--"}).size(), 6u);

  // Removing an entry removes it from the name index too.
  ASSERT_TRUE(writer_->Remove("", "beachfront.mp3"));
  EXPECT_EQ(Find({"beachf"}).size(), 0u);
}

// The content of a file belongs to one version of it and goes with its entry; its text is
// capped; an index of another layout is migrated or rebuilt, and never read as it is.
TEST_F(IndexStoreTest, ContentFollowsItsEntryAndLayoutsAreMigratedOrRebuilt) {
  Put("docs", "a.txt", 5);
  Put("docs", "b.txt", 5);
  std::vector<ContentCandidate> pending, none;
  std::int64_t next = 0;
  bool atEnd = false;
  ASSERT_TRUE(writer_->PendingContent(0, 10, pending, next, atEnd));
  ASSERT_EQ(pending.size(), 2u);
  EXPECT_TRUE(atEnd);
  // One look covers a window of ids: a long run without work takes a few looks.
  ASSERT_TRUE(writer_->Begin());
  for (int i = 0; i < 5000; ++i) Put("other", std::to_string(i), 1, true);
  Put("other", "last.txt");
  ASSERT_TRUE(writer_->Commit());
  next = pending.back().id;
  ASSERT_TRUE(writer_->PendingContent(next, 10, none, next, atEnd));
  EXPECT_TRUE(none.empty());
  EXPECT_FALSE(atEnd);
  ASSERT_TRUE(writer_->PendingContent(next, 10, none, next, atEnd));
  ASSERT_EQ(none.size(), 1u);
  EXPECT_EQ(none[0].entry.name, "last.txt");
  EXPECT_TRUE(atEnd);
  ASSERT_TRUE(writer_->RemoveBelow("other"));

  Content content;
  content.kind = Kind::kDocument;
  content.mime = "text/plain";
  bool stored = false;
  ASSERT_TRUE(writer_->PutContent(pending[0], content, std::string(kMaxTextPerFile + 10, 'w'), stored));
  EXPECT_TRUE(stored);
  ContentCandidate stale = pending[1];
  stale.entry.mtime = 4;  // extracted from a version the index no longer has
  ASSERT_TRUE(writer_->PutContent(stale, content, "old words", stored));
  EXPECT_FALSE(stored);
  auto reader = ContentReader::Open(dir_ + "/db", error_);
  ASSERT_TRUE(reader) << error_;
  Entry entry;
  bool found = false, hasContent = false;
  ASSERT_TRUE(reader->Lookup("docs/a.txt", entry, found, content, hasContent));
  ASSERT_TRUE(found && hasContent);
  EXPECT_EQ(content.textBytes, static_cast<std::int64_t>(kMaxTextPerFile));
  EXPECT_TRUE(content.textTruncated);
  pending.clear();
  ASSERT_TRUE(writer_->PendingContent(0, 10, pending, next, atEnd));
  ASSERT_EQ(pending.size(), 1u);
  EXPECT_EQ(pending[0].entry.name, "b.txt");
  Put("docs", "a.txt", 6);  // changed: its content is due again, and not shown meanwhile
  ASSERT_TRUE(reader->Lookup("docs/a.txt", entry, found, content, hasContent));
  EXPECT_FALSE(hasContent);
  reader.reset();
  EXPECT_EQ(Count("SELECT count(*) FROM texts WHERE texts MATCH 'www*'"), 1);
  ASSERT_TRUE(writer_->RemoveBelow("docs"));
  EXPECT_EQ(Count("SELECT count(*) FROM contents"), 0);
  EXPECT_EQ(Count("SELECT count(*) FROM texts WHERE texts MATCH 'www*'"), 0);

  // The first layout (no content tables, user_version 0): readers refuse it, the writer
  // migrates it and keeps its entries.
  Put("docs", "c.txt");
  Exec("DROP TABLE contents; DROP TABLE texts; PRAGMA user_version=0;");
  EXPECT_FALSE(ContentReader::Open(dir_ + "/db", error_));
  EXPECT_NE(error_.find("migrates"), std::string::npos) << error_;
  ASSERT_NO_FATAL_FAILURE(Reopen());
  EXPECT_EQ(All(), std::set<std::string>{"docs/c.txt"});
  EXPECT_TRUE(ContentReader::Open(dir_ + "/db", error_)) << error_;

  // The content's kind becomes the entry's (a PDF named as a photo is a document); types
  // and reasons are kept once for all files.
  Put("docs", "d.jpg");
  Put("docs", "e.jpg");
  pending.clear();
  ASSERT_TRUE(writer_->PendingContent(0, 10, pending, next, atEnd));
  ASSERT_EQ(pending.size(), 3u);
  content = Content();
  content.state = ExtractState::kFailed;
  content.mime = "application/pdf";
  content.reason = "the PDF is encrypted";
  for (int i : {1, 2}) {
    pending[i].entry.kind = content.kind = Kind::kDocument;
    ASSERT_TRUE(writer_->PutContent(pending[i], content, "", stored));
  }
  EXPECT_EQ(Described("docs/e.jpg", content), "document application/pdf the PDF is encrypted");
  EXPECT_EQ(Count("SELECT count(*) FROM content_strings WHERE text = 'application/pdf'"), 1);
  // The second layout kept both in each row, and the content's kind beside the content
  // only: the writer moves them over.
  Exec(
      "UPDATE entries SET kind = 4 WHERE name = 'e.jpg'; DELETE FROM contents WHERE id != (SELECT id FROM"
      " entries WHERE name = 'e.jpg'); ALTER TABLE contents RENAME TO contents_3;"
      "CREATE TABLE contents(id INTEGER PRIMARY KEY, mtime INTEGER NOT NULL, size INTEGER NOT NULL,"
      " state INTEGER NOT NULL, mime TEXT NOT NULL, kind INTEGER NOT NULL, reason TEXT NOT NULL, title TEXT,"
      " artist TEXT, album TEXT, genre TEXT, year INTEGER, duration_ms INTEGER, width INTEGER, height"
      " INTEGER, taken TEXT, make TEXT, model TEXT, latitude REAL, longitude REAL, codecs TEXT, author TEXT,"
      " text_bytes INTEGER NOT NULL, text_truncated INTEGER NOT NULL);"
      "INSERT INTO contents SELECT id, mtime, size, 1, 'application/pdf', kind, '', 'Invoice', NULL, NULL,"
      " NULL, NULL, NULL, NULL, NULL, NULL, NULL, NULL, NULL, NULL, NULL, NULL, 0, 0 FROM contents_3;"
      "DROP TABLE contents_3; CREATE INDEX contents_by_taken ON contents(taken) WHERE taken IS NOT NULL; "
      "DROP TABLE content_strings; PRAGMA user_version=2;");
  EXPECT_FALSE(ContentReader::Open(dir_ + "/db", error_));
  ASSERT_NO_FATAL_FAILURE(Reopen());
  EXPECT_EQ(Described("docs/e.jpg", content), "document application/pdf ");
  EXPECT_EQ(content.title, "Invoice");
  EXPECT_EQ(Count("SELECT count(*) FROM sqlite_master WHERE name IN ('contents_by_taken', 'contents_2')"), 1);

  // A newer layout: nothing reads it; the writer starts it again from nothing.
  Exec("PRAGMA user_version=99;");
  EXPECT_FALSE(IndexReader::Open(dir_ + "/db", error_));
  EXPECT_FALSE(ContentReader::Open(dir_ + "/db", error_));
  ASSERT_NO_FATAL_FAILURE(Reopen());
  EXPECT_TRUE(All().empty());
}

// A folded-name index built with another folding (as after an ICU upgrade) misses names
// in prefix searches until the writer, on opening, builds it again.
TEST_F(IndexStoreTest, FoldedNamesAreRebuiltForAnotherFolding) {
  Put("docs", "Beach One.jpg");
  Exec("REINDEX entries_by_folded_name; UPDATE meta SET value = 'other' WHERE key = 'folding'",
       [](sqlite3_context* context, int, sqlite3_value** values) {
         std::string text = reinterpret_cast<const char*>(sqlite3_value_text(values[0]));
         for (char& c : text) c = static_cast<char>(std::toupper(static_cast<unsigned char>(c)));
         sqlite3_result_text(context, text.c_str(), -1, SQLITE_TRANSIENT);
       });
  const std::string prefixed =
      "SELECT count(*) FROM entries WHERE fi_fold(name) >= 'beach' AND fi_fold(name) < 'beachz'";
  EXPECT_EQ(Count(prefixed), 0);
  ASSERT_NO_FATAL_FAILURE(Reopen());
  EXPECT_EQ(Count(prefixed), 1);
}

// A file that is not an index (damaged, or overwritten) is kept aside and a new index
// started, which the writer says; a sound index is opened as it is. An index is private.
TEST_F(IndexStoreTest, DamagedIndexIsSetAsideAndStartedAgain) {
  struct stat st;
  ASSERT_EQ(::stat((dir_ + "/db").c_str(), &st), 0);
  EXPECT_EQ(st.st_mode & 07777, 0700u);
  EXPECT_FALSE(IndexReader::Open(dir_ + "/none", error_));  // readers never make one
  EXPECT_NE(error_.find("/none/"), std::string::npos) << error_;

  Put("docs", "a.txt");
  writer_.reset();
  const std::string file = dir_ + "/db/index.sqlite3", garbage(8192, 'x');
  std::ofstream(file, std::ios::binary | std::ios::trunc) << garbage;
  ASSERT_NO_FATAL_FAILURE(Reopen());
  EXPECT_NE(writer_->SetAsideNote().find("not a database"), std::string::npos) << writer_->SetAsideNote();
  EXPECT_TRUE(All().empty());
  Put("docs", "b.txt");
  std::ifstream kept(file + ".damaged", std::ios::binary);
  EXPECT_EQ(std::string(std::istreambuf_iterator<char>(kept), {}), garbage);
  ASSERT_NO_FATAL_FAILURE(Reopen());
  EXPECT_TRUE(writer_->SetAsideNote().empty());
  EXPECT_EQ(All(), std::set<std::string>{"docs/b.txt"});
}

}  // namespace
