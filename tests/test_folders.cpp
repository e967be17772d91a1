// The folder record, the governing folder of a path and the folder.conf collection.
#include <fileindex/error.h>
#include <fileindex/folders.h>
#include <fileindex/utils.h>

#include "support/sysroot_test.h"

using namespace TAVO::FILEINDEX;

namespace {
class FoldersTest : public SysrootTest {
 protected:
  void Load(const std::string& conf) {
    AddShare("photo");
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

// Load keeps previous values for mistyped members; an unresolvable path logs when asked for. The
// last folder matching whole path components governs; "a/bc" does not cover "a/b".
TEST_F(FoldersTest, RecordKeepsMistypedMembersAndTheLastWholeComponentMatchGoverns) {
  AddShare("photo");
  Folder folder = Make("/photo/2019", R"({"name": "2019", "document": true, "video": true})");
  folder.Load("/photo/2019", ParseJson(R"({"name": 7, "document": "no", "audio": true, "video": false})"));
  EXPECT_EQ(folder.asJson(), ParseJson(R"({"path": "/photo/2019", "name": "2019", "document": true,
                                           "audio": true, "video": false, "photo": false})"));
  Folder gone = Make("/gone/x", "{}"), sibling = Make("/photo/a/bc", "{}");
  EXPECT_EQ(ErrorHandler::GetError(), FILEINDEX_ERR_BAD_PATH);
  EXPECT_EQ(gone.GetFullPath(), "");
  EXPECT_EQ(logcap::Count(" Failed to get full path from /gone/x"), 1);
  Folder outer = Make("/photo/a", R"({"name": "outer"})"), inner = Make("/photo/a/b", R"({"name": "inner"})");
  EXPECT_EQ(GetMostSuitableCfg({outer, inner}, Rooted("/volume1/photo/a/b/c"))["name"], "inner");
  EXPECT_EQ(GetMostSuitableCfg({inner, outer}, Rooted("/volume1/photo/a/b/c"))["name"], "outer");
  EXPECT_EQ(GetMostSuitableCfg({outer, sibling}, Rooted("/volume1/photo/a/b"))["name"], "outer");
  EXPECT_EQ(GetMostSuitableCfg({inner, sibling}, Rooted("/volume1/photo/a/bcd")), ParseJson("{}"));
}

// A non-object file is refused; flags without valid values carry over from the previous record on
// load and save; a delete reports flag changes keyed by path; listing a share matches its name exactly.
TEST_F(FoldersTest, LoadSaveDeleteAndListByShare) {
  WriteFile(FolderConfPath(), "[1]");
  EXPECT_FALSE(folders_.Load());
  EXPECT_EQ(ErrorHandler::GetError(), FILEINDEX_ERR_MALFORMED_CONFIG);
  EXPECT_TRUE(logcap::Contains(" Malformed folders: [1]"));
  Load(R"({"/photo/a": {"name": "a", "document": true, "audio": false, "video": true, "photo": true},
           "/photo/a/b": {"document": "yes", "audio": true, "video": false},
           "/photos/x": {}, "/Photo/z": {}})");
  ASSERT_TRUE(folders_.Save());
  EXPECT_EQ(ReadJson(FolderConfPath())["/photo/a/b"], ParseJson(R"({"path": "/photo/a/b", "name": "",
      "document": true, "audio": true, "video": false, "photo": true})"));
  ASSERT_TRUE(folders_.Delete(result_, "/photo/a/b"));
  EXPECT_EQ(result_,
            ParseJson(R"({"/photo/a/b":{"document":false,"audio":true,"video":true,"photo":false}})"));
  std::vector<Folder> out(3);
  ASSERT_TRUE(folders_.List(out, "photo"));
  ASSERT_EQ(out.size(), 1u);
  EXPECT_EQ(out[0].GetPath(), "/photo/a");
}

// Upsert returns the flags that changed (against the covering folder for a new one) and validates
// input; the 1001st folder is refused while updates still pass.
TEST_F(FoldersTest, UpsertReportsChangedFlagsAndValidatesInput) {
  Json::Value conf(Json::objectValue);
  for (int i = 0; i < 998; ++i) conf["/photo/" + std::to_string(i)]["document"] = true;
  conf["/photo/2019"] = ParseJson(R"({"document": false, "audio": false, "video": true, "photo": true})");
  Load(conf.toStyledString());
  ASSERT_TRUE(folders_.Upsert(result_, ParseJson(R"({"path": "/photo/2019", "video": false})")));
  EXPECT_EQ(result_, ParseJson(R"({"document":false,"audio":false,"video":true,"photo":false})"));
  Json::Value request = ParseJson(R"({"path": "/photo/2019/x", "photo": true})");
  ASSERT_TRUE(folders_.Upsert(result_, request));
  EXPECT_EQ(result_, ParseJson(R"({"document":false,"audio":false,"video":false,"photo":false})"));
  EXPECT_TRUE(folders_.Upsert(result_, ParseJson(R"({"path": "/photo/5"})")));
  EXPECT_FALSE(folders_.Upsert(result_, ParseJson(R"({"path": "/photo/new1001"})")));
  EXPECT_EQ(ErrorHandler::GetError(), FILEINDEX_ERR_EXCEED_MAX_FOLDER);
  EXPECT_TRUE(logcap::Contains(" Exceed max folder size"));
  request["path"] = "/gone/x";
  EXPECT_FALSE(folders_.Upsert(result_, request));
  EXPECT_EQ(ErrorHandler::GetError(), FILEINDEX_ERR_BAD_PARAM);
  EXPECT_TRUE(logcap::Contains(" Bad param: {\"path\":\"/gone/x\",\"photo\":true}"));
  EXPECT_FALSE(folders_.Get(result_, "/photo/2019/"));  // no trailing-slash normalisation
  EXPECT_EQ(ErrorHandler::GetError(), FILEINDEX_ERR_NO_SUCH_FOLDER);
}
