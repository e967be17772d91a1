// The host platform against real files, processes and mounts, each test in its own
// temporary system root.
#include <fcntl.h>
#include <fileindex/utils.h>
#include <gtest/gtest.h>
#include <sched.h>
#include <sys/mount.h>
#include <sys/stat.h>
#include <sys/wait.h>
#include <tavo/platform.h>
#include <tavo/tavotifyd.h>
#include <unistd.h>
#include <climits>
#include <csignal>
#include <cstdlib>
#include <filesystem>
#include <fstream>
#include <sstream>
#include <string>
namespace fs = std::filesystem;

namespace {
class HostPlatformTest : public ::testing::Test {
 protected:
  void SetUp() override {
    char pattern[] = "/tmp/host_platform.XXXXXX";
    ASSERT_NE(::mkdtemp(pattern), nullptr);
    char resolved[PATH_MAX];
    ASSERT_NE(::realpath(pattern, resolved), nullptr);
    root_ = resolved;
    ::setenv("FILEINDEX_SYSROOT", root_.c_str(), 1);
    fs::create_directories(root_ + "/etc/tavo");
    WriteShares(R"({"shares": [
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
  // Writes through a new file, so the table's identity changes as on a real update.
  void WriteShares(const std::string& json) { Write("/etc/tavo/shares.json", json); }
  void Write(const std::string& path, const std::string& text, bool executable = false) {
    fs::create_directories(fs::path(root_ + path).parent_path());
    std::string tmp = root_ + path + ".new";
    std::ofstream(tmp) << text;
    if (executable) ::chmod(tmp.c_str(), 0755);
    fs::rename(tmp, root_ + path);
  }
  std::string Read(const std::string& path) {
    std::stringstream text;
    text << std::ifstream(root_ + path).rdbuf();
    return text.str();
  }
  // Share name and directory of a full path, or "!<platform error>".
  std::string ShareOf(const std::string& full) {
    char name[492] = {0}, dir[4096] = {0};
    if (TAVOShareNamePathGet(full.c_str(), name, sizeof(name), dir, sizeof(dir)) < 0) {
      std::ostringstream error;
      error << "!" << std::hex << VLIBCErrGet();
      return error.str();
    }
    return std::string(name) + " " + dir;
  }
  std::string root_;
  std::vector<std::string> mounts_;
};

// Longest whole-component prefix wins; outside-root, misnamed and too-small buffers fail with their codes;
// a changed table is reread and a broken one is an error rather than the old table.
TEST_F(HostPlatformTest, ShareLookupTakesTheLongestWholeComponentPrefix) {
  const std::string v1 = root_ + "/volume1";
  EXPECT_EQ(ShareOf(v1 + "/photo/inner/a"), "inner " + v1 + "/photo/inner");
  EXPECT_EQ(ShareOf(v1 + "/photo/innerx"), "photo " + v1 + "/photo");
  EXPECT_EQ(ShareOf(v1 + "/photos/x"), "photos " + v1 + "/photos");
  EXPECT_EQ(ShareOf(v1 + "/pho"), "!1400");
  EXPECT_EQ(ShareOf("/volume1/photo/2019"), "!1400");
  EXPECT_EQ(ShareOf(root_ + "/volume2/other/a"), "!1403");
  char name[4], dir[4096];
  EXPECT_LT(TAVOShareNamePathGet((v1 + "/photos").c_str(), name, sizeof(name), dir, sizeof(dir)), 0);
  EXPECT_EQ(VLIBCErrGet(), 0x1402);
  std::string full;
  ASSERT_TRUE(TAVO::FILEINDEX::GetFullPath(full, "/photos/2019"));
  EXPECT_EQ(full, v1 + "/photos/2019");
  WriteShares(R"({"shares": [{"name": "video", "path": "/volume3/video"}]})");
  EXPECT_EQ(ShareOf(root_ + "/volume3/video/a"), "video " + root_ + "/volume3/video");
  for (const char* broken : {R"({"shares": [{"name": "video", "path": "volume3/video"}]})",
                             R"({"shares": [{"name": "video", "path": "/v/video"}, {"name": "video", "path": "/w/video"}]})",
                             "[]"}) {
    WriteShares(broken);
    EXPECT_EQ(ShareOf(root_ + "/volume3/video/a"), "!1401") << broken;
  }
}

// Recycle bins and snapshots count only at the share top; remote/image file systems are classified.
TEST_F(HostPlatformTest, RecycleBinsAndSnapshotsAreAtTheShareTop) {
  const std::string photo = root_ + "/volume1/photo";
  EXPECT_EQ(TAVOShareIsShareRecycle((photo + "/#recycle/a.jpg").c_str()), 1);
  EXPECT_EQ(TAVOShareIsShareRecycle((photo + "/2019/#recycle/a").c_str()), 0);
  EXPECT_EQ(TAVOShareIsShareRecycle((root_ + "/volume1/photos/#recycle").c_str()), 0);  // bin off
  int in = -1;
  ASSERT_EQ(VLIBFhsPathInSnapshot((photo + "/2019/#snapshot").c_str(), &in), 0);
  EXPECT_EQ(in, 0);
  EXPECT_LT(TAVOEAMKDir(0, (photo + "/missing/@eaDir").c_str()), 0);
  EXPECT_EQ(TAVOGetFSType((photo + "/missing").c_str(), 0), -1);
  EXPECT_EQ(TAVOFSIsRemoteFS(0x7F534D42), 1);  // CIFS, folded to a non-negative code
  EXPECT_EQ(TAVOFSIsRemoteFS(0xEF53) + TAVOFSIsImageFS(0xEF53), 0);
}

// A bind mount on the same device is still a mount point; the library refuses mounts inside a share.
TEST_F(HostPlatformTest, MountPointsAreFoundByDeviceAndByMountTable) {
  const std::string photo = root_ + "/volume1/photo";
  EXPECT_EQ(TAVOFSDirIsMntPoint(photo.c_str()), 0);
  if (::unshare(CLONE_NEWNS) != 0 || ::mount(nullptr, "/", nullptr, MS_REC | MS_PRIVATE, nullptr) != 0)
    GTEST_SKIP() << "cannot make a private mount namespace: " << std::strerror(errno);
  fs::create_directories(photo + "/tmpfs");
  ASSERT_EQ(::mount("none", (photo + "/tmpfs").c_str(), "tmpfs", 0, "size=1m"), 0) << std::strerror(errno);
  mounts_.push_back(photo + "/tmpfs");
  fs::create_directories(photo + "/bind");
  ASSERT_EQ(::mount((photo + "/2019").c_str(), (photo + "/bind").c_str(), nullptr, MS_BIND, nullptr), 0);
  mounts_.push_back(photo + "/bind");
  EXPECT_EQ(TAVOFSDirIsMntPoint((photo + "/tmpfs/").c_str()), 1);
  EXPECT_EQ(TAVOFSDirIsMntPoint((photo + "/bind").c_str()), 1);
  EXPECT_FALSE(TAVO::FILEINDEX::CanFullPathBeIndexed(photo + "/tmpfs"));
  EXPECT_TRUE(TAVO::FILEINDEX::CanFullPathBeIndexed(photo + "/2019"));
}

// The Spotlight switch edits [global] only, in place, matching names as Samba does.
TEST_F(HostPlatformTest, SpotlightEditKeepsEverythingElse) {
  Write("/etc/samba/smb.conf", "[global]\n    # spotlight = yes\n    a = b \\\n        c\n\n[photo]\n    spotlight = yes\n");
  EXPECT_EQ(TAVOSMBIsEnableSpotlight(), 0);
  ASSERT_EQ(TAVOSMBSetSpotlight(1), 0);
  EXPECT_EQ(Read("/etc/samba/smb.conf"),
            "[global]\n    # spotlight = yes\n    a = b \\\n        c\n    spotlight = yes\n\n[photo]\n    spotlight = yes\n");
  Write("/etc/samba/smb.conf", "[Global]\n\tSpot Light=True\n[x]\n");
  EXPECT_EQ(TAVOSMBIsEnableSpotlight(), 1);
  ASSERT_EQ(TAVOSMBSetSpotlight(0), 0);
  EXPECT_EQ(Read("/etc/samba/smb.conf"), "[Global]\n\tSpot Light = no\n[x]\n");
  Write("/etc/samba/smb.conf", "# c\n[x]\n\tpath = /x\n");  // no [global]: added before the first share
  ASSERT_EQ(TAVOSMBSetSpotlight(1), 0);
  EXPECT_EQ(Read("/etc/samba/smb.conf"), "# c\n[global]\n\tspotlight = yes\n\n[x]\n\tpath = /x\n");
}

// Case folding with full decomposition: é sorts between e and f, ß equals SS.
TEST_F(HostPlatformTest, UnicodeComparisonFoldsCase) {
  EXPECT_EQ(VLIBCUnicodeUTF8StrCaseCmp("e\xCC\x81", "É"), 0);
  EXPECT_EQ(VLIBCUnicodeUTF8StrCaseCmp("Straße", "STRASSE"), 0);
  EXPECT_LT(VLIBCUnicodeUTF8StrCaseCmp("ab", "ABC"), 0);
  EXPECT_LT(VLIBCUnicodeUTF8StrCaseCmp("é", "F"), 0);
  EXPECT_LT(VLIBCUnicodeUTF8StrCaseCmp("e", "é"), 0);
}

// Children get no leaked descriptors or ignored SIGPIPE; exit codes and detached runs are reported.
TEST_F(HostPlatformTest, ProgramsRunWithoutLeakedDescriptorsOrIgnoredSignals) {
  int leaked = ::open("/dev/null", O_RDONLY);  // deliberately without O_CLOEXEC
  ASSERT_GE(leaked, 3);
  auto previous = ::signal(SIGPIPE, SIG_IGN);
  const std::string probe = "test ! -e /proc/self/fd/" + std::to_string(leaked) +
                            " && ign=$(grep SigIgn /proc/self/status | cut -f2) && [ $((0x$ign & 0x1000)) -eq 0 ]";
  EXPECT_EQ(VLIBCExec("/bin/sh", "-c", probe.c_str(), nullptr, nullptr), 0);
  ::signal(SIGPIPE, previous);
  ::close(leaked);
  EXPECT_EQ(VLIBCExec("/bin/sh", "-c", "exit 3", nullptr, nullptr), 3);
  EXPECT_EQ(VLIBCErrGet(), 0x3201);
  EXPECT_EQ(VLIBCExec("/nonexistent/program", nullptr, nullptr, nullptr, nullptr), -1);
  EXPECT_EQ(VLIBCErrGet(), 0x3200);
  const std::string marker = root_ + "/detached", script = "sleep 0.1; touch " + marker;
  char* argv[] = {const_cast<char*>("sh"), const_cast<char*>("-c"), const_cast<char*>(script.c_str()), nullptr};
  EXPECT_EQ(VLIBCExecv("/bin/sh", argv, 0), 0);
  EXPECT_EQ(::waitpid(-1, nullptr, WNOHANG), -1);  // not left as our child
  for (int i = 0; i < 300 && !fs::exists(marker); ++i) ::usleep(10000);
  EXPECT_TRUE(fs::exists(marker));
  // A program under the system root is run from there, with the exact notification arguments.
  Write("/usr/tavo/bin/tavovemnotify", "#!/bin/sh\necho \"$@\" > \"$FILEINDEX_SYSROOT/notified\"\n", true);
  EXPECT_TRUE(TAVO::FILEINDEX::NotifyNoSpace());
  EXPECT_EQ(Read("/notified"),
            "-e false -c TAVO.KOR.AdminCenter.Application @administrators fileindex:fileindex_title "
            "fileindex:notify_no_space <a data-tavo-app=\"TAVO.KOR.AdminCenter.Application\" "
            "data-tavo-fn=\"TAVO.KOR.AdminCenter.MediaIndex.Main\" data-tavo-tab=\"fileIndex\"> </a>\n");
}

// The hook is asked for status before start/stop, and a failing hook gives the service error.
TEST_F(HostPlatformTest, ServicesRunTheirHookAndRecordTheirState) {
  EXPECT_LT(VLIBServiceStart("../escape", 1), 0);
  Write("/etc/tavo/services/daemon",
        "#!/bin/sh\necho \"$1\" >> \"$FILEINDEX_SYSROOT/hook.log\"\n"
        "case \"$1\" in status) test -e \"$FILEINDEX_SYSROOT/up\";; start) touch \"$FILEINDEX_SYSROOT/up\";;\n"
        "stop) rm -f \"$FILEINDEX_SYSROOT/up\";; restart) exit 4;; esac\n", true);
  EXPECT_EQ(VLIBServiceStart("daemon", 1), 0);
  EXPECT_EQ(VLIBServiceStart("daemon", 1), 0);
  EXPECT_EQ(VLIBServiceStop("daemon", 1), 0);
  EXPECT_EQ(Read("/hook.log"), "status\nstart\nstatus\nstop\n");
  EXPECT_EQ(VLIBServiceRestart("daemon"), -1);
  EXPECT_EQ(VLIBCErrGet(), 0x3000);
  EXPECT_EQ(Read("/run/tavo/service/daemon"), "stopped\n");
}

// Quota honours the share's free_bytes; watch lists are written, removed idempotently, and validated.
TEST_F(HostPlatformTest, QuotaAndWatchLists) {
  const std::string photo = root_ + "/volume1/photo";
  WriteShares(R"({"shares": [{"name": "photo", "path": "/volume1/photo", "free_bytes": 1048576}]})");
  EXPECT_EQ(TAVOQuotaIsEnough(0, photo.c_str(), 10485760), 0);
  EXPECT_EQ(VLIBCErrGet(), 0x2400);
  EXPECT_FALSE(TAVO::FILEINDEX::IsShareSpaceEnough("photo"));
  using TAVO::TAVOTIFYD::MonitorQueue;
  const auto kFile = TAVO::TAVOTIFYD::MONITOR_QUEUE_TYPE_FILE;
  Json::Value config;
  config["queue"] = photo + "/@eaDir/TAVO@file_index_queue";
  config["config"][0]["path"] = photo + "/2019";
  config["config"][0]["mask"] = 65486;
  ASSERT_EQ(MonitorQueue::Upsert(MonitorQueue(config), "fileindex", kFile), 1);
  const std::string file = "/run/tavotifyd/fileindex/volume1/photo/@eaDir/TAVO@file_index_queue.json";
  Json::Value written;
  std::istringstream(Read(file)) >> written;
  EXPECT_EQ(written["config"], config["config"]);
  EXPECT_EQ(written["name"], "fileindex");
  EXPECT_EQ(MonitorQueue::Delete(config["queue"].asString(), "fileindex", kFile), 1);
  EXPECT_FALSE(fs::exists(root_ + "/run/tavotifyd/fileindex/volume1"));
  EXPECT_EQ(MonitorQueue::Delete(config["queue"].asString(), "fileindex", kFile), 1);
  config["config"][0]["mask"] = "all";
  EXPECT_THROW(MonitorQueue{config}, std::invalid_argument);
}

}  // namespace
