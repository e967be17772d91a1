// Folders: the governing folder of a path, and loading, listing and changing folder.conf.
#include <fileindex/error.h>
#include <fileindex/folders.h>
#include <fileindex/utils.h>

#include "support/sysroot_test.h"

using namespace TAVO::FILEINDEX;

class FoldersTest : public SysrootTest {
 protected:
  static Folder Make(const std::string& path, const std::string& record) {
    Folder folder;
    folder.Load(path, ParseJson(record));
    return folder;
  }
  Folders folders_;
};

// An unresolvable path sets its code and logs when asked for. The last folder matching whole path
// components governs, not the deepest; listing a share matches its name exactly.
TEST_F(FoldersTest, PathsMatchWholeComponentsAndShareNamesExactly) {
  AddShare("photo");
  Folder gone = Make("/gone/x", "{}");
  EXPECT_EQ(ErrorHandler::GetError(), FILEINDEX_ERR_BAD_PATH);
  EXPECT_EQ(gone.GetFullPath(), "");
  EXPECT_EQ(logcap::Count(" Failed to get full path from /gone/x"), 1);
  Folder outer = Make("/photo/a", R"({"name": "outer"})");
  Folder inner = Make("/photo/a/b", R"({"name": "inner"})");
  EXPECT_EQ(GetMostSuitableCfg({inner, outer}, Rooted("/volume1/photo/a/b/c"))["name"], "outer");
  EXPECT_EQ(GetMostSuitableCfg({inner, Make("/photo/a/bc", "{}")}, Rooted("/volume1/photo/a/bcd")),
            ParseJson("{}"));
  WriteFile(FolderConfPath(), R"({"/photo/a": {}, "/photos/x": {}, "/Photo/z": {}})");
  ASSERT_TRUE(folders_.Load());
  std::vector<Folder> out(3);
  ASSERT_TRUE(folders_.List(out, "photo"));
  ASSERT_EQ(out.size(), 1u);
  EXPECT_EQ(out[0].GetPath(), "/photo/a");
}

// A non-object file is refused with its log line. A new folder reports the flags that differ from
// its covering folder's; the 1001st folder is refused while updates still pass.
TEST_F(FoldersTest, LoadAndUpsertValidateTheirInput) {
  WriteFile(FolderConfPath(), "[1]");
  EXPECT_FALSE(folders_.Load());
  EXPECT_TRUE(logcap::Contains(" Malformed folders: [1]"));
  Json::Value conf(Json::objectValue);
  for (int i = 0; i < 998; ++i) conf["/photo/" + std::to_string(i)]["document"] = true;
  conf["/photo/2019"] = ParseJson(R"({"document": false, "audio": false, "video": true, "photo": true})");
  AddShare("photo");
  WriteFile(FolderConfPath(), conf.toStyledString());
  ASSERT_TRUE(folders_.Load());
  Json::Value result;
  ASSERT_TRUE(folders_.Upsert(result, ParseJson(R"({"path": "/photo/2019/x", "photo": true})")));
  EXPECT_EQ(result, ParseJson(R"({"document":false,"audio":false,"video":true,"photo":false})"));
  EXPECT_TRUE(folders_.Upsert(result, ParseJson(R"({"path": "/photo/5"})")));
  EXPECT_FALSE(folders_.Upsert(result, ParseJson(R"({"path": "/photo/new1001"})")));
  EXPECT_EQ(ErrorHandler::GetError(), FILEINDEX_ERR_EXCEED_MAX_FOLDER);
  EXPECT_TRUE(logcap::Contains(" Exceed max folder size"));
}
