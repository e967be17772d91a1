// Indexability rules and the per-share queue and database locations.
#include <fileindex/error.h>
#include <fileindex/fileindex_c.h>
#include <fileindex/utils.h>
#include <sys/stat.h>
#include <tavo/platform.h>

#include <cstring>

#include "support/sysroot_test.h"

using namespace TAVO::FILEINDEX;

static size_t Calls(const std::string& prefix) { return fake::CallsStartingWith(prefix).size(); }

using RulesTest = SysrootTest;

// Skipping looks at the last component only, and not at an unknown type (-1); share names are exact.
TEST_F(RulesTest, SkipIndexPreservedNamesAndShareRules) {
  EXPECT_FALSE(IsSkipIndex("/v/p/@eaDir/x.jpg"));
  fake::Get().recyclePaths = {"/v/p/#recycle/a"};
  fake::Get().snapshotPaths = {"/v/p/#snapshot/a"};
  EXPECT_TRUE(IsSkipIndex("/v/p/#recycle/a") && IsSkipIndex("/v/p/#snapshot/a"));
  fake::Get().remoteFsTypes = {5};
  fake::Get().imageFsTypes = {7};
  for (int type : {-1, 5, 7, 12, 3}) {
    fake::Get().fsTypes["/v/p/a"] = type;
    EXPECT_EQ(IsSkipIndex("/v/p/a"), type != 3 && type != -1) << type;
  }
  for (const char* name : {".TemporaryItems", "TAVO@.fileindexdb", "TAVO@file_index_queue", "@eaDir"})
    EXPECT_TRUE(IsSystemPreservedFileName(name)) << name;
  for (const char* name : {".ds_store", "TAVO@file_index_queue.tmp"})
    EXPECT_FALSE(IsSystemPreservedFileName(name)) << name;
  char listed[] = "NetBackup";
  char unlisted[] = "netbackup";
  // Name, comment, path, read-only, encrypted (and locked), uses encryption, recycle bin.
  TAVOSHARE shares[] = {{listed, nullptr, nullptr, 0, 0, 0, 0},
                        {unlisted, nullptr, nullptr, 0, 0, 0, 0},
                        {unlisted, nullptr, nullptr, 1, 0, 0, 0},
                        {unlisted, nullptr, nullptr, 0, 1, 0, 0}};
  for (TAVOSHARE& share : shares)
    EXPECT_EQ(CanShareBeIndexed(&share), &share == &shares[1]) << &share - shares;
  EXPECT_FALSE(CanShareBeIndexed(nullptr));
}

// Recycle before the type, which must be known; failed lookups log (and CanPathBeIndexed sets
// BAD_PATH). Only canonical paths pass; a mount point only where its share uses encryption.
TEST_F(RulesTest, FullPathRefusalsComeInOrderAndOnlyCanonicalPathsPass) {
  AddShare("photo");
  AddShare("secret").encryption = true;
  const std::string root = Rooted("/volume1/photo");
  fake::Get().recyclePaths.insert(root + "/#recycle");
  EXPECT_FALSE(CanFullPathBeIndexed(root + "/#recycle"));
  EXPECT_EQ(Calls("TAVOGetFSType("), 0u);
  EXPECT_FALSE(CanFullPathBeIndexed(Rooted("/volume2/x")));
  EXPECT_TRUE(logcap::Contains("GetShareNamePathByFullPath failed, path=" + Rooted("/volume2/x")));
  EXPECT_FALSE(CanPathBeIndexed("/video/a"));
  EXPECT_TRUE(logcap::Contains("GetFullPath failed, path=/video/a"));
  EXPECT_EQ(ErrorHandler::GetError(), FILEINDEX_ERR_BAD_PATH);
  ASSERT_EQ(::mkdir((root + "/usb").c_str(), 0755), 0);
  EXPECT_FALSE(CanFullPathBeIndexed(root + "/usb/../usb"));
  EXPECT_TRUE(logcap::Contains("check realpath failed, path=" + root + "/usb/../usb"));
  fake::Get().mountPoints = {root + "/usb", Rooted("/volume1/secret")};
  EXPECT_TRUE(CanFullPathBeIndexed(Rooted("/volume1/secret")));
  EXPECT_FALSE(CanFullPathBeIndexed(root + "/usb"));
  EXPECT_TRUE(logcap::Contains("Mount point[" + root + "/usb] is not allowed to be indexed"));
  fake::Get().fsTypes[Rooted("/volume1/secret")] = -1;
  EXPECT_FALSE(CanFullPathBeIndexed(Rooted("/volume1/secret")));
  fake::Get().forced["TAVOShareGet"] = -1;
  EXPECT_FALSE(CanFullPathBeIndexed(root));
  EXPECT_TRUE(logcap::Contains("TAVOShareGet failed, share=photo"));
}

// Paths live in the share's @eaDir (made; DB dir made, queue file not) and are cut like snprintf.
// Bad arguments go through the platform error channel; an unknown share fails with the lookup's line.
TEST_F(RulesTest, LocationPathsAreInTheEaDirAndArgumentsAreChecked) {
  AddShare("photo");
  char buffer[4096];
  // One line naming the failed check, error 0xD00 raised at that line, no share lookup.
  EXPECT_EQ(FILEIDXDBPathGet("photo", buffer, 0), -1);
  EXPECT_TRUE(fake::Get().errCode == 0xD00 && fake::Get().errFile == "utils");
  EXPECT_EQ(logcap::Texts(), std::vector<std::string>{"utils:" + std::to_string(fake::Get().errLine) +
                                                      " Invaild Argument (cbOutLen > 0)=[0]\n"});
  EXPECT_EQ(Calls("TAVOShareGet("), 0u);
  const std::string queue = Rooted("/volume1/photo/@eaDir/TAVO@file_index_queue");
  const std::string db = Rooted("/volume1/photo/@eaDir/TAVO@.fileindexdb");
  EXPECT_EQ(FILEIDXQueuePathGet("photo", buffer, sizeof(buffer)), static_cast<int>(queue.size()));
  EXPECT_EQ(std::string(buffer), queue);
  EXPECT_EQ(FILEIDXDBPathGet("photo", buffer, sizeof(buffer)), static_cast<int>(db.size()));
  EXPECT_TRUE(buffer == db && IsDirExist(db) && !Exists(queue));
  EXPECT_EQ(Calls("TAVOShareFree("), Calls("TAVOShareGet(")) << "every share record is freed";
  std::memset(buffer, 'x', sizeof(buffer));
  EXPECT_EQ(FILEIDXQueuePathGet("photo", buffer, 10), 9);
  EXPECT_EQ(std::string(buffer, 11), queue.substr(0, 9) + '\0' + 'x');
  EXPECT_EQ(FILEIDXQueuePathGet("video", buffer, sizeof(buffer)), -1);
  EXPECT_TRUE(logcap::Contains("TAVOShareGet failed, name=video, code=5120"));
}
