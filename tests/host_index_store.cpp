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
    const std::vector<std::string> paths = Find({}, 1000);
    return std::set<std::string>(paths.begin(), paths.end());
  }
  std::vector<std::string> Find(const std::vector<std::string>& words, std::size_t limit = 50) {
    std::vector<Hit> hits;
    auto reader = IndexReader::Open(dir_ + "/db", error_);
    EXPECT_TRUE(reader && reader->Search(Query{words, true, Kind::kOther, limit}, hits)) << error_;
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
  // A file's entry and content, read as the service reads them; false when it has no content.
  bool Lookup(const std::string& path, Entry& entry, Content& content) {
    auto reader = ContentReader::Open(dir_ + "/db", error_);
    bool found = false, has = false;
    return reader && reader->Lookup(path, entry, found, content, has) && has;
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
  // One look covers a window of ids: after a long run without work, the looks go on to the end.
  ASSERT_TRUE(writer_->Begin());
  for (int i = 0; i < 5000; ++i) Put("other", std::to_string(i), 1, true);
  Put("other", "last.txt");
  ASSERT_TRUE(writer_->Commit());
  next = pending.back().id;
  for (atEnd = false; none.empty() && !atEnd;)
    ASSERT_TRUE(writer_->PendingContent(next, 10, none, next, atEnd));
  ASSERT_EQ(none.size(), 1u);
  EXPECT_EQ(none[0].entry.name, "last.txt");
  EXPECT_TRUE(atEnd);
  ASSERT_TRUE(writer_->RemoveBelow("other"));

  Content content;
  bool stored = false;
  ASSERT_TRUE(writer_->PutContent(pending[0], content, std::string(kMaxTextPerFile + 10, 'w'), stored));
  EXPECT_TRUE(stored);
  ContentCandidate stale = pending[1];
  stale.entry.mtime = 4;  // extracted from a version the index no longer has
  ASSERT_TRUE(writer_->PutContent(stale, content, "old words", stored));
  EXPECT_FALSE(stored);
  Entry entry;
  ASSERT_TRUE(Lookup("docs/a.txt", entry, content)) << error_;
  EXPECT_EQ(content.textBytes, static_cast<std::int64_t>(kMaxTextPerFile));
  EXPECT_TRUE(content.textTruncated);
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

  // The second layout kept types and reasons as text in each row, and the content's kind
  // beside the content only: the writer moves them over.
  Put("docs", "e.jpg");
  pending.clear();
  ASSERT_TRUE(writer_->PendingContent(0, 10, pending, next, atEnd));
  ASSERT_EQ(pending.size(), 2u);
  pending[1].entry.kind = content.kind = Kind::kDocument;
  ASSERT_TRUE(writer_->PutContent(pending[1], content, "", stored));
  Exec(
      "UPDATE entries SET kind = 4 WHERE name = 'e.jpg'; DROP TABLE content_strings; PRAGMA user_version=2;"
      "UPDATE contents SET mime = 'application/pdf', reason = '', title = 'Invoice';");
  EXPECT_FALSE(ContentReader::Open(dir_ + "/db", error_));
  ASSERT_NO_FATAL_FAILURE(Reopen());
  ASSERT_TRUE(Lookup("docs/e.jpg", entry, content)) << error_;
  EXPECT_EQ(std::string(KindName(entry.kind)) + " " + content.mime + " " + content.title,
            "document application/pdf Invoice");
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
// started, which the writer says; a sound index is opened as it is.
TEST_F(IndexStoreTest, DamagedIndexIsSetAsideAndStartedAgain) {
  struct stat st;  // the index is private to the service
  ASSERT_EQ(::stat((dir_ + "/db").c_str(), &st), 0);
  EXPECT_EQ(st.st_mode & 07777, 0700u);
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
