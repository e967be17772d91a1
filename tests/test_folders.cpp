// The folder record, the governing folder of a path and the folder.conf collection.
#include <fileindex/error.h>
#include <fileindex/folders.h>
#include <fileindex/utils.h>
#include "support/sysroot_test.h"

using namespace TAVO::FILEINDEX;

namespace {
class FoldersTest : public SysrootTest {
 protected:
  void SetUp() override { SysrootTest::SetUp(); AddShare("photo"); AddShare("video"); }
  std::string Full(const std::string& path) { return Rooted("/volume1") + path; }
  void Load(const std::string& conf) { WriteFile(FolderConfPath(), conf); ASSERT_TRUE(folders_.Load()); }
  static Folder Make(const std::string& path, const std::string& record) {
    Folder folder;
    folder.Load(path, ParseJson(record));
    return folder;
  }
  Folders folders_;
  Json::Value result_;
  const Json::Value kNone = ParseJson(R"({"document":false,"audio":false,"video":false,"photo":false})");
  const Json::Value kAll = ParseJson(R"({"document":true,"audio":true,"video":true,"photo":true})");
};
}  // namespace

// Load keeps previous values for mistyped members; an unknown share is looked up again on each call.
TEST_F(FoldersTest, RecordKeepsMistypedMembersAndResolvesAgainWhileUnresolved) {
  Folder folder = Make("/photo/2019", R"({"name": "2019", "document": true, "video": true})");
  folder.Load("/photo/2019", ParseJson(R"({"name": 7, "document": "no", "audio": true, "video": false})"));
  EXPECT_EQ(folder.asJson(), ParseJson(R"({"path": "/photo/2019", "name": "2019", "document": true,
                                           "audio": true, "video": false, "photo": false})"));
  Folder gone = Make("/gone/x", "{}");
  EXPECT_EQ(ErrorHandler::GetError(), FILEINDEX_ERR_BAD_PATH);
  fake::Get().calls.clear();
  EXPECT_EQ(gone.GetFullPath(), "");
  EXPECT_EQ(logcap::Count("folder:"), 1);
  EXPECT_EQ(logcap::Count(" Failed to get full path from /gone/x"), 1);
  AddShare("gone", "/volume2");
  EXPECT_EQ(gone.GetFullPath(), Rooted("/volume2/gone/x"));
  EXPECT_EQ(fake::CallsStartingWith("TAVOShareGet").size(), 2u);
}

// The last folder matching whole path components wins; "/a/bc" does not cover "/a/b".
TEST_F(FoldersTest, MostSuitableCfgIsTheLastWholeComponentMatch) {
  AddShare("a");
  Folder outer = Make("/a", R"({"name": "outer"})"), inner = Make("/a/b", R"({"name": "inner"})");
  Folder sibling = Make("/a/bc", "{}"), unresolved = Make("/gone", "{}");
  EXPECT_EQ(GetMostSuitableCfg({outer, inner}, Full("/a/b/c"))["name"], "inner");
  EXPECT_EQ(GetMostSuitableCfg({inner, outer}, Full("/a/b/c"))["name"], "outer");
  EXPECT_EQ(GetMostSuitableCfg({outer, sibling}, Full("/a/b"))["name"], "outer");
  EXPECT_EQ(GetMostSuitableCfg({inner, sibling, unresolved}, Full("/a/ab")), Json::Value(Json::objectValue));
}

// A non-object file is refused; flags without valid values carry over from the previous record.
TEST_F(FoldersTest, LoadChecksShapeCarriesFlagsOverAndKeepsUnresolvedFolders) {
  WriteFile(FolderConfPath(), "[1]");
  EXPECT_FALSE(folders_.Load());
  EXPECT_EQ(ErrorHandler::GetError(), FILEINDEX_ERR_MALFORMED_CONFIG);
  EXPECT_TRUE(logcap::Contains(" Malformed folders: [1]"));
  Load(R"({"/photo/a": {"name": "a", "document": true, "audio": false, "video": true, "photo": false},
           "/photo/b": {"video": "yes"}, "/zz/c": {"name": "c"}})");
  std::vector<Folder> all;
  ASSERT_TRUE(folders_.List(all));
  ASSERT_EQ(all.size(), 3u);
  ASSERT_TRUE(folders_.Save());
  EXPECT_EQ(ReadJson(FolderConfPath())["/photo/b"], ParseJson(R"({"path": "/photo/b", "name": "",
      "document": true, "audio": false, "video": true, "photo": false})"));
}

