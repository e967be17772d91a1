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
    std::string error;
    writer_ = IndexWriter::Open(dir_ + "/db", error);
    ASSERT_TRUE(writer_) << error;
  }
  void TearDown() override {
    writer_.reset();
    fs::remove_all(dir_);
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
    EXPECT_TRUE(Reader()->Search(Query{words, anyKind, kind, limit}, hits));
    std::vector<std::string> paths;
    for (const Hit& hit : hits) paths.push_back(hit.path);
    return paths;
  }
  std::unique_ptr<IndexReader> Reader() {
    std::string error;
    auto reader = IndexReader::Open(dir_ + "/db", error);
    EXPECT_TRUE(reader) << error;
    return reader;
  }
  std::string dir_;
  std::unique_ptr<IndexWriter> writer_;
};

TEST_F(IndexStoreTest, RemovesWholeSubtreesOnly) {
  // Siblings whose names begin with the removed directory's name, and the characters
  // that sort just before and after "/", must survive.
  for (const char* name : {"a", "a b", "a.b", "a-b", "ab", "a0"}) Put("", name, 1, true);
  Put("a", "x.jpg");
  Put("a", "sub", 1, true);
  Put("a/sub", "deep.jpg");
  Put("a b", "keep.jpg");
  Put("a.b", "keep.jpg");
  Put("a0", "keep.jpg");
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

TEST_F(IndexStoreTest, IndexIsPrivateAndReadersNeedOne) {
  struct stat st;
  ASSERT_EQ(::stat((dir_ + "/db").c_str(), &st), 0);
  EXPECT_EQ(st.st_mode & 07777, 0700u);
  std::string error;
  EXPECT_FALSE(IndexReader::Open(dir_ + "/none", error));
  EXPECT_NE(error.find("/none/"), std::string::npos) << error;
}

// The content of a file belongs to one version of it and goes with its entry; its text is
// capped; an index of another layout is migrated or rebuilt, and never read as it is.
TEST_F(IndexStoreTest, ContentFollowsItsEntryAndLayoutsAreMigratedOrRebuilt) {
  Put("docs", "a.txt", 5);
  Put("docs", "b.txt", 5);
  std::vector<ContentCandidate> pending;
  std::int64_t next = 0;
  bool atEnd = false;
  ASSERT_TRUE(writer_->PendingContent(0, 10, pending, next, atEnd));
  EXPECT_TRUE(atEnd);
  {
    // One look covers a window of ids: a long run without work takes a few looks.
    std::vector<ContentCandidate> none;
    ASSERT_TRUE(writer_->Begin());
    for (int i = 0; i < 5000; ++i) Put("other", std::to_string(i), 1, true);
    Put("other", "last.txt");
    ASSERT_TRUE(writer_->Commit());
    std::int64_t after = pending.back().id;
    ASSERT_TRUE(writer_->PendingContent(after, 10, none, after, atEnd));
    EXPECT_TRUE(none.empty());
    EXPECT_FALSE(atEnd);
    ASSERT_TRUE(writer_->PendingContent(after, 10, none, after, atEnd));
    ASSERT_EQ(none.size(), 1u);
    EXPECT_EQ(none[0].entry.name, "last.txt");
    EXPECT_TRUE(atEnd);
    ASSERT_TRUE(writer_->RemoveBelow("other"));
  }
  ASSERT_EQ(pending.size(), 2u);
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
  std::string error;
  auto reader = ContentReader::Open(dir_ + "/db", error);
  ASSERT_TRUE(reader) << error;
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
  auto rows = [this](const char* sql) {
    sqlite3* db = nullptr;
    sqlite3_stmt* statement = nullptr;
    sqlite3_open_v2((dir_ + "/db/index.sqlite3").c_str(), &db, SQLITE_OPEN_READONLY, nullptr);
    sqlite3_prepare_v2(db, sql, -1, &statement, nullptr);
    int count = sqlite3_step(statement) == SQLITE_ROW ? sqlite3_column_int(statement, 0) : -1;
    sqlite3_finalize(statement);
    sqlite3_close(db);
    return count;
  };
  EXPECT_EQ(rows("SELECT count(*) FROM texts WHERE texts MATCH 'www*'"), 1);
  ASSERT_TRUE(writer_->RemoveBelow("docs"));
  EXPECT_EQ(rows("SELECT count(*) FROM contents"), 0);
  EXPECT_EQ(rows("SELECT count(*) FROM texts WHERE texts MATCH 'www*'"), 0);
  reader.reset();

  // The first layout (no content tables, user_version 0): readers refuse it, the writer
  // migrates it and keeps its entries.
  Put("docs", "c.txt");
  writer_.reset();
  auto setLayout = [this](const char* sql) {
    sqlite3* db = nullptr;
    ASSERT_EQ(sqlite3_open((dir_ + "/db/index.sqlite3").c_str(), &db), SQLITE_OK);
    EXPECT_EQ(sqlite3_exec(db, sql, nullptr, nullptr, nullptr), SQLITE_OK) << sqlite3_errmsg(db);
    sqlite3_close(db);
  };
  setLayout("DROP TABLE contents; DROP TABLE texts; PRAGMA user_version=0;");
  EXPECT_FALSE(ContentReader::Open(dir_ + "/db", error));
  EXPECT_NE(error.find("migrates"), std::string::npos) << error;
  writer_ = IndexWriter::Open(dir_ + "/db", error);
  ASSERT_TRUE(writer_) << error;
  EXPECT_EQ(All(), std::set<std::string>{"docs/c.txt"});
  EXPECT_TRUE(ContentReader::Open(dir_ + "/db", error)) << error;

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
  auto lookup = [&](const std::string& path) {
    auto reader = ContentReader::Open(dir_ + "/db", error);
    EXPECT_TRUE(reader) << error;
    Entry found;
    bool exists = false, has = false;
    content = Content();
    EXPECT_TRUE(reader && reader->Lookup(path, found, exists, content, has) && exists && has) << path;
    return std::string(KindName(found.kind)) + " " + content.mime + " " + content.reason;
  };
  EXPECT_EQ(lookup("docs/e.jpg"), "document application/pdf the PDF is encrypted");
  EXPECT_EQ(rows("SELECT count(*) FROM content_strings WHERE text = 'application/pdf'"), 1);
  // The second layout kept both in each row, and the content's kind beside the content
  // only: the writer moves them over.
  writer_.reset();
  setLayout(
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
  EXPECT_FALSE(ContentReader::Open(dir_ + "/db", error));
  writer_ = IndexWriter::Open(dir_ + "/db", error);
  ASSERT_TRUE(writer_) << error;
  EXPECT_EQ(lookup("docs/e.jpg"), "document application/pdf ");
  EXPECT_EQ(content.title, "Invoice");
  EXPECT_EQ(rows("SELECT count(*) FROM sqlite_master WHERE name IN ('contents_by_taken', 'contents_2')"), 1);

  // A newer layout: nothing reads it; the writer starts it again from nothing.
  writer_.reset();
  setLayout("PRAGMA user_version=99;");
  EXPECT_FALSE(IndexReader::Open(dir_ + "/db", error));
  EXPECT_FALSE(ContentReader::Open(dir_ + "/db", error));
  writer_ = IndexWriter::Open(dir_ + "/db", error);
  ASSERT_TRUE(writer_) << error;
  EXPECT_TRUE(All().empty());
}

// A folded-name index built with another folding (as after an ICU upgrade) misses names
// in prefix searches until the writer, on opening, builds it again.
TEST_F(IndexStoreTest, FoldedNamesAreRebuiltForAnotherFolding) {
  Put("docs", "Beach One.jpg");
  writer_.reset();
  sqlite3* db = nullptr;
  ASSERT_EQ(sqlite3_open((dir_ + "/db/index.sqlite3").c_str(), &db), SQLITE_OK);
  auto upper = [](sqlite3_context* context, int, sqlite3_value** values) {
    std::string text = reinterpret_cast<const char*>(sqlite3_value_text(values[0]));
    for (char& c : text) c = static_cast<char>(std::toupper(static_cast<unsigned char>(c)));
    sqlite3_result_text(context, text.c_str(), -1, SQLITE_TRANSIENT);
  };
  sqlite3_create_function_v2(db, "fi_fold", 1, SQLITE_UTF8 | SQLITE_DETERMINISTIC, nullptr, upper, nullptr,
                             nullptr, nullptr);
  ASSERT_EQ(sqlite3_exec(
                db, "REINDEX entries_by_folded_name; UPDATE meta SET value = 'other' WHERE key = 'folding'",
                nullptr, nullptr, nullptr),
            SQLITE_OK)
      << sqlite3_errmsg(db);
  sqlite3_close(db);
  auto prefixed = [this] {
    sqlite3* reader = nullptr;
    sqlite3_open_v2((dir_ + "/db/index.sqlite3").c_str(), &reader, SQLITE_OPEN_READONLY, nullptr);
    EXPECT_TRUE(RegisterMatchingFunctions(reader));
    sqlite3_stmt* statement = nullptr;
    sqlite3_prepare_v2(
        reader, "SELECT count(*) FROM entries WHERE fi_fold(name) >= 'beach' AND fi_fold(name) < 'beachz'",
        -1, &statement, nullptr);
    const int count = sqlite3_step(statement) == SQLITE_ROW ? sqlite3_column_int(statement, 0) : -1;
    sqlite3_finalize(statement);
    sqlite3_close(reader);
    return count;
  };
  EXPECT_EQ(prefixed(), 0);
  std::string error;
  writer_ = IndexWriter::Open(dir_ + "/db", error);
  ASSERT_TRUE(writer_) << error;
  EXPECT_EQ(prefixed(), 1);
}

// A file that is not an index (damaged, or overwritten) is kept aside and a new index
// started, which the writer says.
TEST_F(IndexStoreTest, DamagedIndexIsSetAsideAndStartedAgain) {
  Put("docs", "a.txt");
  writer_.reset();
  const std::string file = dir_ + "/db/index.sqlite3";
  const std::string garbage(8192, 'x');
  std::ofstream(file, std::ios::binary | std::ios::trunc) << garbage;
  std::string error;
  writer_ = IndexWriter::Open(dir_ + "/db", error);
  ASSERT_TRUE(writer_) << error;
  EXPECT_NE(writer_->SetAsideNote().find("not a database"), std::string::npos) << writer_->SetAsideNote();
  EXPECT_TRUE(All().empty());
  Put("docs", "b.txt");
  EXPECT_EQ(All(), std::set<std::string>{"docs/b.txt"});
  std::ifstream kept(file + ".damaged", std::ios::binary);
  EXPECT_EQ(std::string(std::istreambuf_iterator<char>(kept), {}), garbage);
  writer_.reset();
  writer_ = IndexWriter::Open(dir_ + "/db", error);  // a sound index is opened as it is
  ASSERT_TRUE(writer_) << error;
  EXPECT_TRUE(writer_->SetAsideNote().empty());
  EXPECT_EQ(All(), std::set<std::string>{"docs/b.txt"});
}

}  // namespace
