// The folder record, the governing folder of a path and the folder.conf collection.
#include <fileindex/error.h>
#include <fileindex/folders.h>
#include <fileindex/utils.h>

#include "support/sysroot_test.h"

using namespace TAVO::FILEINDEX;

namespace {

Json::Value Flags(bool document, bool audio, bool video, bool photo) {
  Json::Value flags(Json::objectValue);
  flags["document"] = document;
  flags["audio"] = audio;
  flags["video"] = video;
  flags["photo"] = photo;
  return flags;
}

class FoldersTest : public SysrootTest {
 protected:
  void SetUp() override {
    SysrootTest::SetUp();
    AddShare("photo");
    AddShare("video");
  }
  std::string Full(const std::string& path) { return Rooted("/volume1") + path; }
  // Writes folder.conf and loads it.
  void Load(const std::string& conf) {
    WriteFile(FolderConfPath(), conf);
    ASSERT_TRUE(folders_.Load());
  }
  static Folder Make(const std::string& path, const std::string& record) {
    Folder folder;
    folder.Load(path, ParseJson(record));
    return folder;
  }
  Folders folders_;
  Json::Value result_;
};

}  // namespace

TEST_F(FoldersTest, RecordKeepsMistypedMembersAndResolvesAgainWhileUnresolved) {
  Folder folder = Make("/photo/2019", R"({"name": "2019", "document": true, "video": true})");
  const Json::Value mistyped = ParseJson(R"({"name": 7, "document": "no", "audio": true, "video": false})");
  folder.Load("/photo/2019", mistyped);
  EXPECT_EQ(folder.asJson(), ParseJson(R"({"path": "/photo/2019", "name": "2019", "document": true,
                                           "audio": true, "video": false, "photo": false})"));
  folder.Reload("/photo/2019", mistyped);
  EXPECT_FALSE(folder.IsDocument());
  EXPECT_EQ(folder.GetName(), "");
  Json::Value array(Json::arrayValue);
  EXPECT_FALSE(folder.AddToJson(array));
  EXPECT_EQ(array.size(), 0u);

  // A folder of an unknown share: every GetFullPath() asks the platform again.
  Folder gone = Make("/gone/x", "{}");
  EXPECT_EQ(ErrorHandler::GetError(), FILEINDEX_ERR_BAD_PATH);
  fake::Get().calls.clear();
  EXPECT_EQ(gone.GetFullPath(), "");
  EXPECT_EQ(gone.GetFullPath(), "");
  EXPECT_EQ(logcap::Count("folder:"), 2);
  EXPECT_EQ(logcap::Count(" Failed to get full path from /gone/x"), 2);
  AddShare("gone", "/volume2");
  EXPECT_EQ(gone.GetFullPath(), Rooted("/volume2/gone/x"));
  EXPECT_EQ(fake::CallsStartingWith("TAVOShareGet").size(), 3u);
}

TEST_F(FoldersTest, MostSuitableCfgIsTheLastWholeComponentMatch) {
  AddShare("a");
  Folder outer = Make("/a", R"({"name": "outer"})"), inner = Make("/a/b", R"({"name": "inner"})");
  Folder sibling = Make("/a/bc", "{}"), unresolved = Make("/gone", "{}");
  EXPECT_EQ(GetMostSuitableCfg({outer, inner}, Full("/a/b/c"))["name"], "inner");
  EXPECT_EQ(GetMostSuitableCfg({inner, outer}, Full("/a/b/c"))["name"], "outer");
  EXPECT_EQ(GetMostSuitableCfg({outer, sibling}, Full("/a/b"))["name"], "outer");
  EXPECT_EQ(GetMostSuitableCfg({inner, sibling, unresolved}, Full("/a/ab")), Json::Value(Json::objectValue));
  EXPECT_EQ(GetMostSuitableCfg({}, Full("/a")), Json::Value(Json::objectValue));
}

TEST_F(FoldersTest, LoadChecksShapeCarriesFlagsOverAndKeepsUnresolvedFolders) {
  WriteFile(FolderConfPath(), "[1]");
  Folders malformed;
  EXPECT_FALSE(malformed.Load());
  EXPECT_EQ(ErrorHandler::GetError(), FILEINDEX_ERR_MALFORMED_CONFIG);
  EXPECT_TRUE(logcap::Contains("folders:") && logcap::Contains(" Malformed folders: [1]"));

  // /photo/b has no valid flags of its own: it keeps those of /photo/a, read before it.
  Load(R"({"/photo/a": {"name": "a", "document": true, "audio": false, "video": true, "photo": false},
           "/photo/b": {"video": "yes"}, "/zz/c": {"name": "c"}})");
  std::vector<Folder> all;
  ASSERT_TRUE(folders_.List(all));
  ASSERT_EQ(all.size(), 3u);
  const Json::Value expected = ParseJson(R"({"path": "/photo/b", "name": "", "document": true,
                                             "audio": false, "video": true, "photo": false})");
  EXPECT_EQ(all[1].asJson(), expected);
  EXPECT_EQ(all[1].GetFullPath(), Full("/photo/b"));
  EXPECT_EQ(all[2].GetFullPath(), "");
  ASSERT_TRUE(folders_.Save());
  EXPECT_EQ(ReadJson(FolderConfPath())["/photo/b"], expected);
}

