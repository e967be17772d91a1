// Samba's Spotlight searches answered from a share's index: the query forms Samba writes for
// Finder, hostile queries refused, and answers holding only existing files of indexed folders.
#include <content.h>
#include <gtest/gtest.h>
#include <json/json.h>
#include <spotlight_search.h>
#include <store.h>

#include <filesystem>
#include <fstream>
#include <set>

namespace fs = std::filesystem;
using namespace fileindex_store;
using Paths = std::set<std::string>;

namespace {
const std::string kTrips = "2020/trips", kOne = "2020/beach one.jpg", kCopy = "2020/Beach (1) copy.jpg",
                  kNotes = "2020/beach notes.txt", kWalk = "2020/trips/beach walk.mp4",
                  kGone = "2020/sunset.png";

class SpotlightTest : public ::testing::Test {
 protected:
  void SetUp() override {
    char pattern[] = "/tmp/spotlight.XXXXXX";
    ASSERT_NE(::mkdtemp(pattern), nullptr);
    dir_ = fs::canonical(pattern).string();
    share_ = dir_ + "/share";
    std::string error;
    writer_ = IndexWriter::Open(dir_ + "/db", error);
    ASSERT_TRUE(writer_ && writer_->Begin()) << error;
    // The notes first: the one file whose text the extraction worker read.
    Put(kNotes, false, 100, 1641038400);
    std::vector<ContentCandidate> pending;
    std::int64_t scannedTo = 0;
    bool atEnd = false, stored = false;
    ASSERT_TRUE(writer_->PendingContent(0, 100, pending, scannedTo, atEnd) && pending.size() == 1);
    ASSERT_TRUE(writer_->PutContent(pending[0], Content(), "A puffin colony on the cliffs", stored));
    // 2020-01-01, 2021-06-01, 2019-05-01 and so on, at noon UTC.
    Put(kOne, false, 20, 1622548800);
    Put(kCopy, false, 5, 1556712000);
    Put(kTrips, true, 0, 1577880000);
    Put(kWalk, false, 12, 1598961600);
    Put(kGone, false, 30, 1596283200);
    Put("old/beach old.jpg", false, 1, 1598961600);  // its folder is no longer indexed
    for (const char* path : {"2020", "old"}) ASSERT_TRUE(writer_->PutFolder(FolderState{path}));
    ASSERT_TRUE(writer_->Commit());
    search_.SetShares({{"photo", share_, dir_ + "/db", {"2020"}}});
  }
  void TearDown() override { fs::remove_all(dir_); }

  // An entry of the folder its path starts with, and its file or directory on the disk.
  void Put(const std::string& path, bool isDir, std::int64_t size, std::int64_t mtime) {
    const fs::path at(path);
    const Kind kind = isDir ? Kind::kOther : KindOfExtension(ExtensionOf(at.filename().string()));
    ASSERT_TRUE(writer_->Put({at.parent_path(), at.filename(), isDir, size, mtime, kind, *at.begin()}));
    fs::create_directories(share_ / (isDir ? at : at.parent_path()));
    if (!isDir) std::ofstream(share_ / at) << "x";
  }
  std::string Scope() { return "path.real.fulltext:\"" + share_.string() + "\""; }
  Json::Value Ask(const std::string& query, int from = 0, int size = 50, int status = 200) {
    Json::Value request;
    request["from"] = from;
    request["size"] = size;
    request["query"]["query_string"]["query"] = query;
    fileindexd::SearchAnswer answer = search_.Search("_all", Json::FastWriter().write(request));
    Json::Value response;
    EXPECT_TRUE(answer.status == status && Json::Reader().parse(answer.body, response))
        << query << answer.body;
    return response;
  }

  std::string dir_;
  fs::path share_;
  std::unique_ptr<IndexWriter> writer_;
  fileindexd::SpotlightSearch search_;
};

// Files gone from the disk before the indexer saw them and entries of folders no longer indexed
// are never answered.
TEST_F(SpotlightTest, EveryFormSambaWritesSelectsTheRightFiles) {
  auto pathsOf = [this](const Json::Value& answer) {
    Paths found;
    for (const Json::Value& hit : answer["hits"]["hits"])
      found.insert(fs::path(hit["_source"]["path"]["real"].asString()).lexically_relative(share_));
    return found;
  };
  // Pages of two, each with the whole total, add up to the whole answer.
  const std::string every = "file.filename:* AND " + Scope();
  const Paths all = pathsOf(Ask(every));
  Paths paged;
  for (size_t from = 0; from < all.size() + 2; from += 2) {
    const Json::Value page = Ask(every, static_cast<int>(from), 2);
    EXPECT_EQ(page["hits"]["total"]["value"].asUInt64(), all.size()) << from;
    EXPECT_EQ(page["hits"]["hits"].size(), std::min<size_t>(2, all.size() - std::min(from, all.size())))
        << from;
    const Paths onPage = pathsOf(page);
    paged.insert(onPage.begin(), onPage.end());
  }
  EXPECT_GT(all.size(), 4u);
  EXPECT_EQ(paged, all);
  fs::remove(share_ / kGone);
  const std::vector<std::pair<std::string, Paths>> rows = {
      {"file.filename:BEACH\\ ONE.jpg", {kOne}},
      {"file.filename:*each*", {kOne, kCopy, kNotes, kWalk}},
      {"content:puffin\\ colony", {kNotes}},
      {"file.content_type:(text\\/directory)", {kTrips}},
      {"file.filesize:5 OR file.filesize:[* TO 4]", {kCopy}},  // files only
      {"file.last_modified:[* TO 2020\\-01\\-01]", {kTrips, kCopy}},
      {"meta.title:beach*", {}},      // fields the index does not hold match nothing
      {"file.filename:sunset*", {}},  // gone from the disk: no hits and a total of 0
  };
  for (const auto& [query, paths] : rows) {
    const Json::Value answer = Ask("(" + query + ") AND " + Scope());  // scoped to the share, as Samba does
    EXPECT_EQ(pathsOf(answer), paths) << query;
    EXPECT_EQ(answer["hits"]["total"]["value"].asUInt64(), paths.size()) << query;
  }
  EXPECT_EQ(Ask("beach* AND path.real.fulltext:\"/elsewhere\"")["hits"]["total"]["value"], 0);  // no share
}

TEST_F(SpotlightTest, HostileRequestsAreRefusedWithReasons) {
  for (const std::string& query : std::vector<std::string>{
           std::string(5000, '(') + "a" + std::string(5000, ')'), "(a AND b", "", std::string(40000, 'a'),
           "file.filename:" + std::string(2000, 'x'), "\"open phrase", "file.filesize:[1 TO",
           "file.filesize:{ten TO *}", "file.last_modified:2020\\-13\\-01", "a^2"})
    EXPECT_EQ(Ask(query + " AND " + Scope(), 0, 50, 400)["error"]["type"], "query_shard_exception");
  EXPECT_EQ(Ask("a*", 0, 10, 400)["error"]["type"], "query_shard_exception");  // no share scope
  EXPECT_EQ(Ask("a* AND " + Scope(), 9990, 20, 400)["error"]["type"], "illegal_argument_exception");
  EXPECT_NE(search_.Search("_all", "{\"query\":").body.find("parsing_exception"), std::string::npos);
}

}  // namespace
