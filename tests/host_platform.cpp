// The host platform against real files and mounts, each test in its own temporary system root.
#include <fileindex/utils.h>
#include <sched.h>
#include <sys/mount.h>
#include <tavo/platform.h>
#include <tavo/tavotifyd.h>

#include <cstring>

#include "host_support.h"
namespace fs = std::filesystem;
using namespace TAVO::TAVOTIFYD;

namespace {
class HostPlatformTest : public ::testing::Test {
 protected:
  void SetUp() override {
    char pattern[] = "/tmp/host_platform.XXXXXX";
    ASSERT_NE(::mkdtemp(pattern), nullptr);
    root_ = fs::canonical(pattern).string();
    ::setenv("FILEINDEX_SYSROOT", root_.c_str(), 1);
    Write("/etc/tavo/shares.json", R"({"shares": [{"name": "photo", "path": "/volume1/photo/"},
      {"name": "inner", "path": "/volume1/photo/inner"}, {"name": "misnamed", "path": "/volume2/o"}]})");
    fs::create_directories(root_ + "/volume1/photo/2019");
  }
  void TearDown() override {
    for (auto it = mounts_.rbegin(); it != mounts_.rend(); ++it) ::umount2(it->c_str(), MNT_DETACH);
    ::unsetenv("FILEINDEX_SYSROOT");
    fs::remove_all(root_);
  }
  // Writes through a new file, so the file's identity changes as on a real update.
  void Write(const std::string& path, const std::string& text) {
    host_test::WriteFile(root_ + path + ".new", text);
    fs::rename(root_ + path + ".new", root_ + path);
  }
  // Share name and directory of a full path, or the platform's error code.
  std::string ShareOf(const std::string& full) {
    char name[492] = {0};
    char dir[4096] = {0};
    int got = TAVOShareNamePathGet(full.c_str(), name, sizeof(name), dir, sizeof(dir));
    return got < 0 ? std::to_string(VLIBCErrGet()) : std::string(name) + " " + dir;
  }
  std::string root_;
  std::vector<std::string> mounts_;
};

// The longest whole-component prefix wins; failures have their codes (a broken table is reread).
TEST_F(HostPlatformTest, ShareLookupTakesTheLongestWholeComponentPrefix) {
  EXPECT_EQ(ShareOf(root_ + "/volume1/photo/inner/a"), "inner " + root_ + "/volume1/photo/inner");
  EXPECT_EQ(ShareOf(root_ + "/volume1/photo/innerx"), "photo " + root_ + "/volume1/photo");
  EXPECT_EQ(ShareOf("/volume1/photo/2019"), std::to_string(0x1400));
  EXPECT_EQ(ShareOf(root_ + "/volume2/o/a"), std::to_string(0x1403));
  Write("/etc/tavo/shares.json", R"({"shares": [{"name": "v", "path": "/v"}, {"name": "v", "path": "/w"}]})");
  EXPECT_EQ(ShareOf(root_ + "/volume1/photo/inner/a"), std::to_string(0x1401));
}

// A bind mount on the same device is still a mount point; the library refuses mounts inside a share.
TEST_F(HostPlatformTest, MountPointsAreFoundByDeviceAndByMountTable) {
  const std::string photo = root_ + "/volume1/photo";
  EXPECT_EQ(TAVOFSDirIsMntPoint(photo.c_str()), 0);
  if (::unshare(CLONE_NEWNS) != 0 || ::mount(nullptr, "/", nullptr, MS_REC | MS_PRIVATE, nullptr) != 0)
    GTEST_SKIP() << "cannot make a private mount namespace: " << std::strerror(errno);
  mounts_ = {photo + "/tmpfs", photo + "/bind"};
  for (const std::string& dir : mounts_) fs::create_directories(dir);
  ASSERT_EQ(::mount("none", (photo + "/tmpfs").c_str(), "tmpfs", 0, "size=1m"), 0) << std::strerror(errno);
  ASSERT_EQ(::mount((photo + "/2019").c_str(), (photo + "/bind").c_str(), nullptr, MS_BIND, nullptr), 0);
  for (const std::string& dir : mounts_) EXPECT_EQ(TAVOFSDirIsMntPoint(dir.c_str()), 1) << dir;
  EXPECT_FALSE(TAVO::FILEINDEX::CanFullPathBeIndexed(photo + "/tmpfs"));
}

