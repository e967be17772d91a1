// Indexability rules and the per-share queue and database locations.
#include <fileindex/error.h>
#include <fileindex/fileindex_c.h>
#include <fileindex/utils.h>
#include <sys/stat.h>
#include <tavo/platform.h>

#include <cstring>
#include <regex>

#include "support/sysroot_test.h"

using namespace TAVO::FILEINDEX;

namespace {

class RulesTest : public SysrootTest {
 protected:
  static size_t Calls(const std::string& prefix) { return fake::CallsStartingWith(prefix).size(); }
  // One "Invaild Argument" line naming the failed check, 0xD00 raised at that line, no share lookup.
  static void ExpectBadArgument(int rc, const std::string& failed) {
    EXPECT_EQ(rc, -1) << failed;
    ASSERT_EQ(logcap::Texts().size(), 1u) << failed;
    const std::string line = logcap::Texts()[0];
    std::smatch m;
    ASSERT_TRUE(std::regex_match(line, m, std::regex("utils:([0-9]+) Invaild Argument \\((.*)\\)=\\[0\\]\n")))
        << line;
    EXPECT_EQ(m[2].str(), failed);
    EXPECT_EQ(fake::Get().errCode, 0xD00);
    EXPECT_EQ(fake::Get().errFile + ":" + std::to_string(fake::Get().errLine), "utils:" + m[1].str());
    EXPECT_EQ(Calls("TAVOShareGet("), 0u);
    fake::Get().calls.clear(), logcap::Clear(), fake::Get().errCode = 0;
  }
};

// Skipping asks the type first, looks at the last component only, and recycle before snapshot.
TEST_F(RulesTest, SkipIndexPreservedNamesAndShareRulesApplyInOrder) {
  EXPECT_TRUE(IsSkipIndex("no-slash"));
  EXPECT_EQ(fake::Get().calls, std::vector<std::string>{"TAVOGetFSType(no-slash,0)"});
  EXPECT_FALSE(IsSkipIndex("/v/p/@eaDir/x.jpg"));
  const std::string recycle = "/v/p/#recycle/a", snapshot = "/v/p/#snapshot/a";
  fake::Get().recyclePaths = {recycle};
  fake::Get().snapshotPaths = {snapshot};
  fake::Get().calls.clear();
  EXPECT_TRUE(IsSkipIndex(recycle) && IsSkipIndex(snapshot));
  EXPECT_EQ(Calls("VLIBFhsPathInSnapshot("), 1u) << "asked only for the path that is no recycle bin";
  fake::Get().remoteFsTypes = {5}, fake::Get().imageFsTypes = {7};
  for (int type : {-1, 5, 7, 12, 3}) {
    fake::Get().fsTypes["/v/p/a"] = type;
    fake::Get().calls.clear();
    EXPECT_EQ(IsSkipIndex("/v/p/a"), type != 3 && type != -1) << type;
    EXPECT_EQ(Calls("TAVOFSIsRemoteFS("), type == -1 ? 0u : 1u) << type;
  }
  for (const char* name : {".TemporaryItems", "TAVO@.fileindexdb", "TAVO@file_index_queue", "@eaDir"})
    EXPECT_TRUE(IsSystemPreservedFileName(name)) << name;
  for (const char* name : {".ds_store", "", "TAVO@file_index_queue.tmp"})
    EXPECT_FALSE(IsSystemPreservedFileName(name)) << name;
  // Shares: the name list is exact and checked before the platform; encrypted or read-only is refused.
  EXPECT_FALSE(CanShareBeIndexed(nullptr));
  char listed[] = "NetBackup", unlisted[] = "netbackup", empty[] = "";
  TAVOSHARE share;
  std::memset(&share, 0, sizeof(share));
  share.szComment = share.szPath = empty;
  share.szName = listed;
  EXPECT_FALSE(CanShareBeIndexed(&share));
  EXPECT_EQ(Calls("VLIBShare"), 0u);
  share.szName = unlisted;
  EXPECT_TRUE(CanShareBeIndexed(&share));
  share.blEncrypted = 1;
  EXPECT_FALSE(CanShareBeIndexed(&share));
  share.blEncrypted = 0, share.blReadOnly = 1;
  EXPECT_FALSE(CanShareBeIndexed(&share));
}

// Recycle before the type, type before the share lookup; unresolvable paths log and set BAD_PATH.
TEST_F(RulesTest, FullPathRefusalsComeInOrder) {
  AddShare("photo");
  const std::string root = Rooted("/volume1/photo"), recycle = root + "/#recycle";
  fake::Get().recyclePaths.insert(recycle);
  fake::Get().fsTypes[root] = -1;
  EXPECT_FALSE(CanFullPathBeIndexed(recycle));
  EXPECT_EQ(Calls("TAVOGetFSType("), 0u);
  EXPECT_FALSE(CanFullPathBeIndexed(root));
  EXPECT_EQ(Calls("TAVOShareNamePathGet("), 0u);
  EXPECT_FALSE(CanFullPathBeIndexed(Rooted("/volume2/x")));
  EXPECT_TRUE(logcap::Contains("GetShareNamePathByFullPath failed, path=" + Rooted("/volume2/x")));
  EXPECT_EQ(ErrorHandler::GetError(), FILEINDEX_ERR_BAD_PATH);
  EXPECT_FALSE(CanPathBeIndexed("/video/a"));
  EXPECT_TRUE(logcap::Contains("GetFullPath failed, path=/video/a"));
  fake::Get().fsTypes.clear();
  fake::Get().forced["TAVOShareGet"] = -1;
  EXPECT_FALSE(CanFullPathBeIndexed(root));
  EXPECT_TRUE(logcap::Contains("TAVOShareGet failed, share=photo"));
}

// Non-canonical or missing paths are refused with a log line; a mount point is refused (LOG_ERR)
// unless its share uses encryption.
TEST_F(RulesTest, OnlyCanonicalPathsAndEncryptedMountPointsPass) {
  AddShare("photo");
  AddShare("secret").encryption = true;
  const std::string mounted = Rooted("/volume1/photo/usb");
  ASSERT_EQ(::mkdir(mounted.c_str(), 0755), 0);
  EXPECT_FALSE(CanFullPathBeIndexed(mounted + "/../usb"));
  EXPECT_EQ(logcap::Count("check realpath failed, path=" + mounted + "/../usb"), 1);
  fake::Get().mountPoints = {mounted, Rooted("/volume1/secret")};
  EXPECT_TRUE(CanFullPathBeIndexed(Rooted("/volume1/secret")));
  logcap::Clear();
  EXPECT_FALSE(CanFullPathBeIndexed(mounted));
  ASSERT_EQ(logcap::Lines().size(), 1u);
  EXPECT_TRUE(logcap::Contains("Mount point[" + mounted + "] is not allowed to be indexed"));
  EXPECT_EQ(logcap::Lines()[0].priority, 3);
}

// Bad arguments: one log line naming the check, error 0xD00 raised at that line, no lookup.
TEST_F(RulesTest, LocationArgumentsAreCheckedThroughThePlatformErrorChannel) {
  AddShare("photo");
  char buffer[64];
  LOG_LEVEL = 0;
  ExpectBadArgument(FILEIDXQueuePathGet(nullptr, nullptr, 0), "__null != szName");
  ExpectBadArgument(FILEIDXQueuePathGet("photo", nullptr, 0), "__null != szOutQueuePath");
  ExpectBadArgument(FILEIDXDBPathGet("photo", nullptr, -1), "__null != szOutDBPath");
  ExpectBadArgument(FILEIDXDBPathGet("photo", buffer, 0), "cbOutLen > 0");
  EXPECT_EQ(FILEIDXQueuePathGet("video", buffer, sizeof(buffer)) + FILEIDXDBPathGet("video", buffer, 9), -2);
  EXPECT_EQ(logcap::Count("TAVOShareGet failed, name=video, code=5120"), 2);
}

// Paths live in the share's @eaDir (made; DB dir made, queue file not) and are cut like snprintf.
TEST_F(RulesTest, LocationPathsAreInTheEaDirAndCutLikeSnprintf) {
  AddShare("photo");
  const std::string eaDir = Rooted("/volume1/photo/@eaDir"), queue = eaDir + "/TAVO@file_index_queue",
                    db = eaDir + "/TAVO@.fileindexdb";
  char buffer[4096];
  EXPECT_EQ(FILEIDXQueuePathGet("photo", buffer, sizeof(buffer)), static_cast<int>(queue.size()));
  EXPECT_EQ(std::string(buffer), queue);
  EXPECT_EQ(fake::CallsStartingWith("TAVOEAMKDir("),
            std::vector<std::string>{"TAVOEAMKDir(0," + eaDir + ")"});
  EXPECT_EQ(FILEIDXDBPathGet("photo", buffer, sizeof(buffer)), static_cast<int>(db.size()));
  EXPECT_TRUE(buffer == db && IsDirExist(db) && !Exists(queue));
  EXPECT_EQ(Calls("TAVOShareFree("), Calls("TAVOShareGet(")) << "every share record is freed";
  std::memset(buffer, 'x', sizeof(buffer));
  EXPECT_EQ(FILEIDXQueuePathGet("photo", buffer, 10), 9);
  EXPECT_EQ(std::string(buffer, 11), queue.substr(0, 9) + '\0' + 'x');
  EXPECT_EQ(FILEIDXQueuePathGet("photo", buffer, 1), 0);
  EXPECT_EQ(buffer[0], '\0');
  EXPECT_EQ(FILEIDXDBPathGet("photo", buffer, static_cast<int>(db.size())), static_cast<int>(db.size()) - 1);
  EXPECT_TRUE(logcap::Texts().empty());
}

}  // namespace
