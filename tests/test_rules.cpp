// Indexability rules and the per-share queue and database locations.
#include <fileindex/error.h>
#include <fileindex/fileindex_c.h>
#include <fileindex/utils.h>
#include <sys/stat.h>
#include <tavo/platform.h>
#include <unistd.h>

#include <climits>
#include <cstdlib>
#include <cstring>
#include <regex>

#include "support/sysroot_test.h"

using namespace TAVO::FILEINDEX;

namespace {

class RulesTest : public SysrootTest {
 protected:
  void SetUp() override {
    SysrootTest::SetUp();
    char resolved[PATH_MAX];
    ASSERT_NE(::realpath(root_.c_str(), resolved), nullptr);
    ASSERT_EQ(root_, resolved) << "the test root must be a canonical path";
  }

  std::string Volume(const std::string& rest = "") const { return Rooted("/volume1" + rest); }

  // Position of the first recorded call starting with prefix, or -1.
  static int CallIndex(const std::string& prefix) {
    const auto& calls = fake::Get().calls;
    for (size_t i = 0; i < calls.size(); ++i) {
      if (calls[i].compare(0, prefix.size(), prefix) == 0) return static_cast<int>(i);
    }
    return -1;
  }
  static size_t Calls(const std::string& prefix) { return fake::CallsStartingWith(prefix).size(); }

  // Every record handed out came back to TAVOShareFree (for calls since the last Reset,
  // whose share lookups all succeeded).
  static void ExpectRecordsFreed() { EXPECT_EQ(Calls("TAVOShareFree("), Calls("TAVOShareGet(")); }

