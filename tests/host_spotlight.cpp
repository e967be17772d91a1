// Samba's Spotlight searches answered from a share's index: each query form Samba writes
// for Finder selects the right files, hostile queries are refused, and the answers hold
// only existing files of folders still indexed.
#include <content.h>
#include <gtest/gtest.h>
#include <json/json.h>
#include <query_string.h>
#include <spotlight_search.h>
#include <store.h>

#include <filesystem>
#include <fstream>
#include <set>

namespace fs = std::filesystem;
using namespace fileindex_store;
using Paths = std::set<std::string>;

namespace {
const std::string kDir = "2020", kTrips = "2020/trips", kOne = "2020/beach one.jpg",
                  kCopy = "2020/Beach (1) copy.jpg", kNotes = "2020/beach notes.txt",
                  kCafe = "2020/Café del Mar.flac", kSunset = "2020/sunset.png",
                  kWalk = "2020/trips/beach walk.mp4", kUnknown = "2020/unknown.xyz";

class SpotlightTest : public ::testing::Test {
 protected:
  void SetUp() override {
    char pattern[] = "/tmp/spotlight.XXXXXX";
    ASSERT_NE(::mkdtemp(pattern), nullptr);
    dir_ = fs::canonical(pattern).string();
    share_ = dir_ + "/share";
    std::string error;
    writer_ = IndexWriter::Open(dir_ + "/db", error);
    ASSERT_TRUE(writer_) << error;
    ASSERT_TRUE(writer_->Begin());
    // 2021-06-01, 2019-05-01, 2022-01-01 and so on, at noon UTC.
    Put(kDir, true, 0, 1577880000);
    Put(kOne, false, 20, 1622548800);
    Put(kCopy, false, 5, 1556712000);
    Put(kNotes, false, 100, 1641038400);
    Put(kCafe, false, 15, 1593604800);
    Put(kSunset, false, 30, 1596283200);
    Put(kTrips, true, 0, 1577880000);
    Put(kWalk, false, 12, 1598961600);
    Put(kUnknown, false, 7, 1598961600);
    Put("old/beach gone.jpg", false, 1, 1598961600, "old");  // its folder is no longer indexed
    for (const char* path : {"2020", "old"}) {
      FolderState folder;
      folder.path = path;
      ASSERT_TRUE(writer_->PutFolder(folder));
    }
    // What the extraction worker read inside one file.
    std::vector<ContentCandidate> pending;
    std::int64_t scannedTo = 0;
    bool atEnd = false, stored = false;
    ASSERT_TRUE(writer_->PendingContent(0, 100, pending, scannedTo, atEnd));
    for (const ContentCandidate& candidate : pending)
      if (candidate.entry.name == "beach notes.txt" &&
          !writer_->PutContent(candidate, Content(), "A puffin colony on the cliffs", stored))
        FAIL() << writer_->LastError();
    ASSERT_TRUE(stored);
    ASSERT_TRUE(writer_->Commit());
    search_.SetShares({{"photo", share_, dir_ + "/db", {"2020"}}});
  }
  void TearDown() override { fs::remove_all(dir_); }

  void Put(const std::string& path, bool isDir, std::int64_t size, std::int64_t mtime,
           const std::string& folder = "2020") {
    Entry entry;
    std::size_t slash = path.rfind('/');
    entry.parent = slash == std::string::npos ? "" : path.substr(0, slash);
    entry.name = path.substr(slash + 1);
    entry.isDir = isDir;
    entry.size = size;
    entry.mtime = mtime;
    entry.kind = isDir ? Kind::kOther : KindOfExtension(ExtensionOf(entry.name));
    entry.folder = folder;
    ASSERT_TRUE(writer_->Put(entry)) << writer_->LastError();
    fs::create_directories(share_ + "/" + (isDir ? path : entry.parent));
    if (!isDir) std::ofstream(share_ + "/" + path) << "x";
  }

  Json::Value Ask(const std::string& query, int from = 0, int size = 50, int status = 200) {
    Json::Value request;
    request["from"] = from;
    request["size"] = size;
    request["_source"].append("path.real");
    request["query"]["query_string"]["query"] = query;
    fileindexd::SearchAnswer answer = search_.Search("_all", Json::FastWriter().write(request));
    EXPECT_EQ(answer.status, status) << query << ": " << answer.body;
    Json::Value response;
    EXPECT_TRUE(Json::Reader().parse(answer.body, response)) << answer.body;
    return response;
  }
  // The share-relative paths a Samba query string finds, scoped to the share as Samba does.
  Paths Find(const std::string& expression) {
    Json::Value response = Ask("(" + expression + ") AND path.real.fulltext:\"" + share_ + "\"");
    Paths paths;
    for (const Json::Value& hit : response["hits"]["hits"]) {
      std::string path = hit["_source"]["path"]["real"].asString();
      EXPECT_EQ(path.compare(0, share_.size() + 1, share_ + "/"), 0) << path;
      paths.insert(path.substr(share_.size() + 1));
    }
    EXPECT_EQ(response["hits"]["total"]["value"].asUInt64(), paths.size()) << expression;
    return paths;
  }

