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
    std::ifstream in(root_ + path);
    std::stringstream text;
    text << in.rdbuf();
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

TEST_F(HostPlatformTest, ShareLookupTakesTheLongestWholeComponentPrefix) {
  const std::string v1 = root_ + "/volume1";
  EXPECT_EQ(ShareOf(v1 + "/photo/2019/a.jpg"), "photo " + v1 + "/photo");
  EXPECT_EQ(ShareOf(v1 + "/photo"), "photo " + v1 + "/photo");
  EXPECT_EQ(ShareOf(v1 + "/photos/x"), "photos " + v1 + "/photos");
  EXPECT_EQ(ShareOf(v1 + "/photo/inner/a"), "inner " + v1 + "/photo/inner");
  EXPECT_EQ(ShareOf(v1 + "/photo/innerx"), "photo " + v1 + "/photo");
  EXPECT_EQ(ShareOf(v1 + "/pho"), "!1400");
  EXPECT_EQ(ShareOf("/volume1/photo/2019"), "!1400");  // outside the system root
  EXPECT_EQ(ShareOf(root_ + "/volume2/other/a"), "!1403");

  char name[4], dir[4096];
  EXPECT_LT(TAVOShareNamePathGet((v1 + "/photos").c_str(), name, sizeof(name), dir, sizeof(dir)), 0);
  EXPECT_EQ(VLIBCErrGet(), 0x1402);

  PTAVOSHARE share = nullptr;
  EXPECT_LT(TAVOShareGet("misnamed", &share), 0);
  EXPECT_EQ(VLIBCErrGet(), 0x1403);
  ASSERT_EQ(TAVOShareGet("photo", &share), 0);
  EXPECT_STREQ(share->szName, "photo");
  EXPECT_EQ(share->szPath, v1 + "/photo");
  TAVOShareFree(share);

  // The library's full path goes through the same table.
  std::string full;
  ASSERT_TRUE(TAVO::FILEINDEX::GetFullPath(full, "/photos/2019"));
  EXPECT_EQ(full, v1 + "/photos/2019");

  // A changed table is read again; a broken one is an error, not the old table.
  WriteShares(R"({"shares": [{"name": "video", "path": "/volume3/video"}]})");
  EXPECT_EQ(ShareOf(root_ + "/volume3/video/a"), "video " + root_ + "/volume3/video");
  EXPECT_EQ(ShareOf(v1 + "/photo/a"), "!1400");
  for (const char* broken :
       {R"({"shares": [{"name": "video", "path": "volume3/video"}]})",
        R"({"shares": [{"name": "video", "path": "/volume3/video", "readonly": "no"}]})",
        R"({"shares": [{"name": "video", "path": "/v/video"}, {"name": "video", "path": "/w/video"}]})",
        R"({"shares": [{"name": "video", "path": "/volume3/../video"}]})", "[]"}) {
    WriteShares(broken);
    EXPECT_EQ(ShareOf(root_ + "/volume3/video/a"), "!1401") << broken;
  }
}

TEST_F(HostPlatformTest, RecycleBinsAndSnapshotsAreAtTheShareTop) {
  const std::string photo = root_ + "/volume1/photo";
  EXPECT_EQ(TAVOShareIsShareRecycle((photo + "/#recycle/a.jpg").c_str()), 1);
  EXPECT_EQ(TAVOShareIsShareRecycle((photo + "/#recycle").c_str()), 1);
  EXPECT_EQ(TAVOShareIsShareRecycle((photo + "/2019/#recycle/a").c_str()), 0);
  EXPECT_EQ(TAVOShareIsShareRecycle((photo + "/#recycled").c_str()), 0);
  EXPECT_EQ(TAVOShareIsShareRecycle((root_ + "/volume1/photos/#recycle").c_str()), 0);  // bin off

  int in = -1;
  ASSERT_EQ(VLIBFhsPathInSnapshot((photo + "/#snapshot/daily/a").c_str(), &in), 0);
  EXPECT_EQ(in, 1);
  ASSERT_EQ(VLIBFhsPathInSnapshot((photo + "/2019/#snapshot").c_str(), &in), 0);
  EXPECT_EQ(in, 0);

  EXPECT_EQ(TAVOEAIsHiddenDir("@eaDir"), 1);
  EXPECT_EQ(TAVOEAIsHiddenDir("@eadir"), 0);
  ASSERT_EQ(TAVOEAMKDir(0, (photo + "/@eaDir").c_str()), 0);
  EXPECT_TRUE(fs::is_directory(photo + "/@eaDir"));
  EXPECT_EQ(TAVOEAMKDir(0, (photo + "/@eaDir").c_str()), 0);
  EXPECT_LT(TAVOEAMKDir(0, (photo + "/missing/@eaDir").c_str()), 0);

  EXPECT_EQ(TAVOGetFSType((photo + "/missing").c_str(), 0), -1);
  int type = TAVOGetFSType(photo.c_str(), 0);
  EXPECT_GE(type, 0);
  EXPECT_EQ(TAVOFSIsRemoteFS(0x6969), 1);                            // NFS
  EXPECT_EQ(TAVOFSIsRemoteFS(0x7F534D42), 1);                        // CIFS, folded to a non-negative code
  EXPECT_EQ(TAVOFSIsImageFS(0x9660), 1);                             // ISO 9660
  EXPECT_EQ(TAVOFSIsRemoteFS(0xEF53) + TAVOFSIsImageFS(0xEF53), 0);  // ext4
}

