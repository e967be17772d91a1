// Saves killed at random moments, and saves on a full file system: either way folder.conf
// and status.conf hold a whole document, the old one or the new one.
#include <fcntl.h>
#include <fileindex/error.h>
#include <fileindex/folders.h>
#include <fileindex/status.h>
#include <sched.h>
#include <signal.h>
#include <sys/mman.h>
#include <sys/mount.h>
#include <sys/prctl.h>
#include <sys/wait.h>
#include <unistd.h>

#include <chrono>
#include <filesystem>
#include <random>

#include "internal/json_io.h"
#include "support/sysroot_test.h"

using namespace TAVO::FILEINDEX;
using Clock = std::chrono::steady_clock;

namespace {

const int kBig = 400;  // folders and marks: documents large enough to take a while to write

Json::Value Record(const std::string& path, const std::string& name) {
  Json::Value record(Json::objectValue);
  record["path"] = path, record["name"] = name;
  return record;
}

void Fill(Folders& folders, Status& status) {
  Json::Value changes;
  for (int i = 0; i < kBig; ++i) {
    const std::string pad = std::to_string(i) + std::string(150 + i % 50, static_cast<char>('a' + i % 26));
    folders.Upsert(changes, Record("/photo/f" + std::to_string(i), pad));
    status.SetUpdated("mark-" + pad);
  }
}

// Saves generations from `first` on through Folders then Status, noting in progress[0] the one it
// starts and in progress[1] the one it finished.
bool SaveGenerations(volatile long long* progress, long long first, long long count) {
  Folders folders;
  Status status;
  Json::Value changes;
  if (!folders.Load() || !status.Load()) return false;
  if (first == 1) Fill(folders, status);  // generation 1 starts from nothing
  for (long long g = first; g < first + count; progress[1] = g++) {
    progress[0] = g, status.Pause(g);
    if (!folders.Upsert(changes, Record("/photo/gen", std::to_string(g))) || !folders.Save() ||
        !status.Save())
      return false;
  }
  return true;
}

class CrashSafetyTest : public SysrootTest {
 protected:
  void SetUp() override { SysrootTest::SetUp(), AddShare("photo"); }
  std::string ConfDir() const { return Rooted("/usr/tavo/etc/fileindex"); }
  long Entries() const { return std::distance(std::filesystem::directory_iterator(ConfDir()), {}); }
  // Which generation the file holds: -1 for a torn file.
  long long Gen(bool folders) const {
    Json::Value doc;
    if (!internal::JsonFromString(doc, ReadFile(folders ? FolderConfPath() : StatusConfPath()))) return -1;
    if (doc.size() != kBig + 1u) return -1;
    return folders ? std::atoll(doc["/photo/gen"]["name"].asString().c_str()) : doc["resume_time"].asInt64();
  }
};

TEST_F(CrashSafetyTest, KilledSavesLeaveTheOldOrTheNewDocument) {
  auto* progress = static_cast<volatile long long*>(
      ::mmap(nullptr, 2 * sizeof(long long), PROT_READ | PROT_WRITE, MAP_SHARED | MAP_ANONYMOUS, -1, 0));
  ASSERT_NE(progress, MAP_FAILED);
  // Kills fall anywhere up to about the third generation, however slow saves are here.
  auto t0 = Clock::now();
  ASSERT_TRUE(SaveGenerations(progress, 1, 2));
  const unsigned long long window = (Clock::now() - t0) / std::chrono::microseconds(2) * 3 + 1;
  std::mt19937 rng(7);
  long long folderGen = 2, statusGen = 2;  // what the files held after the last kill
  int kills = 0, midSave = 0;
  // Up to 400 kills in 20 s; a slow machine (sanitizers, other tests) goes on to at least 40.
  auto more = [&] {
    const auto t = Clock::now() - t0;
    return kills < 400 && (t < std::chrono::seconds(20) || (kills < 40 && t < std::chrono::seconds(90)));
  };
  for (t0 = Clock::now(); more(); ++kills) {
    progress[0] = progress[1] = -1;
    pid_t pid = ::fork();
    if (pid == 0) {
      ::prctl(PR_SET_PDEATHSIG, SIGKILL), ::alarm(60);
      ::_exit(SaveGenerations(progress, statusGen + 1, 1LL << 40) ? 0 : 2);
    }
    ASSERT_GE(pid, 0);
    ::usleep(static_cast<useconds_t>(rng() % window));
    ::kill(pid, SIGKILL);
    int ws = 0;
    ASSERT_TRUE(::waitpid(pid, &ws, 0) == pid && WIFSIGNALED(ws)) << "child ended: " << ws;
    // Each generation saves folder.conf, then status.conf: a kill during one leaves each file
    // at its old or new generation, and status.conf never ahead of folder.conf.
    const long long started = progress[0], finished = progress[1];
    if (finished >= 0) folderGen = statusGen = finished;  // the old generation of both
    const bool during = started != finished;
    const long long folder = Gen(true), status = Gen(false);
    ASSERT_TRUE(folder == folderGen || (during && folder == started)) << folder << " at kill " << kills;
    ASSERT_TRUE(status == statusGen || (during && status == started && folder == started)) << status;
    folderGen = folder, statusGen = status, midSave += during;
  }
  EXPECT_TRUE(kills >= 40 && midSave > kills / 4 && statusGen > 2)
      << kills << ", " << midSave << ", " << statusGen;
  // Only a kill between naming the written file and the rename leaves a temporary file.
  EXPECT_LE(Entries() - 2, kills / 5);
  ::munmap(const_cast<long long*>(progress), 2 * sizeof(long long));
}

TEST_F(CrashSafetyTest, FullDiskKeepsThePreviousDocumentAndNoTemporaryFile) {
  // In a private mount namespace, so the small tmpfs never shows on the host.
  if (::unshare(CLONE_NEWNS) != 0 || ::mount("none", "/", "none", MS_REC | MS_PRIVATE, nullptr) != 0 ||
      ::mount("tmpfs", ConfDir().c_str(), "tmpfs", 0, "size=64k") != 0)
    GTEST_SKIP() << "cannot mount a small tmpfs in a private mount namespace here";
  Folders folders;
  Status status;
  Json::Value changes;
  status.Pause(5);
  EXPECT_TRUE(folders.Load() && folders.Upsert(changes, Record("/photo/a", "a")) && folders.Save() &&
              status.Save());
  const std::string folderBefore = ReadFile(FolderConfPath()), statusBefore = ReadFile(StatusConfPath());
  const int filler = ::open((ConfDir() + "/filler").c_str(), O_WRONLY | O_CREAT | O_CLOEXEC, 0644);
  while (::write(filler, std::string(4096, 'x').data(), 4096) > 0) continue;
  ::close(filler);
  Fill(folders, status);
  EXPECT_TRUE(!folders.Save() && ErrorHandler::GetError() == FILEINDEX_ERR_SAVE_CONFIG);
  EXPECT_TRUE(logcap::Contains("Failed to save json to " + FolderConfPath()));
  ErrorHandler::SetError(FILEINDEX_ERR_NONE);
  EXPECT_TRUE(!status.Save() && ErrorHandler::GetError() == FILEINDEX_ERR_SAVE_CONFIG);
  EXPECT_TRUE(ReadFile(FolderConfPath()) == folderBefore && ReadFile(StatusConfPath()) == statusBefore);
  EXPECT_EQ(Entries(), 3) << "a temporary file was left";  // the two and filler
  ::umount(ConfDir().c_str());
}

}  // namespace
