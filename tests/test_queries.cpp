// Whether paths and shares are indexed, the folder list and one folder under the lock.
#include <fcntl.h>
#include <fileindex/error.h>
#include <fileindex/fileindex_c.h>
#include <fileindex/folders.h>
#include <fileindex/index_mgr.h>
#include <sys/file.h>
#include <unistd.h>

#include "support/sysroot_test.h"

using namespace TAVO::FILEINDEX;

namespace {
class QueriesTest : public SysrootTest {
 protected:
  void WriteFolders(const std::vector<std::string>& paths) {
    Json::Value conf(Json::objectValue);
    for (const std::string& path : paths) conf[path]["name"] = "n";
    WriteFile(FolderConfPath(), conf.toStyledString());
  }
};
}  // namespace

// Whole components, byte for byte; a caller's list means no file or share look-up.
TEST_F(QueriesTest, PathTestsMatchWholeComponentsByteForByte) {
  AddShare("video");
  WriteFolders({"/video/movies"});
  for (const char* path : {"/video/movies/a/b", "/video/movies/"})
    EXPECT_EQ(FILEIDXIsPathIndexed(path), 1) << path;
  for (const char* path : {"/video//movies", "/video/movies2", "/Video/movies"})
    EXPECT_EQ(FILEIDXIsPathIndexed(path), 0) << path;
  EXPECT_TRUE(IndexMgr::IsPathContainIndexed("/video"));
  EXPECT_FALSE(IndexMgr::IsPathContainIndexed("/vid"));
  EXPECT_EQ(FILEIDXIsFullPathIndexed(Rooted("/volume1/video/movies2").c_str()), 0);
  std::vector<Folder> folders;
  ASSERT_TRUE(IndexMgr::List(folders));
  ::unlink(FolderConfPath().c_str());
  fake::Get().calls.clear();
  EXPECT_TRUE(IndexMgr::IsFullPathIndexed(Rooted("/volume1/video/movies/x"), folders));
  EXPECT_TRUE(fake::Get().calls.empty());
  WriteFolders({"", "/video/movies"});  // a folder without a share name is logged and skipped
  EXPECT_EQ(FILEIDXIsShareIndexed("video"), 1);
  EXPECT_EQ(FILEIDXIsShareIndexed("Video"), 0);
  EXPECT_EQ(logcap::Count("index_mgr:"), 2);
  EXPECT_EQ(logcap::Count(" Failed to get share name from path: "), 2);
}

// No file means no folders; a broken file fails every query rather than answering "not indexed".
TEST_F(QueriesTest, AbsentConfigIsEmptyWhileABrokenOneFailsEveryQuery) {
  std::vector<Folder> folders(2);
  EXPECT_TRUE(IndexMgr::List(folders));
  EXPECT_TRUE(folders.empty());
  AddShare("video");
  WriteFile(FolderConfPath(), "{\"/video/movies\": {}");
  Json::Value result;
  EXPECT_FALSE(IndexMgr::List(folders));
  EXPECT_FALSE(IndexMgr::IsPathContainIndexed("/video"));
  EXPECT_EQ(FILEIDXIsShareIndexed("video"), 0);
  EXPECT_FALSE(IndexMgr::Get(result, "/video/movies"));
  EXPECT_EQ(ErrorHandler::GetError(), FILEINDEX_ERR_LOAD_CONFIG);
}

// Get fails with a lock error while another holder has the lock, and releases it on every path.
TEST_F(QueriesTest, GetTakesTheLockAndReleasesItOnEveryWayOut) {
  AddShare("video");
  WriteFolders({"/video/movies"});
  int fd = ::open(Rooted("/tmp/fileidx_cfg_folder.lock").c_str(), O_RDWR | O_CREAT | O_CLOEXEC, 0644);
  ASSERT_EQ(::flock(fd, LOCK_EX), 0);  // another open file, so the library's own flock conflicts
  Json::Value result;
  EXPECT_FALSE(IndexMgr::Get(result, "/video/movies"));
  EXPECT_EQ(ErrorHandler::GetError(), FILEINDEX_ERR_LOCK);
  ::close(fd);
  EXPECT_FALSE(IndexMgr::Get(result, "/video/other"));
  EXPECT_EQ(ErrorHandler::GetError(), FILEINDEX_ERR_NO_SUCH_FOLDER);
  ASSERT_TRUE(IndexMgr::Get(result, "/video/movies"));
  EXPECT_EQ(result["path"], "/video/movies");
  WriteFile(FolderConfPath(), "[]");
  EXPECT_FALSE(IndexMgr::Get(result, "/video/movies"));
  Folders config;
  EXPECT_TRUE(config.Lock(true));  // every call above let go of the lock
  config.Unlock();
}