  std::string dir_, share_;
  std::unique_ptr<IndexWriter> writer_;
  fileindexd::SpotlightSearch search_;
};

TEST_F(SpotlightTest, EveryFormSambaWritesSelectsTheRightFiles) {
  const std::vector<std::pair<std::string, Paths>> rows = {
      {"file.filename:beach*", {kOne, kCopy, kNotes, kWalk}},
      {"file.filename:BEACH\\ ONE.jpg", {kOne}},
      {"file.filename:*each*", {kOne, kCopy, kNotes, kWalk}},
      {"file.filename:beach\\ \\(1\\)*", {kCopy}},
      {"file.filename:café*", {kCafe}},
      {"file.filename:CAFE\\ DEL*", {kCafe}},  // accents ignored
      {"walk*", {kWalk}},                      // any word of the name
      {"puff*", {kNotes}},                     // or of the text
      {"content:puffin\\ colony", {kNotes}},
      {"content:colony\\ puffin", {}},
      {"file.content_type:(image\\/jpeg)", {kOne, kCopy}},
      {"file.content_type:(image\\/* audio\\/*)", {kOne, kCopy, kSunset, kCafe}},
      {"file.content_type:(text\\/directory)", {kDir, kTrips}},
      {"file.content_type:(application\\/octet\\-stream)", {kUnknown}},
      {"file.filesize:{15 TO *}", {kOne, kNotes, kSunset}},  // 15 itself is out
      {"file.filesize:[12 TO 20]", {kOne, kCafe, kWalk}},
      {"file.filesize:5 OR file.filesize:[* TO 4]", {kCopy}},  // files only
      {"file.last_modified:{2021\\-01\\-01T00\\:00\\:00Z TO *}", {kOne, kNotes}},
      {"file.last_modified:[* TO 2020\\-01\\-01]", {kDir, kTrips, kCopy}},
      {"(file.filename:beach* AND (NOT file.filename:*.jpg))", {kNotes, kWalk}},
      {"((file.filename:sunset* OR file.filename:café*))", {kSunset, kCafe}},
      {"file.filename:beach* AND file.content_type:(image\\/*) AND file.filesize:{10 TO *}", {kOne}},
      {"meta.title:beach*", {}},  // fields the index does not hold match nothing
  };
  for (const auto& [query, paths] : rows) EXPECT_EQ(Find(query), paths) << query;
  EXPECT_EQ(Find("NOT file.created:*").size(), 9u);
  // A scope inside the share is a sub-folder scope; one outside any share finds nothing.
  EXPECT_EQ(Ask("beach* AND path.real.fulltext:\"" + share_ + "/2020/trips\"")["hits"]["total"]["value"], 1);
  EXPECT_EQ(Ask("beach* AND path.real.fulltext:\"/elsewhere\"")["hits"]["total"]["value"], 0);
}

TEST_F(SpotlightTest, PagesAreExactAndHoldOnlyExistingFilesOfIndexedFolders) {
  std::set<std::string> seen;
  for (int from = 0; from < 9; from += 4) {
    Json::Value page = Ask("file.filename:* AND path.real.fulltext:\"" + share_ + "\"", from, 4);
    EXPECT_EQ(page["hits"]["total"]["value"], 9);  // the old folder's entry is left out
    for (const Json::Value& hit : page["hits"]["hits"])
      seen.insert(hit["_source"]["path"]["real"].asString());
  }
  EXPECT_EQ(seen.size(), 9u);
  EXPECT_EQ(seen.count(share_ + "/old/beach gone.jpg"), 0u);
  fs::remove(share_ + "/" + kSunset);  // gone before the indexer saw it
  EXPECT_EQ(Find("file.filename:sunset*"), Paths{});
}

TEST_F(SpotlightTest, HostileRequestsAreRefusedWithReasons) {
  Condition condition;
  for (const std::string& query :
       {std::string(5000, '(') + "a" + std::string(5000, ')'), std::string("(a AND b"), std::string("a)"),
        "file.filename:" + std::string(2000, 'x'), std::string("\"open phrase"), std::string("a\\"),
        std::string("file.filesize:[1 TO"), std::string("file.filesize:{ten TO *}"),
        std::string("file.last_modified:2020\\-13\\-01"), std::string("a^2"), std::string(""),
        std::string(40000, 'a')}) {
    std::string error;
    EXPECT_FALSE(fileindexd::ParseQueryString(query, condition, error)) << query.substr(0, 40);
    EXPECT_FALSE(error.empty()) << query.substr(0, 40);
  }
  EXPECT_EQ(Ask("a*", 0, 10, 400)["error"]["type"], "query_shard_exception");  // no share scope
  EXPECT_EQ(Ask("a* AND path.real.fulltext:\"" + share_ + "\"", 9990, 20, 400)["status"], 400);
  fileindexd::SearchAnswer notJson = search_.Search("_all", "{\"query\":");
  EXPECT_EQ(notJson.status, 400);
  EXPECT_NE(notJson.body.find("parsing_exception"), std::string::npos);
}

}  // namespace