TEST_F(HostPlatformTest, MountPointsAreFoundByDeviceAndByMountTable) {
  const std::string photo = root_ + "/volume1/photo";
  EXPECT_EQ(TAVOFSDirIsMntPoint(photo.c_str()), 0);
  EXPECT_EQ(TAVOFSDirIsMntPoint("/"), 1);
  Write("/volume1/photo/file", "x");
  EXPECT_EQ(TAVOFSDirIsMntPoint((photo + "/file").c_str()), 0);

  // Mounts go into a private namespace of this process, so nothing outlives the test.
  if (::unshare(CLONE_NEWNS) != 0 || ::mount(nullptr, "/", nullptr, MS_REC | MS_PRIVATE, nullptr) != 0)
    GTEST_SKIP() << "cannot make a private mount namespace: " << std::strerror(errno);
  fs::create_directories(photo + "/tmpfs");
  ASSERT_EQ(::mount("none", (photo + "/tmpfs").c_str(), "tmpfs", 0, "size=1m"), 0) << std::strerror(errno);
  mounts_.push_back(photo + "/tmpfs");
  fs::create_directories(photo + "/bind");
  ASSERT_EQ(::mount((photo + "/2019").c_str(), (photo + "/bind").c_str(), nullptr, MS_BIND, nullptr), 0);
  mounts_.push_back(photo + "/bind");

  EXPECT_EQ(TAVOFSDirIsMntPoint((photo + "/tmpfs").c_str()), 1);
  EXPECT_EQ(TAVOFSDirIsMntPoint((photo + "/tmpfs/").c_str()), 1);
  EXPECT_EQ(TAVOFSDirIsMntPoint((photo + "/bind").c_str()), 1);  // same device as its parent
  fs::create_directories(photo + "/tmpfs/sub");
  EXPECT_EQ(TAVOFSDirIsMntPoint((photo + "/tmpfs/sub").c_str()), 0);

  // The library refuses a volume mounted inside an ordinary share.
  EXPECT_FALSE(TAVO::FILEINDEX::CanFullPathBeIndexed(photo + "/tmpfs"));
  EXPECT_TRUE(TAVO::FILEINDEX::CanFullPathBeIndexed(photo + "/2019"));
}

TEST_F(HostPlatformTest, SpotlightEditKeepsEverythingElse) {
  const std::string original =
      "# Samba configuration\n"
      "; the appliance's defaults\n"
      "[global]\n"
      "    workgroup = WORKGROUP\n"
      "    # spotlight = yes   (a comment, not a setting)\n"
      "    server string = NAS \\\n"
      "        with continuation\n"
      "\n"
      "[photo]\n"
      "    path = /volume1/photo\n"
      "    spotlight = yes\n";
  Write("/etc/samba/smb.conf", original);
  EXPECT_EQ(TAVOSMBIsEnableSpotlight(), 0);  // only the [photo] share has it

  ASSERT_EQ(TAVOSMBSetSpotlight(1), 0);
  EXPECT_EQ(TAVOSMBIsEnableSpotlight(), 1);
  const std::string on = Read("/etc/samba/smb.conf");
  EXPECT_EQ(on,
            "# Samba configuration\n"
            "; the appliance's defaults\n"
            "[global]\n"
            "    workgroup = WORKGROUP\n"
            "    # spotlight = yes   (a comment, not a setting)\n"
            "    server string = NAS \\\n"
            "        with continuation\n"
            "    spotlight = yes\n"
            "\n"
            "[photo]\n"
            "    path = /volume1/photo\n"
            "    spotlight = yes\n");

  // Switching off edits the same line in place.
  ASSERT_EQ(TAVOSMBSetSpotlight(0), 0);
  EXPECT_EQ(TAVOSMBIsEnableSpotlight(), 0);
  std::string expectedOff = on;
  expectedOff.replace(expectedOff.find("    spotlight = yes\n\n"), 19, "    spotlight = no");
  EXPECT_EQ(Read("/etc/samba/smb.conf"), expectedOff);

  // Names are matched as Samba does (case and blanks ignored), and true/1 are on.
  Write("/etc/samba/smb.conf", "[Global]\n\tSpot Light=True\n[x]\n");
  EXPECT_EQ(TAVOSMBIsEnableSpotlight(), 1);
  ASSERT_EQ(TAVOSMBSetSpotlight(0), 0);
  EXPECT_EQ(Read("/etc/samba/smb.conf"), "[Global]\n\tSpot Light = no\n[x]\n");

  // Without a [global] section one is added before the first share, after the comments.
  Write("/etc/samba/smb.conf", "# c\n[x]\n\tpath = /x\n");
  ASSERT_EQ(TAVOSMBSetSpotlight(1), 0);
  EXPECT_EQ(Read("/etc/samba/smb.conf"), "# c\n[global]\n\tspotlight = yes\n\n[x]\n\tpath = /x\n");
}

