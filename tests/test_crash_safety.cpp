// Saves killed at random moments or failing on a full file system leave whole documents, old or new.
#include <fileindex/error.h>
#include <fileindex/folders.h>
#include <fileindex/status.h>
#include <sched.h>
#include <signal.h>
#include <sys/mount.h>
#include <sys/prctl.h>
#include <sys/wait.h>
#include <unistd.h>

#include <chrono>
#include <cstdlib>
#include <filesystem>

#include "internal/json_io.h"
#include "support/sysroot_test.h"

using namespace TAVO::FILEINDEX;
using Clock = std::chrono::steady_clock;

static bool Put(Folders& folders, const std::string& path, const std::string& name) {
  Json::Value record(Json::objectValue), changes;
  record["path"] = path;
  record["name"] = name;
  return folders.Upsert(changes, record);
}

// Saves generations from `first` on, each through Folders then Status. Generation 1 starts with
// documents large enough to take a while to write: 400 folders and as many marks.
static bool SaveGenerations(long long first, long long count) {
  Folders folders;
  Status status;
  if (!folders.Load() || !status.Load()) return false;
  for (int i = 0; first == 1 && i < 400; ++i) {
    const std::string pad = std::to_string(i) + std::string(150 + i % 50, static_cast<char>('a' + i % 26));
    Put(folders, "/photo/f" + std::to_string(i), pad);
    status.SetUpdated("mark-" + pad);
  }
  for (long long g = first; g < first + count; ++g) {
    status.Pause(g);
    if (!Put(folders, "/photo/gen", std::to_string(g)) || !folders.Save() || !status.Save()) return false;
  }
  return true;
}

class CrashSafetyTest : public SysrootTest {
 protected:
  std::string ConfDir() const { return Rooted("/usr/tavo/etc/fileindex"); }
  long long Gen(bool folders) const {  // which generation the file holds: -1 for a torn file
    Json::Value doc;
    if (!internal::JsonFromString(doc, ReadFile(folders ? FolderConfPath() : StatusConfPath()))) return -1;
    return folders ? std::atoll(doc["/photo/gen"]["name"].asString().c_str()) : doc["resume_time"].asInt64();
  }
};

// A kill leaves each file whole, at the generation it held or a later one, and status.conf never
// ahead of folder.conf. Kills fall anywhere up to about the third generation, however slow saves are.
TEST_F(CrashSafetyTest, KilledSavesLeaveTheOldOrTheNewDocument) {
  AddShare("photo");
  const auto t0 = Clock::now();
  ASSERT_TRUE(SaveGenerations(1, 2));
  const unsigned long long window = (Clock::now() - t0) / std::chrono::microseconds(2) * 3 + 1;
  long long folderGen = 2, statusGen = 2;  // what the files held after the last kill
  int kills = 0, betweenSaves = 0;
  const auto end = Clock::now() + std::chrono::seconds(20);  // 400 kills at most; 40 on a slow machine
  for (; kills < 400 && (kills < 40 || Clock::now() < end); ++kills) {
    const pid_t pid = ::fork();
    if (pid == 0) {
      ::prctl(PR_SET_PDEATHSIG, SIGKILL);
      ::_exit(SaveGenerations(statusGen + 1, 1LL << 40) ? 0 : 2);
    }
    ASSERT_GE(pid, 0);
    ::usleep(static_cast<useconds_t>(std::rand() % window));
    ::kill(pid, SIGKILL);
    int ws = 0;
    ASSERT_TRUE(::waitpid(pid, &ws, 0) == pid && WIFSIGNALED(ws)) << "child ended: " << ws;
    const long long folder = Gen(true), status = Gen(false);
    ASSERT_TRUE(folder >= folderGen && status >= statusGen && status <= folder) << folder << "/" << status;
    betweenSaves += status < folder;
    folderGen = folder;
    statusGen = status;
  }
  EXPECT_GT(betweenSaves, kills / 8) << "kills rarely fell between the two saves";
}

// Documents too big for a small tmpfs (in a private mount namespace, never shown on the host)
// fail to save midway, with code 7 and a log line, and leave the previous ones.
TEST_F(CrashSafetyTest, FullDiskKeepsThePreviousDocumentAndNoTemporaryFile) {
  if (::unshare(CLONE_NEWNS) != 0 || ::mount("none", "/", "none", MS_REC | MS_PRIVATE, nullptr) != 0 ||
      ::mount("tmpfs", ConfDir().c_str(), "tmpfs", 0, "size=64k") != 0)
    GTEST_SKIP() << "cannot mount a small tmpfs in a private mount namespace here";
  AddShare("photo");
  ASSERT_TRUE(SaveGenerations(5, 1));
  EXPECT_TRUE(!SaveGenerations(1, 1) && ErrorHandler::GetError() == FILEINDEX_ERR_SAVE_CONFIG);
  EXPECT_TRUE(logcap::Contains("Failed to save json to " + FolderConfPath()));
  EXPECT_TRUE(Gen(true) == 5 && Gen(false) == 5);
  EXPECT_EQ(std::distance(std::filesystem::directory_iterator(ConfDir()), {}), 2) << "a temporary file";
  ::umount(ConfDir().c_str());
}