// Upsert returns the flags that changed (against the covering folder for a new one) and validates input.
TEST_F(FoldersTest, UpsertReportsChangedFlagsAndUpdatesPartially) {
  Load(R"({"/photo/2019": {"name": "2019", "document": false, "audio": false, "video": true, "photo": true}})");
  ASSERT_TRUE(folders_.Upsert(result_, ParseJson(R"({"path": "/photo/2019", "video": false})")));
  EXPECT_EQ(result_, ParseJson(R"({"document":false,"audio":false,"video":true,"photo":false})"));
  Json::Value stored;
  ASSERT_TRUE(folders_.Get(stored, "/photo/2019"));
  EXPECT_EQ(stored["name"], "2019");
  Json::Value request = ParseJson(R"({"path": "/photo/2019/x", "photo": true})");
  ASSERT_TRUE(folders_.Upsert(result_, request));
  EXPECT_EQ(result_, kNone);
  request["path"] = "/video/new";
  ASSERT_TRUE(folders_.Upsert(result_, request));
  EXPECT_EQ(result_, kAll);
  request["path"] = "/gone/x";
  result_ = "untouched";
  EXPECT_FALSE(folders_.Upsert(result_, request));
  EXPECT_EQ(ErrorHandler::GetError(), FILEINDEX_ERR_BAD_PARAM);
  EXPECT_TRUE(logcap::Contains(" Bad param: {\"path\":\"/gone/x\",\"photo\":true}"));
  EXPECT_EQ(result_, "untouched");
  EXPECT_FALSE(folders_.Get(stored, "/photo/2019/"));  // no trailing-slash normalisation
  EXPECT_EQ(ErrorHandler::GetError(), FILEINDEX_ERR_NO_SUCH_FOLDER);
}

// The 1001st folder is refused (updates still pass), though it stays in memory.
TEST_F(FoldersTest, AThousandFoldersAtMost) {
  Json::Value conf(Json::objectValue);
  for (int i = 0; i < 999; ++i) conf["/photo/" + std::to_string(i)]["document"] = true;
  Load(conf.toStyledString());
  EXPECT_TRUE(folders_.Upsert(result_, ParseJson(R"({"path": "/photo/new1000"})")));
  EXPECT_TRUE(folders_.Upsert(result_, ParseJson(R"({"path": "/photo/5"})")));
  EXPECT_FALSE(folders_.Upsert(result_, ParseJson(R"({"path": "/photo/new1001"})")));
  EXPECT_EQ(ErrorHandler::GetError(), FILEINDEX_ERR_EXCEED_MAX_FOLDER);
  EXPECT_TRUE(logcap::Contains(" Exceed max folder size"));
}

// Delete reports flag changes keyed by path; an unknown share succeeds without output.
TEST_F(FoldersTest, DeleteWrapsTheFlagChangesInAnObjectKeyedByThePath) {
  Load(R"({"/photo/a": {"document": true, "audio": false, "video": true, "photo": false},
           "/photo/a/b": {"document": true, "audio": true, "video": false, "photo": false}})");
  ASSERT_TRUE(folders_.Delete(result_, "/photo/a/b"));
  EXPECT_EQ(result_, ParseJson(R"({"/photo/a/b": {"document":false,"audio":true,"video":true,"photo":false}})"));
  ASSERT_TRUE(folders_.Delete(result_, "/video/outside"));
  EXPECT_EQ(result_["/video/outside"], kAll);
  result_ = "untouched";
  EXPECT_TRUE(folders_.Delete(result_, "/gone/x"));
  EXPECT_EQ(result_, "untouched");
}

// Share membership is the exact, case-sensitive first path component.
TEST_F(FoldersTest, ListByShareMatchesTheWholeShareName) {
  Load(R"({"/photo/b": {}, "/photos/x": {}, "/gone/y": {}, "/photo/a": {}, "/Photo/z": {}, "": {}})");
  std::vector<Folder> out(3);
  ASSERT_TRUE(folders_.List(out, "photo"));
  ASSERT_EQ(out.size(), 2u);
  EXPECT_EQ(out[0].GetPath() + out[1].GetPath(), "/photo/a/photo/b");
  ASSERT_TRUE(folders_.List(out, "gone"));
  EXPECT_EQ(out.size(), 1u);
}