// The Spotlight switch edits [global] in place, backend included, and keeps everything else.
TEST_F(HostPlatformTest, SpotlightEditKeepsEverythingElse) {
  const std::string head = "[global]\n    # spotlight = yes\n    a = b \\\n        c\n";
  const std::string tail = "\n[photo]\n    spotlight = yes\n";
  Write("/etc/samba/smb.conf", head + tail);
  ASSERT_EQ(TAVOSMBSetSpotlight(1), 0);
  EXPECT_EQ(host_test::ReadFile(root_ + "/etc/samba/smb.conf"),
            head + "    spotlight = yes\n    spotlight backend = elasticsearch\n" +
                "    elasticsearch:address = 127.0.0.1\n    elasticsearch:port = 9200\n" +
                "    elasticsearch:mappings = /usr/share/samba/mdssvc/elasticsearch_mappings.json\n" + tail);
  EXPECT_EQ(TAVOSMBIsEnableSpotlight(), 1);
  ASSERT_EQ(TAVOSMBSetSpotlight(0), 0);
  EXPECT_EQ(host_test::ReadFile(root_ + "/etc/samba/smb.conf"), head + "    spotlight = no\n" + tail);
}

// Folder lists sort with it: canonically equal forms and case variants compare equal.
TEST_F(HostPlatformTest, UnicodeComparisonFoldsCase) {
  EXPECT_EQ(VLIBCUnicodeUTF8StrCaseCmp("e\xCC\x81", "\xC3\x89"), 0);
  EXPECT_EQ(VLIBCUnicodeUTF8StrCaseCmp("Stra\xC3\x9F"
                                       "e",
                                       "STRASSE"),
            0);
  EXPECT_LT(VLIBCUnicodeUTF8StrCaseCmp("ab", "ABC"), 0);
  EXPECT_LT(VLIBCUnicodeUTF8StrCaseCmp("e", "\xC3\xA9"), 0);
}

// Files are written through an unnamed file: a writer killed at any moment leaves at most a
// temporary file, which the next write of the same file removes.
TEST_F(HostPlatformTest, KilledWritersLeaveNoTemporaryFiles) {
  Json::Value watch;
  watch["queue"] = root_ + "/volume1/photo/@eaDir/queue";
  for (int i = 0; i < 5000; ++i)  // a long list, so that kills land inside writes
    watch["config"].append(host_test::ParseJson(R"({"mask": 4095})"))["path"] = "/f" + std::to_string(i);
  const MonitorQueue queue(watch);
  for (int round = 0; round < 20; ++round) {
    pid_t child = ::fork();
    ASSERT_GE(child, 0);
    while (child == 0) MonitorQueue::Upsert(queue, "fileindex", MONITOR_QUEUE_TYPE_FILE);
    ::usleep(30000 + 3000 * round);
    ::kill(child, SIGKILL);
    ::waitpid(child, nullptr, 0);
  }
  ::sleep(2);  // leftovers of the last instants are old enough to be swept by the next write
  MonitorQueue::Upsert(queue, "fileindex", MONITOR_QUEUE_TYPE_FILE);
  std::vector<std::string> files;
  for (const auto& entry : fs::recursive_directory_iterator(root_ + "/run/tavotifyd"))
    if (!entry.is_directory()) files.push_back(entry.path().filename());
  EXPECT_EQ(files, std::vector<std::string>{"queue.json"});
}

}  // namespace
