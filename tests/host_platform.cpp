// The host platform against real files and mounts, each test in its own temporary system root.
#include <fileindex/utils.h>
#include <sched.h>
#include <sys/mount.h>
#include <tavo/platform.h>
#include <tavo/tavotifyd.h>

#include <cstring>

#include "host_support.h"
namespace fs = std::filesystem;

namespace {
class HostPlatformTest : public ::testing::Test {
 protected:
  void SetUp() override {
    char pattern[] = "/tmp/host_platform.XXXXXX";
    ASSERT_NE(::mkdtemp(pattern), nullptr);
    root_ = fs::canonical(pattern).string();
    ::setenv("FILEINDEX_SYSROOT", root_.c_str(), 1);
    Write("/etc/tavo/shares.json", R"({"shares": [
      {"name": "photo", "path": "/volume1/photo", "recycle_bin": true},
      {"name": "photos", "path": "/volume1/photos/"},
      {"name": "inner", "path": "/volume1/photo/inner"},
      {"name": "misnamed", "path": "/volume2/other"}]})");
    for (const char* dir :
         {"/volume1/photo/2019", "/volume1/photos", "/volume1/photo/inner", "/volume2/other"})
      fs::create_directories(root_ + dir);
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
  std::string Read(const std::string& path) { return host_test::ReadFile(root_ + path); }
  // Share name and directory of a full path, or "!<platform error>".
  std::string ShareOf(const std::string& full, size_t nameSize = 492) {
    char name[492] = {0}, dir[4096] = {0};
    if (TAVOShareNamePathGet(full.c_str(), name, nameSize, dir, sizeof(dir)) < 0) {
      std::ostringstream error;
      error << "!" << std::hex << VLIBCErrGet();
      return error.str();
    }
    return std::string(name) + " " + dir;
  }
  std::string root_;
  std::vector<std::string> mounts_;
};

// Longest whole-component prefix wins; outside-root, misnamed and too-small buffers fail with
// their codes; a changed table is reread and a broken one is an error rather than the old table.
TEST_F(HostPlatformTest, ShareLookupTakesTheLongestWholeComponentPrefix) {
  const std::string v1 = root_ + "/volume1";
  EXPECT_EQ(ShareOf(v1 + "/photo/inner/a"), "inner " + v1 + "/photo/inner");
  EXPECT_EQ(ShareOf(v1 + "/photo/innerx"), "photo " + v1 + "/photo");
  EXPECT_EQ(ShareOf(v1 + "/photos/x"), "photos " + v1 + "/photos");
  EXPECT_EQ(ShareOf(v1 + "/pho"), "!1400");
  EXPECT_EQ(ShareOf("/volume1/photo/2019"), "!1400");
  EXPECT_EQ(ShareOf(root_ + "/volume2/other/a"), "!1403");
  EXPECT_EQ(ShareOf(v1 + "/photos", 4), "!1402");
  std::string full;
  ASSERT_TRUE(TAVO::FILEINDEX::GetFullPath(full, "/photos/2019"));
  EXPECT_EQ(full, v1 + "/photos/2019");
  Write("/etc/tavo/shares.json", R"({"shares": [{"name": "video", "path": "/volume3/video"}]})");
  EXPECT_EQ(ShareOf(root_ + "/volume3/video/a"), "video " + root_ + "/volume3/video");
  for (const char* broken :
       {R"({"shares": [{"name": "video", "path": "volume3/video"}]})",
        R"({"shares": [{"name": "video", "path": "/v/video"}, {"name": "video", "path": "/w/video"}]})",
        "[]"}) {
    Write("/etc/tavo/shares.json", broken);
    EXPECT_EQ(ShareOf(root_ + "/volume3/video/a"), "!1401") << broken;
  }
}

// A bind mount on the same device is still a mount point; the library refuses mounts inside a share.
TEST_F(HostPlatformTest, MountPointsAreFoundByDeviceAndByMountTable) {
  const std::string photo = root_ + "/volume1/photo";
  EXPECT_EQ(TAVOFSDirIsMntPoint(photo.c_str()), 0);
  if (::unshare(CLONE_NEWNS) != 0 || ::mount(nullptr, "/", nullptr, MS_REC | MS_PRIVATE, nullptr) != 0)
    GTEST_SKIP() << "cannot make a private mount namespace: " << std::strerror(errno);
  for (const char* dir : {"/tmpfs", "/bind"})
    fs::create_directories(photo + dir), mounts_.push_back(photo + dir);
  ASSERT_EQ(::mount("none", (photo + "/tmpfs").c_str(), "tmpfs", 0, "size=1m"), 0) << std::strerror(errno);
  ASSERT_EQ(::mount((photo + "/2019").c_str(), (photo + "/bind").c_str(), nullptr, MS_BIND, nullptr), 0);
  EXPECT_EQ(TAVOFSDirIsMntPoint((photo + "/tmpfs/").c_str()), 1);
  EXPECT_EQ(TAVOFSDirIsMntPoint((photo + "/bind").c_str()), 1);
  EXPECT_FALSE(TAVO::FILEINDEX::CanFullPathBeIndexed(photo + "/tmpfs"));
  EXPECT_TRUE(TAVO::FILEINDEX::CanFullPathBeIndexed(photo + "/2019"));
}