TEST_F(HostPlatformTest, UnicodeComparisonFoldsCase) {
  EXPECT_EQ(VLIBCUnicodeUTF8StrCaseCmp("é", "É"), 0);
  EXPECT_EQ(VLIBCUnicodeUTF8StrCaseCmp("Été 2019", "éTÉ 2019"), 0);
  EXPECT_EQ(VLIBCUnicodeUTF8StrCaseCmp("e\xCC\x81", "É"), 0);  // decomposed é
  EXPECT_EQ(VLIBCUnicodeUTF8StrCaseCmp("Straße", "STRASSE"), 0);
  EXPECT_EQ(VLIBCUnicodeUTF8StrCaseCmp("ΣΊΣΥΦΟΣ", "σίσυφος"), 0);
  EXPECT_EQ(VLIBCUnicodeUTF8StrCaseCmp("abc", "ABC"), 0);
  EXPECT_LT(VLIBCUnicodeUTF8StrCaseCmp("a", "B"), 0);
  EXPECT_GT(VLIBCUnicodeUTF8StrCaseCmp("B", "a"), 0);
  EXPECT_LT(VLIBCUnicodeUTF8StrCaseCmp("ab", "ABC"), 0);
  // Decomposed before comparing: é sorts between e and f, not after z.
  EXPECT_LT(VLIBCUnicodeUTF8StrCaseCmp("é", "F"), 0);
  EXPECT_GT(VLIBCUnicodeUTF8StrCaseCmp("Z", "é"), 0);
  EXPECT_LT(VLIBCUnicodeUTF8StrCaseCmp("e", "é"), 0);
  EXPECT_GT(VLIBCUnicodeUTF8StrCaseCmp("École", "ecole"), 0);
}

TEST_F(HostPlatformTest, ProgramsRunWithoutLeakedDescriptorsOrIgnoredSignals) {
  int leaked = ::open("/dev/null", O_RDONLY);  // deliberately without O_CLOEXEC
  ASSERT_GE(leaked, 3);
  const std::string probe = "test ! -e /proc/self/fd/" + std::to_string(leaked);
  EXPECT_EQ(VLIBCExec("/bin/sh", "-c", probe.c_str(), nullptr, nullptr), 0);
  ::close(leaked);

  auto previous = ::signal(SIGPIPE, SIG_IGN);
  EXPECT_EQ(VLIBCExec("/bin/sh", "-c",
                      "ign=$(grep SigIgn /proc/self/status | cut -f2); [ $((0x$ign & 0x1000)) -eq 0 ]",
                      nullptr, nullptr),
            0);
  ::signal(SIGPIPE, previous);

  EXPECT_EQ(VLIBCExec("/bin/sh", "-c", "exit 3", nullptr, nullptr), 3);
  EXPECT_EQ(VLIBCErrGet(), 0x3201);
  EXPECT_EQ(VLIBCExec("/nonexistent/program", nullptr, nullptr, nullptr, nullptr), -1);
  EXPECT_EQ(VLIBCErrGet(), 0x3200);

  // Without waiting: started, not left as this process's child.
  const std::string marker = root_ + "/detached";
  const std::string script = "sleep 0.1; touch " + marker;
  char* argv[] = {const_cast<char*>("sh"), const_cast<char*>("-c"), const_cast<char*>(script.c_str()),
                  nullptr};
  EXPECT_EQ(VLIBCExecv("/bin/sh", argv, 0), 0);
  EXPECT_FALSE(fs::exists(marker));
  EXPECT_EQ(::waitpid(-1, nullptr, WNOHANG), -1);
  for (int i = 0; i < 300 && !fs::exists(marker); ++i) ::usleep(10000);
  EXPECT_TRUE(fs::exists(marker));

  // A program under the system root is run from there: the sandbox's notifier.
  Write("/usr/tavo/bin/tavovemnotify", "#!/bin/sh\necho \"$@\" > \"$FILEINDEX_SYSROOT/notified\"\n", true);
  EXPECT_TRUE(TAVO::FILEINDEX::NotifyNoSpace());
  EXPECT_EQ(Read("/notified"),
            "-e false -c TAVO.KOR.AdminCenter.Application @administrators fileindex:fileindex_title "
            "fileindex:notify_no_space <a data-tavo-app=\"TAVO.KOR.AdminCenter.Application\" "
            "data-tavo-fn=\"TAVO.KOR.AdminCenter.MediaIndex.Main\" data-tavo-tab=\"fileIndex\"> </a>\n");
}

