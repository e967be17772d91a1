// Keeping folder.conf, watch lists and the daemon's share workers in step with shares
// that are removed, renamed, paused and resumed.
#include <fileindex/error.h>
#include <fileindex/index_mgr.h>
#include <sys/stat.h>

#include "support/index_mgr_test.h"

using namespace TAVO::FILEINDEX;

namespace {

class ShareHooksTest : public IndexMgrTest {
 protected:
  void SetUp() override {
    IndexMgrTest::SetUp();
    AddShare("photo");
    AddShare("video");
  }
};

TEST_F(ShareHooksTest, RemoveForgetsTheShareAndStopsIndexingWithTheLastFolder) {
  StartDaemon();
  fake::Get().spotlight = true;
  WriteFolders({Record("/photo/a", "A", false, false, false, true),
                Record("/photo/a/b", "B", true, false, false, false),
                Record("/video/v", "V", false, false, true, false)});
  ::mkdir(EaDir("photo").c_str(), 0755);
  WriteFile(Queue("photo"), "");

  ASSERT_TRUE(IndexMgr::ShareRemove("photo"));
  EXPECT_EQ(FolderConf().getMemberNames(), (std::vector<std::string>{"/video/v"}));
  EXPECT_EQ(FolderConf()["/video/v"], Record("/video/v", "V", false, false, true, false));
  // Folders remain: nothing else happens, and the share's files are left alone.
  EXPECT_TRUE(SideEffectCalls().empty());
  EXPECT_TRUE(Exists(Queue("photo")));
  EXPECT_TRUE(fake::Get().execs.empty());

  ASSERT_TRUE(IndexMgr::ShareRemove("video"));
  EXPECT_EQ(FolderConf(), Json::Value(Json::objectValue));
  EXPECT_EQ(SideEffectCalls(),
            (std::vector<std::string>{"VLIBServiceStop(fileindexd,1)", "TAVOSMBIsEnableSpotlight()",
                                      "TAVOSMBSetSpotlight(0)", "VLIBServiceRestart(samba)"}));
  EXPECT_TRUE(Commands().empty());
  EXPECT_TRUE(fake::Get().monitorCalls.empty());
  EXPECT_TRUE(LockIsFree());
  EXPECT_TRUE(logcap::Texts().empty());
}

TEST_F(ShareHooksTest, RemoveOfAShareWithoutFolders) {
  WriteFolders({Record("/video/v", "V", false, false, true, false)});
  const Json::Value before = FolderConf();
  ASSERT_TRUE(IndexMgr::ShareRemove("photo"));
  EXPECT_EQ(FolderConf(), before);
  EXPECT_TRUE(SideEffectCalls().empty());

  // Nothing configured at all: saved as an empty object and the daemon stopped; Spotlight
  // already off stays untouched.
  ::unlink(FolderConfPath().c_str());
  ASSERT_TRUE(IndexMgr::ShareRemove("photo"));
  EXPECT_EQ(FolderConf(), Json::Value(Json::objectValue));
  EXPECT_EQ(SideEffectCalls(),
            (std::vector<std::string>{"VLIBServiceStop(fileindexd,1)", "TAVOSMBIsEnableSpotlight()"}));

  fake::Get().forced["VLIBServiceStop"] = -1;
  fake::Get().spotlight = true;
  fake::Get().forced["TAVOSMBSetSpotlight"] = -1;
  EXPECT_TRUE(IndexMgr::ShareRemove("photo"));
  EXPECT_TRUE(logcap::Contains(" VLIBServiceStop failed: err=[0x3001 service.c:20]"));
  EXPECT_TRUE(logcap::Contains(" TAVOSMBSetSpotlight failed: err=[0x3100 smb.c:40]"));
  EXPECT_TRUE(fake::CallsStartingWith("VLIBServiceRestart").empty());
}

TEST_F(ShareHooksTest, RenameMovesFoldersWithTheirSettings) {
  StartDaemon();
  WriteFolders({Record("/video/a", "A", true, false, true, false),
                Record("/video/a/b", "B", false, true, false, true),
                Record("/photo/p", "P", false, false, false, true)});
  // The platform already knows the share by its new name only.
  fake::Get().shares.erase("video");
  AddShare("movies");

  ASSERT_TRUE(IndexMgr::ShareRename("video", "movies"));
  Json::Value conf(Json::objectValue);
  conf["/movies/a"] = Record("/movies/a", "A", true, false, true, false);
  conf["/movies/a/b"] = Record("/movies/a/b", "B", false, true, false, true);
  conf["/photo/p"] = Record("/photo/p", "P", false, false, false, true);
  EXPECT_EQ(FolderConf(), conf);
  EXPECT_TRUE(SideEffectCalls().empty());
  EXPECT_TRUE(Commands().empty());
  // The rename itself writes nothing; a folder of the vanished share may be logged by the lookup.
  EXPECT_FALSE(logcap::Contains("index_mgr:"));
  EXPECT_TRUE(LockIsFree());

  // A share with no folders: saved unchanged.
  ASSERT_TRUE(IndexMgr::ShareRename("nosuch", "other"));
  EXPECT_EQ(FolderConf(), conf);
}

TEST_F(ShareHooksTest, RenameIsAllOrNothing) {
  WriteFolders(
      {Record("/video/a", "A", true, false, true, false), Record("/video/b", "B", false, true, false, true)});
  const std::string before = ReadFile(FolderConfPath());
  // A new name the platform cannot resolve fails at the first folder; nothing is saved.
  EXPECT_FALSE(IndexMgr::ShareRename("video", "unknown"));
  EXPECT_EQ(ErrorHandler::GetError(), FILEINDEX_ERR_BAD_PARAM);
  EXPECT_EQ(ReadFile(FolderConfPath()), before);
  EXPECT_TRUE(LockIsFree());
}

TEST_F(ShareHooksTest, PauseThenResumeRestoresTheWatchList) {
  StartDaemon();
  WriteFolders({Record("/photo/a", "A", false, false, false, true),
                Record("/video/v", "V", false, false, true, false)});
  const std::string before = ReadFile(FolderConfPath());

  ASSERT_TRUE(IndexMgr::SharePause("photo"));
  ASSERT_TRUE(IndexMgr::ShareResume("photo"));
  EXPECT_EQ(ReadFile(FolderConfPath()), before);
  EXPECT_EQ(Commands(), (std::vector<Json::Value>{Command("delete_share_worker", "share_name", "photo"),
                                                  Command("revive_share_worker", "share_name", "photo")}));
  ASSERT_EQ(fake::Get().monitorCalls.size(), 2u);
  EXPECT_EQ(fake::Get().monitorCalls[0].op, "delete");
  EXPECT_EQ(fake::Get().monitorCalls[0].queuePath, Queue("photo"));
  EXPECT_EQ(fake::Get().monitorCalls[1].op, "upsert");
  EXPECT_EQ(fake::Get().monitorCalls[1].config, Watch("photo", {"/photo/a"}));
  EXPECT_TRUE(logcap::Texts().empty());
  EXPECT_FALSE(Exists(LockPath()));
}

TEST_F(ShareHooksTest, PauseTellsTheDaemonFirstAndResumeLast) {
  WriteFolders({Record("/photo/a", "A", false, false, false, true)});
  // The daemon does not listen: pausing stops before the watch list, without a line of its own.
  EXPECT_FALSE(IndexMgr::SharePause("photo"));
  EXPECT_TRUE(fake::Get().monitorCalls.empty());
  EXPECT_TRUE(logcap::Texts().empty());
  // Resuming restores the watch list, then fails to tell the daemon.
  EXPECT_FALSE(IndexMgr::ShareResume("photo"));
  EXPECT_EQ(fake::Get().monitorCalls.size(), 1u);
  EXPECT_TRUE(logcap::Texts().empty());

  StartDaemon();
  fake::Get().monitorUpsertResult = 0;
  EXPECT_FALSE(IndexMgr::ShareResume("photo"));
  EXPECT_TRUE(logcap::Contains(" UpsertTAVotifydCfg failed, share=photo"));
  EXPECT_TRUE(Commands().empty());

  fake::Get().monitorDeleteResult = 0;
  EXPECT_FALSE(IndexMgr::SharePause("photo"));
  EXPECT_TRUE(logcap::Contains(" DeleteTAVotifydCfg failed, share=photo"));
  EXPECT_EQ(Commands().size(), 1u);
}

}  // namespace