TEST_F(FoldersTest, UpsertReportsChangedFlagsAndUpdatesPartially) {
  Load(
      R"({"/photo/2019": {"name": "2019", "document": false, "audio": false, "video": true, "photo": true}})");
  ASSERT_TRUE(folders_.Upsert(result_, ParseJson(R"({"path": "/photo/2019", "video": false})")));
  EXPECT_EQ(result_, Flags(false, false, true, false));
  Json::Value stored;
  ASSERT_TRUE(folders_.Get(stored, "/photo/2019"));
  const Json::Value expected = ParseJson(R"({"path": "/photo/2019", "name": "2019", "document": false,
                                             "audio": false, "video": false, "photo": true})");
  EXPECT_EQ(stored, expected);

  // A new folder with its covering folder's flags changes nothing; one without a cover, all.
  Json::Value request = ParseJson(R"({"path": "/photo/2019/x", "photo": true})");
  ASSERT_TRUE(folders_.Upsert(result_, request));
  EXPECT_EQ(result_, Flags(false, false, false, false));
  request["path"] = "/video/new";
  ASSERT_TRUE(folders_.Upsert(result_, request));
  EXPECT_EQ(result_, Flags(true, true, true, true));

  request["path"] = "/gone/x";
  result_ = "untouched";
  EXPECT_FALSE(folders_.Upsert(result_, request));
  EXPECT_EQ(ErrorHandler::GetError(), FILEINDEX_ERR_BAD_PARAM);
  EXPECT_TRUE(logcap::Contains(" Bad param: {\"path\":\"/gone/x\",\"photo\":true}"));
  EXPECT_FALSE(folders_.Upsert(result_, ParseJson(R"({"path": 1})")));
  EXPECT_EQ(result_, "untouched");

  EXPECT_FALSE(folders_.Get(stored, "/photo/2019/"));
  EXPECT_EQ(ErrorHandler::GetError(), FILEINDEX_ERR_NO_SUCH_FOLDER);
  EXPECT_TRUE(logcap::Contains(" No such folder: /photo/2019/"));
  EXPECT_EQ(stored, expected);
}

TEST_F(FoldersTest, AThousandFoldersAtMost) {
  Json::Value conf(Json::objectValue);
  for (int i = 0; i < 999; ++i) conf["/photo/" + std::to_string(i)]["document"] = true;
  Load(conf.toStyledString());
  EXPECT_TRUE(folders_.Upsert(result_, ParseJson(R"({"path": "/photo/new1000"})")));
  EXPECT_TRUE(folders_.Upsert(result_, ParseJson(R"({"path": "/photo/5"})"))) << "an update adds nothing";
  EXPECT_FALSE(folders_.Upsert(result_, ParseJson(R"({"path": "/photo/new1001"})")));
  EXPECT_EQ(ErrorHandler::GetError(), FILEINDEX_ERR_EXCEED_MAX_FOLDER);
  EXPECT_TRUE(logcap::Contains("folders:") && logcap::Contains(" Exceed max folder size"));
  std::vector<Folder> all;
  folders_.List(all);
  EXPECT_EQ(all.size(), 1001u) << "the refused folder stays in memory";
}

TEST_F(FoldersTest, DeleteWrapsTheFlagChangesInAnObjectKeyedByThePath) {
  Load(R"({"/photo/a": {"document": true, "audio": false, "video": true, "photo": false},
           "/photo/a/b": {"document": true, "audio": true, "video": false, "photo": false}})");
  ASSERT_TRUE(folders_.Delete(result_, "/photo/a/b"));
  EXPECT_EQ(result_, ParseJson(R"({"/photo/a/b": {"document": false, "audio": true, "video": true,
                                                  "photo": false}})"));
  ASSERT_TRUE(folders_.Delete(result_, "/photo/a/unconfigured"));
  EXPECT_EQ(result_["/photo/a/unconfigured"], Flags(false, false, false, false));
  ASSERT_TRUE(folders_.Delete(result_, "/video/outside"));
  EXPECT_EQ(result_["/video/outside"], Flags(true, true, true, true));
  result_ = "untouched";
  EXPECT_TRUE(folders_.Delete(result_, "/gone/x"));
  EXPECT_EQ(result_, "untouched");
  std::vector<Folder> left;
  folders_.List(left);
  ASSERT_EQ(left.size(), 1u);
  EXPECT_EQ(left[0].GetPath(), "/photo/a");
}

TEST_F(FoldersTest, ListByShareMatchesTheWholeShareName) {
  Load(R"({"/photo/b": {}, "/photos/x": {}, "/gone/y": {}, "/photo/a": {}, "/Photo/z": {}, "": {}})");
  std::vector<Folder> out(3);
  ASSERT_TRUE(folders_.List(out, "photo"));
  ASSERT_EQ(out.size(), 2u);
  EXPECT_EQ(out[0].GetPath() + out[1].GetPath(), "/photo/a/photo/b");
  // The share is named by the path alone: a share the platform does not know still
  // names its folders, while a path without a share name belongs to no share.
  ASSERT_TRUE(folders_.List(out, "gone"));
  ASSERT_EQ(out.size(), 1u);
  EXPECT_EQ(out[0].GetFullPath(), "");
  ASSERT_TRUE(folders_.List(out));
  ASSERT_EQ(out.size(), 6u);
  EXPECT_EQ(out[0].GetPath(), "");
}
