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

// Holds an exclusive flock on path in a child process until the returned descriptor is closed.
pid_t HoldLockInChild(const std::string& path, int& releaseFd) {
  int ready[2], release[2];
  if (::pipe(ready) != 0 || ::pipe(release) != 0) return -1;
  pid_t pid = ::fork();
  if (pid == 0) {
    ::close(ready[0]);
    ::close(release[1]);
    int fd = ::open(path.c_str(), O_RDWR | O_CREAT, 0644);
    char c = 'x';
    if (fd < 0 || ::flock(fd, LOCK_EX) != 0 || ::write(ready[1], &c, 1) != 1) ::_exit(1);
    ::_exit(::read(release[0], &c, 1) < 0 ? 1 : 0);  // EOF once the parent closes its end
  }
  ::close(ready[1]);
  ::close(release[0]);
  char c;
  EXPECT_EQ(::read(ready[0], &c, 1), 1);
  ::close(ready[0]);
  releaseFd = release[1];
  return pid;
}

}  // namespace

TEST_F(QueriesTest, PathTestsMatchWholeComponentsByteForByte) {
  AddShare("video");
  WriteFolders({"/video/movies"});
  for (const char* path : {"/video/movies", "/video/movies/a/b", "/video/movies/", "/video/movies//a"})
    EXPECT_EQ(FILEIDXIsPathIndexed(path), 1) << path;
  for (const char* path : {"/video//movies", "/video/movies2", "/video", "/Video/movies", "/"})
    EXPECT_EQ(FILEIDXIsPathIndexed(path), 0) << path;
  EXPECT_TRUE(IndexMgr::IsPathContainIndexed("/video"));
  EXPECT_TRUE(IndexMgr::IsPathContainIndexed("/video/movies"));
  for (const char* path : {"/video/movies/a", "/video/", "/vid", "/"})
    EXPECT_FALSE(IndexMgr::IsPathContainIndexed(path)) << path;
  EXPECT_EQ(FILEIDXIsFullPathIndexed(Rooted("/volume1/video/movies/x").c_str()), 1);
  EXPECT_EQ(FILEIDXIsFullPathIndexed(Rooted("/volume1/video/movies2").c_str()), 0);

  // With the caller's list no file is read and no share is looked up again.
  std::vector<Folder> folders;
  ASSERT_TRUE(IndexMgr::List(folders));
  ::unlink(FolderConfPath().c_str());
  fake::Get().calls.clear();
  EXPECT_TRUE(IndexMgr::IsPathIndexed("/video/movies/a", folders));
  EXPECT_TRUE(IndexMgr::IsPathContainIndexed("/video", folders));
  EXPECT_TRUE(IndexMgr::IsFullPathIndexed(Rooted("/volume1/video/movies"), folders));
  EXPECT_TRUE(fake::Get().calls.empty());

  // A folder without a share name is logged on every pass and skipped.
  WriteFolders({"", "/video/movies"});
  logcap::Clear();
  EXPECT_EQ(FILEIDXIsShareIndexed("video"), 1);
  EXPECT_EQ(FILEIDXIsShareIndexed("Video"), 0);
  EXPECT_EQ(FILEIDXIsShareIndexed("vid"), 0);
  EXPECT_EQ(logcap::Count("index_mgr:"), 3);
  EXPECT_EQ(logcap::Count(" Failed to get share name from path: "), 3);
}

TEST_F(QueriesTest, AbsentConfigIsEmptyWhileABrokenOneFailsEveryQuery) {
  std::vector<Folder> folders(2);
  EXPECT_TRUE(IndexMgr::List(folders));
  EXPECT_TRUE(folders.empty());
  EXPECT_FALSE(IndexMgr::IsPathContainIndexed("/"));
  EXPECT_FALSE(IndexMgr::IsFullPathIndexed("/x"));

  AddShare("video");
  for (const char* text : {"[\"/video/movies\"]", "{\"/video/movies\": {}"}) {
    WriteFile(FolderConfPath(), text);
    Json::Value result;
    EXPECT_FALSE(IndexMgr::List(folders)) << text;
    EXPECT_FALSE(IndexMgr::IsPathIndexed("/video/movies")) << text;
    EXPECT_FALSE(IndexMgr::IsPathContainIndexed("/video")) << text;
    EXPECT_EQ(FILEIDXIsShareIndexed("video"), 0) << text;
    EXPECT_EQ(FILEIDXIsFullPathIndexed(Rooted("/volume1/video/movies").c_str()), 0) << text;
    EXPECT_FALSE(IndexMgr::Get(result, "/video/movies")) << text;
  }
  EXPECT_EQ(ErrorHandler::GetError(), FILEINDEX_ERR_LOAD_CONFIG);
}

TEST_F(QueriesTest, GetTakesTheLockAndReleasesItOnEveryWayOut) {
  AddShare("video");
  WriteFolders({"/video/movies"});
  Json::Value result;
  int releaseFd = -1;
  pid_t child = HoldLockInChild(Rooted("/tmp/fileidx_cfg_folder.lock"), releaseFd);
  ASSERT_GT(child, 0);
  EXPECT_FALSE(IndexMgr::Get(result, "/video/movies"));
  EXPECT_EQ(ErrorHandler::GetError(), FILEINDEX_ERR_LOCK);
  ::close(releaseFd);
  int status = 0;
  ASSERT_EQ(::waitpid(child, &status, 0), child);
  EXPECT_TRUE(WIFEXITED(status) && WEXITSTATUS(status) == 0);

  EXPECT_FALSE(IndexMgr::Get(result, "/video/other"));
  EXPECT_EQ(ErrorHandler::GetError(), FILEINDEX_ERR_NO_SUCH_FOLDER);
  ASSERT_TRUE(IndexMgr::Get(result, "/video/movies"));
  EXPECT_EQ(result["path"], "/video/movies");
  WriteFile(FolderConfPath(), "[]");
  EXPECT_FALSE(IndexMgr::Get(result, "/video/movies"));
  // Each call above let go of the lock, or this one would find it held.
  Folders config;
  EXPECT_TRUE(config.Lock(true));
  config.Unlock();
}

TEST_F(QueriesTest, LoadingAThousandFoldersLooksEachShareUpOnce) {
  std::vector<std::string> paths;
  for (int share = 0; share < 10; ++share) {
    // Share 9 is unknown to the platform; the others live on two volumes.
    if (share < 9) AddShare("s" + std::to_string(share), share % 2 ? "/volume2" : "/volume1");
    for (int i = 0; i < 100; ++i) paths.push_back("/s" + std::to_string(share) + "/d" + std::to_string(i));
  }
  WriteFolders(paths);
  fake::Get().calls.clear();
  Folders folders;
  ASSERT_TRUE(folders.Load());
  EXPECT_EQ(fake::CallsStartingWith("TAVOShareGet").size(), 10u);
  EXPECT_EQ(ErrorHandler::GetError(), FILEINDEX_ERR_BAD_PATH);

  // The same full paths as resolving each folder on its own.
  std::vector<Folder> loaded;
  folders.List(loaded);
  ASSERT_EQ(loaded.size(), 1000u);
  for (const Folder& folder : loaded) {
    Folder single;
    bool resolved = single.Load(folder.GetPath(), Json::Value(Json::objectValue));
    EXPECT_EQ(resolved, folder.GetPath().compare(0, 4, "/s9/") != 0) << folder.GetPath();
    if (resolved) {
      EXPECT_EQ(folder.GetFullPath(), single.GetFullPath()) << folder.GetPath();
    }
  }
  EXPECT_EQ(loaded[100].GetFullPath(), Rooted("/volume2/s1/d0"));
}