  void Reset() {
    fake::Get().calls.clear();
    logcap::Clear();
  }
};

TEST_F(RulesTest, PreservedNamesAreExactAndHiddenDirsCountOnlyWhenThePlatformSaysOne) {
  for (const char* name : {".TemporaryItems", "TAVO@.fileindexdb", "TAVO@file_index_queue", ".TAVOPPSDB",
                           ".DS_Store", "@eaDir"}) {
    EXPECT_TRUE(IsSystemPreservedFileName(name)) << name;
  }
  for (const char* name :
       {".ds_store", ".DS_Store ", "x.DS_Store", ".TAVOPPSD", "", "TAVO@file_index_queue.tmp"}) {
    EXPECT_FALSE(IsSystemPreservedFileName(name)) << name;
  }
  fake::Get().forced["TAVOEAIsHiddenDir"] = 2;
  EXPECT_FALSE(IsSystemPreservedFileName("@eaDir"));
  EXPECT_TRUE(IsSystemPreservedFileName(".DS_Store"));
}

TEST_F(RulesTest, SkipIndexTakesTheTypeFirstAndAppliesItsRulesInOrder) {
  EXPECT_TRUE(IsSkipIndex("no-slash"));
  ASSERT_FALSE(fake::Get().calls.empty());
  EXPECT_EQ(fake::Get().calls[0], "TAVOGetFSType(no-slash,0)");
  EXPECT_EQ(fake::Get().calls.size(), 1u);

  EXPECT_TRUE(IsSkipIndex("/volume1/photo/.DS_Store"));
  EXPECT_FALSE(IsSkipIndex("/volume1/photo/.ds_store"));
  EXPECT_TRUE(IsSkipIndex("/volume1/photo/a/@eaDir"));
  EXPECT_FALSE(IsSkipIndex("/volume1/photo/@eaDir/x.jpg")) << "only the last component is a name";

  // "#recycle" alone decides nothing: the platform must call it a recycle bin.
  const std::string recycle = "/volume1/photo/#recycle/a.jpg";
  Reset();
  EXPECT_FALSE(IsSkipIndex(recycle));
  EXPECT_EQ(Calls("TAVOShareIsShareRecycle("), 1u);
  fake::Get().recyclePaths.insert(recycle);
  EXPECT_TRUE(IsSkipIndex(recycle));
  Reset();
  EXPECT_FALSE(IsSkipIndex("/volume1/photo/recycle/a.jpg"));
  EXPECT_EQ(Calls("TAVOShareIsShareRecycle("), 0u);
  EXPECT_EQ(Calls("VLIBFhsPathInSnapshot("), 0u);

  const std::string snapshot = "/volume1/photo/#snapshot/s1/a.jpg";
  EXPECT_FALSE(IsSkipIndex(snapshot));
  fake::Get().snapshotPaths.insert(snapshot);
  EXPECT_TRUE(IsSkipIndex(snapshot));
  fake::Get().forced["VLIBFhsPathInSnapshot"] = -1;
  EXPECT_FALSE(IsSkipIndex(snapshot)) << "a failed snapshot query does not skip";
  fake::Get().forced.erase("VLIBFhsPathInSnapshot");

  // A recycle bin is decided before the snapshot question is asked.
  const std::string both = "/volume1/photo/#recycle/#snapshot/a";
  fake::Get().recyclePaths.insert(both);
  Reset();
  EXPECT_TRUE(IsSkipIndex(both));
  EXPECT_EQ(Calls("VLIBFhsPathInSnapshot("), 0u);

  // File-system types: unknown skips nothing; remote, image and 12 skip.
  fake::Get().remoteFsTypes = {5};
  fake::Get().imageFsTypes = {6};
  const std::string file = "/volume1/photo/a.jpg";
  fake::Get().fsTypes[file] = -1;
  Reset();
  EXPECT_FALSE(IsSkipIndex(file));
  EXPECT_EQ(Calls("TAVOFSIsRemoteFS("), 0u);
  for (int type : {5, 6, 12}) {
    fake::Get().fsTypes[file] = type;
    EXPECT_TRUE(IsSkipIndex(file)) << type;
  }
  fake::Get().fsTypes[file] = 3;
  EXPECT_FALSE(IsSkipIndex(file));
  EXPECT_TRUE(logcap::Texts().empty());
}

TEST_F(RulesTest, ShareRulesCheckTheNameListExactlyThenTheFlags) {
  EXPECT_FALSE(CanShareBeIndexed(nullptr));

  char name[64];
  char empty[] = "";
  TAVOSHARE share;
  std::memset(&share, 0, sizeof(share));
  share.szName = name;
  share.szComment = empty;
  share.szPath = empty;

  for (const char* refused : {"surveillance", "NetBackup"}) {
    std::snprintf(name, sizeof(name), "%s", refused);
    Reset();
    EXPECT_FALSE(CanShareBeIndexed(&share)) << refused;
    EXPECT_TRUE(fake::Get().calls.empty()) << "the name list is checked before the platform is asked";
  }
  for (const char* allowed : {"Surveillance", "netbackup", "surveillance2", "photo"}) {
    std::snprintf(name, sizeof(name), "%s", allowed);
    EXPECT_TRUE(CanShareBeIndexed(&share)) << allowed;
  }

  std::snprintf(name, sizeof(name), "photo");
  share.blEncrypted = 1;
  EXPECT_FALSE(CanShareBeIndexed(&share));
  share.blEncrypted = 0;
  share.blReadOnly = 1;
  EXPECT_FALSE(CanShareBeIndexed(&share));
  share.blReadOnly = 0;
  share.blEncryption = 1;
  EXPECT_TRUE(CanShareBeIndexed(&share)) << "using encryption while unlocked is fine";

  fake::Get().forced["VLIBShareIsEncryptedGet"] = -1;
  Reset();
  EXPECT_FALSE(CanShareBeIndexed(&share));
  EXPECT_EQ(Calls("VLIBShareIsReadOnlyGet("), 0u);
  fake::Get().forced.clear();
  fake::Get().forced["VLIBShareIsReadOnlyGet"] = -1;
  EXPECT_FALSE(CanShareBeIndexed(&share));
  EXPECT_TRUE(logcap::Texts().empty());
}

TEST_F(RulesTest, FullPathRefusalsComeInOrderAndFreeTheRecord) {
  AddShare("photo");
  const std::string root = Volume("/photo");
  ASSERT_EQ(::mkdir(Volume("/photo/2019").c_str(), 0755), 0);

  EXPECT_TRUE(CanFullPathBeIndexed(root));
  EXPECT_TRUE(CanFullPathBeIndexed(root + "/2019"));
  ExpectRecordsFreed();
  EXPECT_TRUE(logcap::Texts().empty());

  // Recycle bin and snapshot: refused silently, before the type is asked for.
  const std::string recycle = root + "/#recycle";
  ASSERT_EQ(::mkdir(recycle.c_str(), 0755), 0);
  fake::Get().recyclePaths.insert(recycle);
  Reset();
  EXPECT_FALSE(CanFullPathBeIndexed(recycle));
  EXPECT_EQ(Calls("TAVOGetFSType("), 0u);
  fake::Get().recyclePaths.clear();
  EXPECT_TRUE(CanFullPathBeIndexed(recycle)) << "a #recycle the platform does not know goes on";

  const std::string snapshot = root + "/#snapshot";
  fake::Get().snapshotPaths.insert(snapshot);
  Reset();
  EXPECT_FALSE(CanFullPathBeIndexed(snapshot));
  EXPECT_EQ(Calls("TAVOGetFSType("), 0u);

  // Unknown, remote, image and type 12: refused silently before the share is looked up.
  fake::Get().remoteFsTypes = {5};
  fake::Get().imageFsTypes = {6};
  for (int type : {-1, 5, 6, 12}) {
    fake::Get().fsTypes[root] = type;
    Reset();
    EXPECT_FALSE(CanFullPathBeIndexed(root)) << type;
    EXPECT_EQ(Calls("TAVOShareNamePathGet("), 0u) << type;
  }
  fake::Get().fsTypes.clear();
  EXPECT_TRUE(logcap::Texts().empty());
  EXPECT_EQ(ErrorHandler::GetError(), FILEINDEX_ERR_NONE);

  // No share holds the path: logged, and the lookup's code 2 stays.
  const std::string outside = Rooted("/volume2/x");
  EXPECT_FALSE(CanFullPathBeIndexed(outside));
  EXPECT_TRUE(logcap::Contains("utils:"));
  EXPECT_TRUE(logcap::Contains("GetShareNamePathByFullPath failed, path=" + outside));
  EXPECT_EQ(ErrorHandler::GetError(), FILEINDEX_ERR_BAD_PATH);
  ErrorHandler::SetError(FILEINDEX_ERR_NONE);

  fake::Get().forced["TAVOShareGet"] = -1;
  Reset();
  EXPECT_FALSE(CanFullPathBeIndexed(root));
  EXPECT_TRUE(logcap::Contains("TAVOShareGet failed, share=photo"));
  EXPECT_EQ(Calls("TAVOShareFree("), 0u);
  fake::Get().forced.clear();
  EXPECT_EQ(ErrorHandler::GetError(), FILEINDEX_ERR_NONE);

  // A share that may not be indexed: silent, and the record is freed.
  fake::Get().shares["photo"].readOnly = true;
  Reset();
  EXPECT_FALSE(CanFullPathBeIndexed(root));
  EXPECT_TRUE(logcap::Texts().empty());
  EXPECT_EQ(Calls("TAVOFSDirIsMntPoint("), 0u);
  ExpectRecordsFreed();
  fake::Get().shares["photo"].readOnly = false;
}

TEST_F(RulesTest, MountPointsAreAllowedOnlyOnSharesUsingEncryption) {
  AddShare("photo");
  AddShare("secret").encryption = true;
  ASSERT_EQ(::mkdir(Volume("/photo/usb").c_str(), 0755), 0);
  const std::string mounted = Volume("/photo/usb");
  fake::Get().mountPoints = {mounted, Volume("/secret")};

  EXPECT_TRUE(CanFullPathBeIndexed(Volume("/secret")));
  EXPECT_TRUE(logcap::Texts().empty());

  EXPECT_FALSE(CanFullPathBeIndexed(mounted));
  std::vector<std::string> lines = logcap::Texts();
  ASSERT_EQ(lines.size(), 1u);
  EXPECT_TRUE(std::regex_match(
      lines[0], std::regex("utils:[0-9]+ Mount point\\[" + mounted + "\\] is not allowed to be indexed")))
      << lines[0];
  EXPECT_EQ(logcap::Lines()[0].priority, 3);
  ExpectRecordsFreed();

  // When the platform cannot tell whether the share uses encryption, the mount point passes.
  fake::Get().forced["VLIBShareIsEncryptionGet"] = -1;
  EXPECT_TRUE(CanFullPathBeIndexed(mounted));
  fake::Get().forced.clear();
  // Only a result of exactly 1 means a mount point.
  fake::Get().forced["TAVOFSDirIsMntPoint"] = 2;
  Reset();
  EXPECT_TRUE(CanFullPathBeIndexed(mounted));
  EXPECT_EQ(Calls("VLIBShareIsEncryptionGet("), 0u);
}

TEST_F(RulesTest, OnlyCanonicalExistingPathsPassTheRealpathCheck) {
  AddShare("photo");
  const std::string root = Volume("/photo");
  ASSERT_EQ(::mkdir((root + "/a").c_str(), 0755), 0);
  ASSERT_EQ(::symlink((root + "/a").c_str(), (root + "/link").c_str()), 0);

  for (const std::string& path : {root + "/", root + "/.", root + "/./a", root + "/a/../a", root + "//a",
                                  root + "/link", root + "/missing"}) {
    logcap::Clear();
    EXPECT_FALSE(CanFullPathBeIndexed(path)) << path;
    EXPECT_EQ(logcap::Count("check realpath failed, path=" + path), 1) << path;
  }
  ExpectRecordsFreed();
  EXPECT_EQ(ErrorHandler::GetError(), FILEINDEX_ERR_NONE);
}

TEST_F(RulesTest, SharePathsResolveFirstAndOnlyThatFailureSetsACode) {
  AddShare("photo");
  ASSERT_EQ(::mkdir(Volume("/photo/2019").c_str(), 0755), 0);

  EXPECT_TRUE(CanPathBeIndexed("/photo/2019"));
  EXPECT_TRUE(CanPathBeIndexed("/photo"));

  EXPECT_FALSE(CanPathBeIndexed("/photo/2019/"));
  EXPECT_TRUE(logcap::Contains("check realpath failed, path=" + Volume("/photo/2019/")));
  EXPECT_EQ(ErrorHandler::GetError(), FILEINDEX_ERR_NONE) << "a refusal sets no code of its own";

  Reset();
  EXPECT_FALSE(CanPathBeIndexed("/video/a"));
  EXPECT_TRUE(logcap::Contains("GetFullPath failed, path=/video/a"));
  EXPECT_EQ(ErrorHandler::GetError(), FILEINDEX_ERR_BAD_PATH);
  EXPECT_EQ(Calls("TAVOShareNamePathGet("), 0u);

  logcap::Clear();
  EXPECT_FALSE(CanPathBeIndexed(""));
  EXPECT_TRUE(logcap::Contains("GetFullPath failed, path="));
}

// --- queue and database locations ---

class LocationsTest : public RulesTest {};

// The line number a captured log line carries, or -1.
int LoggedLine(const std::string& text) {
  std::smatch m;
  if (!std::regex_search(text, m, std::regex("^utils:([0-9]+) "))) return -1;
  return std::atoi(m[1].str().c_str());
}

TEST_F(LocationsTest, ArgumentsAreCheckedInOrderThroughThePlatformErrorChannel) {
  AddShare("photo");
  char buffer[64];
  struct Case {
    int (*fn)(const char*, char*, int);
    const char* name;
    char* out;
    int len;
    const char* failed;
  };
  const Case cases[] = {
      {FILEIDXQueuePathGet, nullptr, nullptr, 0, "__null != szName"},
      {FILEIDXQueuePathGet, "photo", nullptr, 0, "__null != szOutQueuePath"},
      {FILEIDXQueuePathGet, "photo", buffer, 0, "cbOutLen > 0"},
      {FILEIDXQueuePathGet, "photo", buffer, -5, "cbOutLen > 0"},
      {FILEIDXDBPathGet, nullptr, buffer, 64, "__null != szName"},
      {FILEIDXDBPathGet, "photo", nullptr, -1, "__null != szOutDBPath"},
      {FILEIDXDBPathGet, "photo", buffer, 0, "cbOutLen > 0"},
  };
  for (const Case& c : cases) {
    Reset();
    fake::Get().errCode = 0;
    LOG_LEVEL = 0;
    EXPECT_EQ(c.fn(c.name, c.out, c.len), -1) << c.failed;
    std::vector<std::string> lines = logcap::Texts();
    ASSERT_EQ(lines.size(), 1u) << c.failed;
    EXPECT_TRUE(std::regex_match(lines[0], std::regex("utils:[0-9]+ Invaild Argument \\(.*\\)=\\[0\\]\n")))
        << lines[0];
    EXPECT_NE(lines[0].find(std::string("(") + c.failed + ")=[0]\n"), std::string::npos) << lines[0];
    EXPECT_EQ(fake::Get().errCode, 0xD00);
    EXPECT_EQ(fake::Get().errFile, "utils");
    EXPECT_EQ(fake::Get().errLine, LoggedLine(lines[0])) << "the error carries the line of the check";
    EXPECT_EQ(Calls("TAVOShareGet("), 0u);
  }
  EXPECT_EQ(ErrorHandler::GetError(), FILEINDEX_ERR_NONE);

  Reset();
  EXPECT_EQ(FILEIDXQueuePathGet("video", buffer, sizeof(buffer)), -1);
  EXPECT_EQ(FILEIDXDBPathGet("video", buffer, sizeof(buffer)), -1);
  EXPECT_EQ(logcap::Count("TAVOShareGet failed, name=video, code=5120"), 2);
  EXPECT_EQ(fake::Get().errCode, 0x1400) << "the platform's error stays as it is";
  EXPECT_EQ(Calls("TAVOEAMKDir("), 0u);
  EXPECT_EQ(ErrorHandler::GetError(), FILEINDEX_ERR_NONE);
}

TEST_F(LocationsTest, PathsOfTheShareAreInItsEaDirAndCutLikeSnprintf) {
  AddShare("photo");
  const std::string eaDir = Volume("/photo/@eaDir");
  const std::string queue = eaDir + "/TAVO@file_index_queue";
  const std::string db = eaDir + "/TAVO@.fileindexdb";

  char buffer[4096];
  std::memset(buffer, 'x', sizeof(buffer));
  EXPECT_EQ(FILEIDXQueuePathGet("photo", buffer, sizeof(buffer)), static_cast<int>(queue.size()));
  EXPECT_EQ(std::string(buffer), queue);
  EXPECT_EQ(fake::CallsStartingWith("TAVOEAMKDir("),
            std::vector<std::string>{"TAVOEAMKDir(0," + eaDir + ")"});
  EXPECT_TRUE(IsDirExist(eaDir));
  EXPECT_FALSE(Exists(queue)) << "the queue file is not made here";
  ExpectRecordsFreed();

  EXPECT_EQ(FILEIDXDBPathGet("photo", buffer, sizeof(buffer)), static_cast<int>(db.size()));
  EXPECT_EQ(std::string(buffer), db);
  EXPECT_TRUE(IsDirExist(db));
  EXPECT_EQ(FILEIDXDBPathGet("photo", buffer, sizeof(buffer)), static_cast<int>(db.size()))
      << "an existing one";
  EXPECT_TRUE(logcap::Texts().empty());
  ExpectRecordsFreed();

  // Cut to the buffer, zero-terminated, the shorter length returned.
  std::memset(buffer, 'x', sizeof(buffer));
  EXPECT_EQ(FILEIDXQueuePathGet("photo", buffer, 10), 9);
  EXPECT_EQ(std::string(buffer), queue.substr(0, 9));
  EXPECT_EQ(buffer[10], 'x');
  EXPECT_EQ(FILEIDXQueuePathGet("photo", buffer, 1), 0);
  EXPECT_EQ(buffer[0], '\0');
  const int cut = static_cast<int>(queue.size());  // one short of the terminator
  EXPECT_EQ(FILEIDXQueuePathGet("photo", buffer, cut), cut - 1);
  EXPECT_EQ(std::string(buffer), queue.substr(0, queue.size() - 1));
  EXPECT_EQ(FILEIDXDBPathGet("photo", buffer, 10), 9);
  EXPECT_TRUE(logcap::Texts().empty());
}

TEST_F(LocationsTest, DirectoriesThatCannotBeMadeAreLoggedAndThePathStillReturned) {
  AddShare("photo");
  const std::string eaDir = Volume("/photo/@eaDir");
  char buffer[4096];

  fake::Get().forced["TAVOEAMKDir"] = -1;
  fake::Get().errCode = 77;
  int length = FILEIDXQueuePathGet("photo", buffer, sizeof(buffer));
  EXPECT_EQ(std::string(buffer), eaDir + "/TAVO@file_index_queue");
  EXPECT_EQ(length, static_cast<int>(std::strlen(buffer)));
  std::vector<std::string> lines = logcap::Texts();
  ASSERT_EQ(lines.size(), 1u);
  EXPECT_TRUE(
      std::regex_match(lines[0], std::regex("utils:[0-9]+ TAVOEAMKDir failed, path=" + eaDir + ", code=77")))
      << lines[0];
  fake::Get().forced.clear();

  // "@eaDir" taken by a regular file: the database directory cannot be made below it.
  WriteFile(eaDir, "not a directory");
  logcap::Clear();
  LOG_LEVEL = 8;
  length = FILEIDXDBPathGet("photo", buffer, sizeof(buffer));
  EXPECT_EQ(std::string(buffer), eaDir + "/TAVO@.fileindexdb");
  EXPECT_EQ(length, static_cast<int>(std::strlen(buffer)));
  EXPECT_EQ(logcap::Count("mkdir failed, path=" + eaDir + "/TAVO@.fileindexdb, reason=Not a directory"), 1);
  EXPECT_EQ(ErrorHandler::GetError(), FILEINDEX_ERR_NONE);
  ExpectRecordsFreed();
}

}  // namespace