TEST_F(HostPlatformTest, ServicesRunTheirHookAndRecordTheirState) {
  EXPECT_EQ(VLIBServiceStart("plain", 1), 0);
  EXPECT_EQ(Read("/run/tavo/service/plain"), "running\n");
  EXPECT_EQ(VLIBServiceStop("plain", 1), 0);
  EXPECT_EQ(Read("/run/tavo/service/plain"), "stopped\n");
  EXPECT_LT(VLIBServiceStart("../escape", 1), 0);

  // The hook logs its actions; "status" says running once it was started.
  Write(
      "/etc/tavo/services/daemon",
      "#!/bin/sh\nlog=\"$FILEINDEX_SYSROOT/hook.log\"\necho \"$1\" >> \"$log\"\n"
      "case \"$1\" in status) test -e \"$FILEINDEX_SYSROOT/up\";; start) touch \"$FILEINDEX_SYSROOT/up\";;\n"
      "stop) rm -f \"$FILEINDEX_SYSROOT/up\";; restart) exit 4;; esac\n",
      true);
  EXPECT_EQ(VLIBServiceStart("daemon", 1), 0);
  EXPECT_EQ(VLIBServiceStart("daemon", 1), 0);
  EXPECT_EQ(VLIBServiceStop("daemon", 1), 0);
  EXPECT_EQ(Read("/hook.log"), "status\nstart\nstatus\nstop\n");
  EXPECT_EQ(VLIBServiceRestart("daemon"), -1);
  EXPECT_EQ(VLIBCErrGet(), 0x3000);
  EXPECT_EQ(Read("/run/tavo/service/daemon"), "stopped\n");
}

TEST_F(HostPlatformTest, QuotaAndWatchLists) {
  const std::string photo = root_ + "/volume1/photo";
  EXPECT_EQ(TAVOQuotaIsEnough(0, photo.c_str(), 4096), 1);
  EXPECT_EQ(TAVOQuotaIsEnough(0, photo.c_str(), 1ULL << 62), 0);
  EXPECT_EQ(VLIBCErrGet(), 0x2900);
  WriteShares(R"({"shares": [{"name": "photo", "path": "/volume1/photo", "free_bytes": 1048576}]})");
  EXPECT_EQ(TAVOQuotaIsEnough(0, photo.c_str(), 10485760), 0);
  EXPECT_EQ(VLIBCErrGet(), 0x2400);
  EXPECT_FALSE(TAVO::FILEINDEX::IsShareSpaceEnough("photo"));

  using TAVO::TAVOTIFYD::MonitorQueue;
  Json::Value config;
  config["queue"] = photo + "/@eaDir/TAVO@file_index_queue";
  Json::Value entry;
  entry["path"] = photo + "/2019";
  entry["mask"] = 65486;
  entry["ignore"].append("@eaDir");
  config["config"].append(entry);
  ASSERT_EQ(MonitorQueue::Upsert(MonitorQueue(config), "fileindex", TAVO::TAVOTIFYD::MONITOR_QUEUE_TYPE_FILE),
            1);
  const std::string file = "/run/tavotifyd/fileindex/volume1/photo/@eaDir/TAVO@file_index_queue.json";
  Json::Value written;
  std::istringstream(Read(file)) >> written;
  EXPECT_EQ(written["queue"], config["queue"]);
  EXPECT_EQ(written["config"], config["config"]);
  EXPECT_EQ(written["name"], "fileindex");
  EXPECT_EQ(written["type"], 1);

  EXPECT_EQ(
      MonitorQueue::Delete(config["queue"].asString(), "fileindex", TAVO::TAVOTIFYD::MONITOR_QUEUE_TYPE_FILE),
      1);
  EXPECT_FALSE(fs::exists(root_ + file));
  EXPECT_FALSE(fs::exists(root_ + "/run/tavotifyd/fileindex/volume1"));
  EXPECT_EQ(
      MonitorQueue::Delete(config["queue"].asString(), "fileindex", TAVO::TAVOTIFYD::MONITOR_QUEUE_TYPE_FILE),
      1);

  config["config"][0]["mask"] = "all";
  EXPECT_THROW(MonitorQueue{config}, std::invalid_argument);
}

}  // namespace
