// The one-time migration: services, Spotlight, watch lists and reindex events brought
// into line with an existing folder.conf.
#include <fileindex/utils.h>
#include <gmock/gmock.h>
#include <sys/stat.h>

#include <string>
#include <vector>

#include "support/sysroot_test.h"

using namespace TAVO::FILEINDEX;
using Strings = std::vector<std::string>;

namespace {
class MigrationTest : public SysrootTest {
 protected:
  void WriteFolders(const Strings& paths) {
    Json::Value conf(Json::objectValue);
    for (const std::string& path : paths) conf[path]["name"] = path, ::mkdir(Full(path).c_str(), 0755);
    WriteFile(FolderConfPath(), conf.toStyledString());
  }
  static Strings ServiceCalls() {  // the platform calls that change the services, in order
    Strings out;
    for (const std::string& call : fake::Get().calls)
      if (call.rfind("VLIBService", 0) == 0 || call.rfind("TAVOSMBSetSpotlight", 0) == 0) out.push_back(call);
    return out;
  }
};
}  // namespace

// No folders: only the daemon is stopped; a failed stop is reported under the start call's name.
TEST_F(MigrationTest, WithoutFoldersOnlyStopsTheDaemon) {
  WriteFile(FolderConfPath(), "{}");
  EXPECT_TRUE(Updater_vem60_beta2());
  EXPECT_EQ(ServiceCalls(), Strings{"VLIBServiceStop(fileindexd,1)"});
  EXPECT_TRUE(fake::Get().monitorCalls.empty());
  fake::Get().forced["VLIBServiceStop"] = -1;
  EXPECT_FALSE(Updater_vem60_beta2());
  EXPECT_THAT(logcap::Texts(), testing::ElementsAre(testing::MatchesRegex(
                                   R"(utils:[0-9]+ VLIBServiceStart failed: err=\[0x3001 service\.c:20\])")));
}

// Start, Spotlight (no Samba restart), one watch list per share, then reindex events in path order.
TEST_F(MigrationTest, RebuildsEachShareOnceAndReindexesEveryFolderInOrder) {
  AddShare("photo");
  AddShare("music");
  WriteFolders({"/photo/b", "/photo/a", "/music/x"});
  ASSERT_TRUE(Updater_vem60_beta2());
  EXPECT_EQ(ServiceCalls(), (Strings{"VLIBServiceStart(fileindexd,1)", "TAVOSMBSetSpotlight(1)"}));
  ASSERT_EQ(fake::Get().monitorCalls.size(), 2u);
  EXPECT_EQ(fake::Get().monitorCalls[0].config["queue"].asString(), Queue("music"));
  EXPECT_EQ(fake::Get().monitorCalls[1].config["config"].size(), 2u);
  Strings photo;
  for (const std::string& line : ReadLines(Queue("photo")))
    photo.push_back(ParseJson(line)["event"].asString() + " " + ParseJson(line)["path"].asString());
  EXPECT_EQ(photo, (Strings{"65536 " + Full("/photo/a"), "65536 " + Full("/photo/b")}));
}

// Each failing step is logged and stops everything after it.
TEST_F(MigrationTest, StopsAtTheFirstFailingStep) {
  AddShare("photo");
  WriteFolders({"/photo/a"});
  fake::Get().forced["TAVOSMBSetSpotlight"] = -1;
  EXPECT_FALSE(Updater_vem60_beta2());
  EXPECT_TRUE(logcap::Contains("TAVOSMBSetSpotlight failed: err=[0x3100 smb.c:40]"));
  EXPECT_TRUE(fake::Get().monitorCalls.empty());
  fake::Reset();
  AddShare("photo");
  fake::Get().monitorUpsertResult = 0;
  EXPECT_FALSE(Updater_vem60_beta2());
  EXPECT_TRUE(logcap::Contains("UpsertTAVotifydCfg failed, share=photo"));
  EXPECT_FALSE(Exists(Queue("photo")));
  fake::Reset();
  AddShare("photo");
  ::mkdir(EaDir("photo").c_str(), 0755);
  ASSERT_EQ(::mkdir(Queue("photo").c_str(), 0755), 0);  // the queue cannot be written
  EXPECT_FALSE(Updater_vem60_beta2());
  EXPECT_EQ(fake::Get().monitorCalls.size(), 1u);
  EXPECT_TRUE(logcap::Contains("Reindex failed"));
}
