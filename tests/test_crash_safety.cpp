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

namespace {

const int kBig = 400;  // folders and marks: documents large enough to take a while to write

class CrashSafetyTest : public SysrootTest {
 protected:
  void SetUp() override {
    SysrootTest::SetUp();
    AddShare("photo");
  }
  std::string ConfDir() const { return Rooted("/usr/tavo/etc/fileindex"); }
  // Files of the configuration directory other than the two configurations.
  std::vector<std::string> Strays() const {
    std::vector<std::string> out;
    for (const auto& entry : std::filesystem::directory_iterator(ConfDir())) {
      const std::string name = entry.path().filename();
      if (name != "folder.conf" && name != "status.conf") out.push_back(name);
    }
    return out;
  }
  static std::string Pad(int i) {
    return std::to_string(i) + std::string(150 + i % 50, static_cast<char>('a' + i % 26));
  }
  static Json::Value Record(const std::string& path, const std::string& name) {
    Json::Value record(Json::objectValue);
    record["path"] = path;
    record["name"] = name;
    for (const char* kind : {"document", "audio", "video", "photo"}) record[kind] = kind[0] == 'v';
    return record;
  }
  // Generation g of folder.conf or status.conf: a large constant part and one value that says g.
  static Json::Value Doc(bool folders, long long g) {
    Json::Value doc(Json::objectValue);
    for (int i = 0; i < kBig; ++i) {
      if (folders) doc["/photo/f" + std::to_string(i)] = Record("/photo/f" + std::to_string(i), Pad(i));
      if (!folders) doc["mark-" + Pad(i)] = true;
    }
    if (folders) doc["/photo/gen"] = Record("/photo/gen", "g" + std::to_string(g));
    if (!folders) doc["resume_time"] = static_cast<Json::Int64>(g);
    return doc;
  }
  // Which generation the file holds: -1 for a torn file or anything that is not one of them.
  long long Gen(bool folders) const {
    Json::Value doc;
    if (!internal::JsonFromString(doc, ReadFile(folders ? FolderConfPath() : StatusConfPath()))) return -1;
    const long long g =
        folders
            ? std::atoll(doc.get("/photo/gen", Json::Value()).get("name", "").asString().erase(0, 1).c_str())
            : doc.get("resume_time", -1).asInt64();
    return doc == Doc(folders, g) ? g : -1;
  }
};

// Saves generations from `first` on through Folders then Status, noting in progress[0]
// the one it starts and in progress[1] the one it finished.
void SaveGenerations(volatile long long* progress, long long first, long long count) {
  Folders folders;
  Status status;
  if (!folders.Load() || !status.Load()) ::_exit(2);
  for (long long g = first; g < first + count; ++g) {
    progress[0] = g;
    Json::Value record(Json::objectValue), changes;
    record["path"] = "/photo/gen";
    record["name"] = "g" + std::to_string(g);
    status.Pause(g);
    if (!folders.Upsert(changes, record) || !folders.Save() || !status.Save()) ::_exit(2);
    progress[1] = g;
  }
}

TEST_F(CrashSafetyTest, KilledSavesLeaveTheOldOrTheNewDocument) {
  auto* progress = static_cast<volatile long long*>(
      ::mmap(nullptr, 2 * sizeof(long long), PROT_READ | PROT_WRITE, MAP_SHARED | MAP_ANONYMOUS, -1, 0));
  ASSERT_NE(progress, MAP_FAILED);
  // Kills fall anywhere up to about the third generation, however slow saves are here.
  auto t0 = std::chrono::steady_clock::now();
  for (int round = 0; round < 2; ++round) {
    ASSERT_TRUE(internal::JsonToFile(Doc(true, 0), FolderConfPath()) &&
                internal::JsonToFile(Doc(false, 0), StatusConfPath()));
    if (round == 0) SaveGenerations(progress, 1, 2);
  }
  const auto window = static_cast<unsigned long long>((std::chrono::steady_clock::now() - t0) /
                                                      std::chrono::microseconds(1)) *
                      3 / 2;

  std::mt19937 rng(7);
  long long folderGen = 0, statusGen = 0;  // what the files held after the last kill
  int kills = 0, midSave = 0;
  for (t0 = std::chrono::steady_clock::now();
       kills < 400 && std::chrono::steady_clock::now() - t0 < std::chrono::seconds(20); ++kills) {
    progress[0] = progress[1] = -1;
    pid_t pid = ::fork();
    if (pid == 0) {
      ::prctl(PR_SET_PDEATHSIG, SIGKILL);
      ::alarm(60);
      SaveGenerations(progress, statusGen + 1, 1LL << 40);
    }
    ASSERT_GE(pid, 0);
    ::usleep(static_cast<useconds_t>(rng() % window));
    ::kill(pid, SIGKILL);
    int wstatus = 0;
    ASSERT_EQ(::waitpid(pid, &wstatus, 0), pid);
    ASSERT_TRUE(WIFSIGNALED(wstatus)) << "the saving child stopped on its own: " << wstatus;
    const long long started = progress[0], finished = progress[1];

    // Each generation saves folder.conf, then status.conf: a kill during one leaves each file
    // at its old or new generation, and status.conf never ahead of folder.conf.
    const long long oldFolder = finished >= 0 ? finished : folderGen,
                    oldStatus = finished >= 0 ? finished : statusGen;
    const bool during = started != finished;
    midSave += during;
    folderGen = Gen(true);
    statusGen = Gen(false);
    ASSERT_TRUE(folderGen == oldFolder || (during && folderGen == started))
        << folderGen << ", kill " << kills;
    ASSERT_TRUE(statusGen == oldStatus || (during && statusGen == started && folderGen == started))
        << statusGen << ", kill " << kills;
  }
  // Only a kill between naming the written file and the rename leaves a temporary file.
  std::printf("%d kills (%d during a generation), %lld generations, %zu temporary files left\n", kills,
              midSave, statusGen, Strays().size());
  EXPECT_GE(kills, 40);
  EXPECT_GT(midSave, kills / 4);
  EXPECT_GT(statusGen, 0);
  EXPECT_LE(Strays().size(), static_cast<size_t>(kills / 5));
  ::munmap(const_cast<long long*>(progress), 2 * sizeof(long long));
}

TEST_F(CrashSafetyTest, FullDiskKeepsThePreviousDocumentAndNoTemporaryFile) {
  const std::string reportPath = Rooted("/tmp/full-disk-report");
  pid_t pid = ::fork();
  if (pid == 0) {  // a private mount namespace, so the small tmpfs never shows on the host
    ::prctl(PR_SET_PDEATHSIG, SIGKILL);
    ::alarm(30);
    if (::unshare(CLONE_NEWNS) != 0 || ::mount("none", "/", "none", MS_REC | MS_PRIVATE, nullptr) != 0 ||
        ::mount("tmpfs", ConfDir().c_str(), "tmpfs", 0, "size=64k") != 0) {
      ::_exit(77);
    }
    std::string report;
    auto check = [&report](bool ok, const char* what) { report += ok ? "" : std::string(what) + "\n"; };
    Folders folders;
    Status status;
    Json::Value changes;
    status.Pause(5);
    check(
        folders.Load() && folders.Upsert(changes, Record("/photo/a", "a")) && folders.Save() && status.Save(),
        "small saves");
    const std::string folderBefore = ReadFile(FolderConfPath()), statusBefore = ReadFile(StatusConfPath());
    int filler = ::open((ConfDir() + "/filler").c_str(), O_WRONLY | O_CREAT | O_CLOEXEC, 0644);
    const std::string block(4096, 'x');
    while (::write(filler, block.data(), block.size()) > 0) {
    }
    ::close(filler);

    for (int i = 0; i < kBig; ++i) folders.Upsert(changes, Record("/photo/f" + std::to_string(i), Pad(i)));
    ErrorHandler::SetError(FILEINDEX_ERR_NONE);
    check(!folders.Save() && ErrorHandler::GetError() == FILEINDEX_ERR_SAVE_CONFIG,
          "folder.conf save: no error 7");
    check(logcap::Contains("Failed to save json to " + FolderConfPath()), "no log line for folder.conf");
    for (int i = 0; i < kBig; ++i) status.SetUpdated("mark-" + Pad(i));
    ErrorHandler::SetError(FILEINDEX_ERR_NONE);
    check(!status.Save() && ErrorHandler::GetError() == FILEINDEX_ERR_SAVE_CONFIG,
          "status.conf save: no error 7");
    check(ReadFile(FolderConfPath()) == folderBefore && ReadFile(StatusConfPath()) == statusBefore,
          "a file changed");
    check(Strays() == std::vector<std::string>{"filler"}, "a temporary file was left");
    ::umount(ConfDir().c_str());
    WriteFile(reportPath, report);
    ::_exit(0);
  }
  int wstatus = 0;
  ASSERT_EQ(::waitpid(pid, &wstatus, 0), pid);
  ASSERT_TRUE(WIFEXITED(wstatus)) << wstatus;
  if (WEXITSTATUS(wstatus) == 77)
    GTEST_SKIP() << "cannot mount a small tmpfs in a private mount namespace here";
  ASSERT_EQ(WEXITSTATUS(wstatus), 0);
  EXPECT_EQ(ReadFile(reportPath), "");
}

}  // namespace
