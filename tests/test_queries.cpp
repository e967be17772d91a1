// Whether paths and shares are indexed, the folder list and one folder under the lock.
#include <fcntl.h>
#include <fileindex/error.h>
#include <fileindex/fileindex_c.h>
#include <fileindex/folders.h>
#include <fileindex/index_mgr.h>
#include <sys/file.h>
#include <sys/wait.h>
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
  for (const char* path : {"/video/movies/a/b", "/video/movies/"}) EXPECT_EQ(FILEIDXIsPathIndexed(path), 1) << path;
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
  // A folder without a share name is logged and skipped.
  WriteFolders({"", "/video/movies"});
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

// Get fails with a lock error while another process holds the lock, and releases it on every path.
TEST_F(QueriesTest, GetTakesTheLockAndReleasesItOnEveryWayOut) {
  AddShare("video");
  WriteFolders({"/video/movies"});
  int ready[2], release[2];
  ASSERT_EQ(::pipe(ready) | ::pipe(release), 0);
  const pid_t child = ::fork();
  if (child == 0) {
    int fd = ::open(Rooted("/tmp/fileidx_cfg_folder.lock").c_str(), O_RDWR | O_CREAT, 0644);
    char c = 'x';
    if (fd < 0 || ::flock(fd, LOCK_EX) != 0 || ::write(ready[1], &c, 1) != 1) ::_exit(1);
    ::close(release[1]);
    ::_exit(::read(release[0], &c, 1) < 0 ? 1 : 0);  // EOF once the parent closes its end
  }
  char c;
  ::close(release[0]), ::close(ready[1]);
  ASSERT_EQ(::read(ready[0], &c, 1), 1);
  Json::Value result;
  EXPECT_FALSE(IndexMgr::Get(result, "/video/movies"));
  EXPECT_EQ(ErrorHandler::GetError(), FILEINDEX_ERR_LOCK);
  ::close(release[1]);
  int status = 0;
  ASSERT_EQ(::waitpid(child, &status, 0), child);
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

// Loading many folders looks each share up once, with the same result as resolving each alone.
TEST_F(QueriesTest, LoadingManyFoldersLooksEachShareUpOnce) {
  std::vector<std::string> paths;
  for (int share = 0; share < 3; ++share) {
    if (share < 2) AddShare("s" + std::to_string(share), share ? "/volume2" : "/volume1");  // s2 is unknown
    for (int i = 0; i < 50; ++i) paths.push_back("/s" + std::to_string(share) + "/d" + std::to_string(i));
  }
  WriteFolders(paths);
  fake::Get().calls.clear();
  Folders folders;
  ASSERT_TRUE(folders.Load());
  EXPECT_EQ(fake::CallsStartingWith("TAVOShareGet").size(), 3u);
  std::vector<Folder> loaded;
  folders.List(loaded);
  ASSERT_EQ(loaded.size(), 150u);
  EXPECT_EQ(loaded[50].GetFullPath(), Rooted("/volume2/s1/d0"));
  EXPECT_EQ(loaded[100].GetFullPath(), "");
}