// The Spotlight switch edits [global] only, in place, matching names as Samba does; it
// brings the Elasticsearch backend along and takes it away again.
TEST_F(HostPlatformTest, SpotlightEditKeepsEverythingElse) {
  const std::string head = "[global]\n    # spotlight = yes\n    a = b \\\n        c\n",
                    tail = "\n[photo]\n    spotlight = yes\n";
  Write("/etc/samba/smb.conf", head + tail);
  EXPECT_EQ(TAVOSMBIsEnableSpotlight(), 0);
  ASSERT_EQ(TAVOSMBSetSpotlight(1), 0);
  EXPECT_EQ(Read("/etc/samba/smb.conf"),
            head +
                "    spotlight = yes\n    spotlight backend = elasticsearch\n"
                "    elasticsearch:address = 127.0.0.1\n    elasticsearch:port = 9200\n"
                "    elasticsearch:mappings = /usr/share/samba/mdssvc/elasticsearch_mappings.json\n" +
                tail);
  EXPECT_EQ(TAVOSMBIsEnableSpotlight(), 1);
  ASSERT_EQ(TAVOSMBSetSpotlight(0), 0);
  EXPECT_EQ(Read("/etc/samba/smb.conf"), head + "    spotlight = no\n" + tail);
  // On without the backend is not on; a cluster's address is kept.
  Write("/etc/samba/smb.conf", "[Global]\n\tSpot Light=True\n\telasticsearch:address = es1\n[x]\n");
  EXPECT_EQ(TAVOSMBIsEnableSpotlight(), 0);
  ASSERT_EQ(TAVOSMBSetSpotlight(1), 0);
  EXPECT_NE(Read("/etc/samba/smb.conf")
                .find("\tSpot Light = yes\n\telasticsearch:address = es1\n\tspotlight backend"),
            std::string::npos);
  Write("/etc/samba/smb.conf", "# c\n[x]\n\tpath = /x\n");  // no [global]: added before the first share
  ASSERT_EQ(TAVOSMBSetSpotlight(0), 0);
  EXPECT_EQ(Read("/etc/samba/smb.conf"), "# c\n[global]\n\tspotlight = no\n\n[x]\n\tpath = /x\n");
}

// Case folding with full decomposition: é sorts between e and f, ß equals SS.
TEST_F(HostPlatformTest, UnicodeComparisonFoldsCase) {
  EXPECT_EQ(VLIBCUnicodeUTF8StrCaseCmp("e\xCC\x81", "É"), 0);
  EXPECT_EQ(VLIBCUnicodeUTF8StrCaseCmp("Straße", "STRASSE"), 0);
  EXPECT_LT(VLIBCUnicodeUTF8StrCaseCmp("ab", "ABC"), 0);
  EXPECT_LT(VLIBCUnicodeUTF8StrCaseCmp("é", "F"), 0);
  EXPECT_LT(VLIBCUnicodeUTF8StrCaseCmp("e", "é"), 0);
}

// Watch lists and service states are written through an unnamed file: a writer killed at
// any moment leaves the old or the new file, and at most a temporary file that the next
// write of the same file removes.
TEST_F(HostPlatformTest, KilledWritersLeaveNoTemporaryFiles) {
  Json::Value watch;
  watch["queue"] = root_ + "/volume1/photo/@eaDir/queue";
  for (int i = 0; i < 5000; ++i) {  // a long list, so that kills land inside writes
    Json::Value& entry = watch["config"].append(Json::Value());
    entry["path"] = root_ + "/volume1/photo/folder" + std::to_string(i);
    entry["mask"] = 4095;
  }
  const TAVO::TAVOTIFYD::MonitorQueue queue(watch);
  auto writeList = [&] {
    TAVO::TAVOTIFYD::MonitorQueue::Upsert(queue, "fileindex", TAVO::TAVOTIFYD::_tag_monitor_queue_type_{});
  };
  for (int round = 0; round < 20; ++round) {
    pid_t child = ::fork();
    ASSERT_GE(child, 0);
    if (child == 0) {
      for (;;) {  // odd rounds write service states only, so that each kind gets written
        if (round % 2 == 0) writeList();
        VLIBServiceStart("fileindexd", 0);
        VLIBServiceStop("fileindexd", 0);
      }
    }
    ::usleep(30000 + 3000 * round);
    ::kill(child, SIGKILL);
    ::waitpid(child, nullptr, 0);
  }
  ::sleep(2);  // leftovers of the last instants are old enough to be swept by the next write
  writeList();
  VLIBServiceStop("fileindexd", 0);  // writes its state whatever it was
  std::vector<std::string> files;
  for (const char* dir : {"/run/tavotifyd", "/run/tavo/service"}) {
    ASSERT_TRUE(fs::is_directory(root_ + dir)) << dir;
    for (const auto& entry : fs::recursive_directory_iterator(root_ + dir))
      if (!entry.is_directory()) files.push_back(entry.path().filename());
  }
  EXPECT_EQ(files, (std::vector<std::string>{"queue.json", "fileindexd"}));
}

}  // namespace
