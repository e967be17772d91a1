// Indexability rules and the per-share queue and database locations.
#include <fileindex/error.h>
#include <fileindex/fileindex_c.h>
#include <fileindex/utils.h>
#include <sys/stat.h>
#include <tavo/platform.h>
#include <unistd.h>

#include <cstdlib>
#include <cstring>
#include <regex>

#include "support/sysroot_test.h"

using namespace TAVO::FILEINDEX;

namespace {

class RulesTest : public SysrootTest {
 protected:
  std::string Volume(const std::string& rest = "") const { return Rooted("/volume1" + rest); }
  static size_t Calls(const std::string& prefix) { return fake::CallsStartingWith(prefix).size(); }
  // Every share record handed out came back to TAVOShareFree.
  static void ExpectRecordsFreed() { EXPECT_EQ(Calls("TAVOShareFree("), Calls("TAVOShareGet(")); }
  void Reset() {
    fake::Get().calls.clear();
    logcap::Clear();
  }
};

// Names match exactly (case, suffixes); "@eaDir" counts only when the platform says 1.
TEST_F(RulesTest, PreservedNamesAreExactAndHiddenDirsCountOnlyWhenThePlatformSaysOne) {
  for (const char* name : {".TemporaryItems", "TAVO@.fileindexdb", "TAVO@file_index_queue", ".TAVOPPSDB", "@eaDir"})
    EXPECT_TRUE(IsSystemPreservedFileName(name)) << name;
  for (const char* name : {".ds_store", ".DS_Store ", "x.DS_Store", "", "TAVO@file_index_queue.tmp"})
    EXPECT_FALSE(IsSystemPreservedFileName(name)) << name;
  fake::Get().forced["TAVOEAIsHiddenDir"] = 2;
  EXPECT_FALSE(IsSystemPreservedFileName("@eaDir"));
  EXPECT_TRUE(IsSystemPreservedFileName(".DS_Store"));
}

// Type asked first; last component only; recycle before snapshot; a failed query skips nothing.
TEST_F(RulesTest, SkipIndexTakesTheTypeFirstAndAppliesItsRulesInOrder) {
  EXPECT_TRUE(IsSkipIndex("no-slash"));
  EXPECT_EQ(fake::Get().calls, std::vector<std::string>{"TAVOGetFSType(no-slash,0)"});
  EXPECT_TRUE(IsSkipIndex("/v/p/a/@eaDir"));
  EXPECT_FALSE(IsSkipIndex("/v/p/@eaDir/x.jpg"));
  const std::string recycle = "/v/p/#recycle/a", snapshot = "/v/p/#snapshot/a", both = "/v/p/#recycle/#snapshot/a";
  EXPECT_FALSE(IsSkipIndex(recycle)) << "#recycle alone decides nothing";
  fake::Get().recyclePaths = {recycle, both};
  fake::Get().snapshotPaths = {snapshot, both};
  Reset();
  EXPECT_TRUE(IsSkipIndex(recycle) && IsSkipIndex(snapshot) && IsSkipIndex(both));
  EXPECT_EQ(Calls("VLIBFhsPathInSnapshot("), 1u) << "asked only for the path that is no recycle bin";
  fake::Get().forced["VLIBFhsPathInSnapshot"] = -1;
  EXPECT_FALSE(IsSkipIndex(snapshot));
  // Unknown type skips nothing without asking further; remote, image and 12 skip.
  fake::Get().remoteFsTypes = {5};
  fake::Get().imageFsTypes = {6};
  for (int type : {-1, 5, 6, 12, 3}) {
    fake::Get().fsTypes["/v/p/a"] = type;
    Reset();
    EXPECT_EQ(IsSkipIndex("/v/p/a"), type != 3 && type != -1) << type;
    EXPECT_EQ(Calls("TAVOFSIsRemoteFS("), type == -1 ? 0u : 1u) << type;
  }
  EXPECT_TRUE(logcap::Texts().empty());
}

// The name list is exact and checked before the platform; encrypted/read-only/failed flags refuse.
TEST_F(RulesTest, ShareRulesCheckTheNameListExactlyThenTheFlags) {
  EXPECT_FALSE(CanShareBeIndexed(nullptr));
  char name[64], empty[] = "";
  TAVOSHARE share;
  std::memset(&share, 0, sizeof(share));
  share.szName = name;
  share.szComment = share.szPath = empty;
  for (const char* n : {"surveillance", "NetBackup", "Surveillance", "netbackup", "surveillance2"}) {
    std::snprintf(name, sizeof(name), "%s", n);
    Reset();
    const bool listed = std::strcmp(n, "surveillance") == 0 || std::strcmp(n, "NetBackup") == 0;
    EXPECT_EQ(CanShareBeIndexed(&share), !listed) << n;
    EXPECT_EQ(fake::Get().calls.empty(), listed) << n;
  }
  share.blEncryption = 1;  // using encryption while unlocked is fine
  for (int flags : {0, 1, 2}) {
    share.blEncrypted = flags == 1;
    share.blReadOnly = flags == 2;
    EXPECT_EQ(CanShareBeIndexed(&share), flags == 0) << flags;
  }
  fake::Get().forced["VLIBShareIsEncryptedGet"] = -1;
  Reset();
  EXPECT_FALSE(CanShareBeIndexed(&share));
  EXPECT_EQ(Calls("VLIBShareIsReadOnlyGet("), 0u);
  EXPECT_TRUE(logcap::Texts().empty());
}

// Recycle/snapshot before the type, type before the share lookup; failures log and set codes.
TEST_F(RulesTest, FullPathRefusalsComeInOrderAndFreeTheRecord) {
  AddShare("photo");
  const std::string root = Volume("/photo"), recycle = root + "/#recycle";
  ASSERT_EQ(::mkdir(recycle.c_str(), 0755), 0);
  EXPECT_TRUE(CanFullPathBeIndexed(recycle)) << "a #recycle the platform does not know goes on";
  ExpectRecordsFreed();
  fake::Get().recyclePaths.insert(recycle);
  Reset();
  EXPECT_FALSE(CanFullPathBeIndexed(recycle));
  EXPECT_EQ(Calls("TAVOGetFSType("), 0u);
  fake::Get().remoteFsTypes = {5};
  for (int type : {-1, 5}) {
    fake::Get().fsTypes[root] = type;
    Reset();
    EXPECT_FALSE(CanFullPathBeIndexed(root)) << type;
    EXPECT_EQ(Calls("TAVOShareNamePathGet("), 0u) << type;
  }
  fake::Get().fsTypes.clear();
  EXPECT_TRUE(logcap::Texts().empty());
  EXPECT_EQ(ErrorHandler::GetError(), FILEINDEX_ERR_NONE);

  EXPECT_FALSE(CanFullPathBeIndexed(Rooted("/volume2/x")));
  EXPECT_TRUE(logcap::Contains("GetShareNamePathByFullPath failed, path=" + Rooted("/volume2/x")));
  EXPECT_EQ(ErrorHandler::GetError(), FILEINDEX_ERR_BAD_PATH);
  ErrorHandler::SetError(FILEINDEX_ERR_NONE);
  fake::Get().forced["TAVOShareGet"] = -1;
  Reset();
  EXPECT_FALSE(CanFullPathBeIndexed(root));
  EXPECT_TRUE(logcap::Contains("TAVOShareGet failed, share=photo"));
  EXPECT_EQ(Calls("TAVOShareFree("), 0u);
  EXPECT_EQ(ErrorHandler::GetError(), FILEINDEX_ERR_NONE);
  fake::Get().forced.clear();
  fake::Get().shares["photo"].readOnly = true;
  Reset();
  EXPECT_FALSE(CanFullPathBeIndexed(root));
  EXPECT_EQ(Calls("TAVOFSDirIsMntPoint(") + logcap::Texts().size(), 0u);
  ExpectRecordsFreed();
}

// A mount point is refused (logged at LOG_ERR) unless its share uses encryption.
TEST_F(RulesTest, MountPointsAreAllowedOnlyOnSharesUsingEncryption) {
  AddShare("photo");
  AddShare("secret").encryption = true;
  const std::string mounted = Volume("/photo/usb");
  ASSERT_EQ(::mkdir(mounted.c_str(), 0755), 0);
  fake::Get().mountPoints = {mounted, Volume("/secret")};
  EXPECT_TRUE(CanFullPathBeIndexed(Volume("/secret")));
  EXPECT_FALSE(CanFullPathBeIndexed(mounted));
  ASSERT_EQ(logcap::Lines().size(), 1u);
  EXPECT_TRUE(std::regex_match(logcap::Lines()[0].text, std::regex("utils:[0-9]+ Mount point\\[.*\\] is not allowed to be indexed")));
  EXPECT_TRUE(logcap::Contains("[" + mounted + "]"));
  EXPECT_EQ(logcap::Lines()[0].priority, 3);
  ExpectRecordsFreed();
  fake::Get().forced = {{"TAVOFSDirIsMntPoint", 2}};
  Reset();
  EXPECT_TRUE(CanFullPathBeIndexed(mounted)) << "only exactly 1 means a mount point";
  EXPECT_EQ(Calls("VLIBShareIsEncryptionGet("), 0u);
}

// Non-canonical or missing paths are refused with a log line and no error code; share paths
// that cannot be resolved set BAD_PATH before the platform is asked.
TEST_F(RulesTest, OnlyCanonicalExistingPathsPassAndOnlyResolutionFailureSetsACode) {
  AddShare("photo");
  const std::string root = Volume("/photo");
  ASSERT_EQ(::mkdir((root + "/a").c_str(), 0755), 0);
  ASSERT_EQ(::symlink((root + "/a").c_str(), (root + "/link").c_str()), 0);
  for (const std::string& path : {root + "/", root + "/a/../a", root + "/link", root + "/missing"}) {
    logcap::Clear();
    EXPECT_FALSE(CanFullPathBeIndexed(path)) << path;
    EXPECT_EQ(logcap::Count("check realpath failed, path=" + path), 1) << path;
  }
  ExpectRecordsFreed();
  EXPECT_TRUE(CanPathBeIndexed("/photo/a"));
  EXPECT_EQ(ErrorHandler::GetError(), FILEINDEX_ERR_NONE);
  Reset();
  EXPECT_FALSE(CanPathBeIndexed("/video/a"));
  EXPECT_TRUE(logcap::Contains("GetFullPath failed, path=/video/a"));
  EXPECT_EQ(ErrorHandler::GetError(), FILEINDEX_ERR_BAD_PATH);
  EXPECT_EQ(Calls("TAVOShareNamePathGet("), 0u);
}

// Bad arguments: one log line naming the check, error 0xD00 raised at that line, no lookup.
TEST_F(RulesTest, LocationArgumentsAreCheckedInOrderThroughThePlatformErrorChannel) {
  AddShare("photo");
  char buffer[64];
  const struct {
    int (*fn)(const char*, char*, int);
    const char *name, *out;
    int len;
    const char* failed;
  } cases[] = {{FILEIDXQueuePathGet, nullptr, nullptr, 0, "__null != szName"},
                        {FILEIDXQueuePathGet, "photo", nullptr, 0, "__null != szOutQueuePath"},
                        {FILEIDXQueuePathGet, "photo", buffer, -5, "cbOutLen > 0"},
                        {FILEIDXDBPathGet, "photo", nullptr, -1, "__null != szOutDBPath"},
                        {FILEIDXDBPathGet, "photo", buffer, 0, "cbOutLen > 0"}};
  for (const auto& c : cases) {
    Reset();
    fake::Get().errCode = 0;
    LOG_LEVEL = 0;
    EXPECT_EQ(c.fn(c.name, const_cast<char*>(c.out), c.len), -1) << c.failed;
    ASSERT_EQ(logcap::Texts().size(), 1u) << c.failed;
    const std::string line = logcap::Texts()[0];
    std::smatch m;
    ASSERT_TRUE(std::regex_match(line, m, std::regex("utils:([0-9]+) Invaild Argument \\((.*)\\)=\\[0\\]\n"))) << line;
    EXPECT_EQ(m[2].str(), c.failed);
    EXPECT_EQ(fake::Get().errCode, 0xD00);
    EXPECT_EQ(fake::Get().errFile + ":" + std::to_string(fake::Get().errLine), "utils:" + m[1].str());
    EXPECT_EQ(Calls("TAVOShareGet("), 0u);
  }
  Reset();
  EXPECT_EQ(FILEIDXQueuePathGet("video", buffer, sizeof(buffer)) + FILEIDXDBPathGet("video", buffer, 9), -2);
  EXPECT_EQ(logcap::Count("TAVOShareGet failed, name=video, code=5120"), 2);
  EXPECT_EQ(fake::Get().errCode, 0x1400) << "the platform's error stays as it is";
  EXPECT_EQ(ErrorHandler::GetError(), FILEINDEX_ERR_NONE);
}

// Paths live in the share's @eaDir (made; DB dir made, queue file not) and are cut like snprintf;
// failures to make the directories are logged with their reason and the path still returned.
TEST_F(RulesTest, LocationPathsAreInTheEaDirAndCutLikeSnprintf) {
  AddShare("photo");
  const std::string eaDir = Volume("/photo/@eaDir"), queue = eaDir + "/TAVO@file_index_queue";
  const std::string db = eaDir + "/TAVO@.fileindexdb";
  char buffer[4096];
  EXPECT_EQ(FILEIDXQueuePathGet("photo", buffer, sizeof(buffer)), static_cast<int>(queue.size()));
  EXPECT_EQ(std::string(buffer), queue);
  EXPECT_EQ(fake::CallsStartingWith("TAVOEAMKDir("), std::vector<std::string>{"TAVOEAMKDir(0," + eaDir + ")"});
  EXPECT_FALSE(Exists(queue));
  for (int round = 0; round < 2; ++round)  // made, then already there
    EXPECT_EQ(FILEIDXDBPathGet("photo", buffer, sizeof(buffer)) == static_cast<int>(db.size()) && buffer == db &&
                  IsDirExist(db), true);
  ExpectRecordsFreed();
  std::memset(buffer, 'x', sizeof(buffer));
  EXPECT_EQ(FILEIDXQueuePathGet("photo", buffer, 10), 9);
  EXPECT_EQ(std::string(buffer, 11), queue.substr(0, 9) + '\0' + 'x');
  EXPECT_EQ(FILEIDXQueuePathGet("photo", buffer, 1), 0);
  EXPECT_EQ(buffer[0], '\0');
  EXPECT_EQ(FILEIDXDBPathGet("photo", buffer, static_cast<int>(db.size())), static_cast<int>(db.size()) - 1);
  EXPECT_TRUE(logcap::Texts().empty());
  // A directory that cannot be made is logged with its reason, and the path still returned.
  fake::Get().forced["TAVOEAMKDir"] = -1;
  fake::Get().errCode = 77;
  EXPECT_EQ(FILEIDXQueuePathGet("photo", buffer, sizeof(buffer)), static_cast<int>(queue.size()));
  EXPECT_EQ(std::string(buffer), queue);
  EXPECT_EQ(logcap::Texts().size(), 1u);
  EXPECT_EQ(logcap::Count("TAVOEAMKDir failed, path=" + eaDir + ", code=77"), 1);
  fake::Get().forced.clear();
  ASSERT_EQ(std::system(("rm -rf '" + eaDir + "'").c_str()), 0);
  WriteFile(eaDir, "not a directory");  // no directory can be made below it
  logcap::Clear();
  LOG_LEVEL = 8;
  EXPECT_EQ(FILEIDXDBPathGet("photo", buffer, sizeof(buffer)), static_cast<int>(db.size()));
  EXPECT_EQ(logcap::Count("mkdir failed, path=" + eaDir + "/TAVO@.fileindexdb, reason=Not a directory"), 1);
  EXPECT_EQ(ErrorHandler::GetError(), FILEINDEX_ERR_NONE);
  ExpectRecordsFreed();
}

}  // namespace
