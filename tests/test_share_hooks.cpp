// Keeping folder.conf, watch lists and the daemon's share workers in step with shares
// that are removed, renamed, paused and resumed.
#include <fileindex/error.h>
#include <fileindex/index_mgr.h>

#include "support/index_mgr_test.h"

using namespace TAVO::FILEINDEX;
using Strings = std::vector<std::string>;

namespace {

class ShareHooksTest : public IndexMgrTest {
 protected:
  void SetUp() override { IndexMgrTest::SetUp(), AddShare("photo"), AddShare("video"); }
};

// Only the share's folders go; indexing stops with the last folder.
TEST_F(ShareHooksTest, RemoveForgetsTheShareAndStopsIndexingWithTheLastFolder) {
  StartDaemon();
  fake::Get().spotlight = true;
  WriteFolders({Record("/photo/a", "A", false, false, false, true),
                Record("/video/v", "V", false, false, true, false)});
  ASSERT_TRUE(IndexMgr::ShareRemove("photo"));
  EXPECT_EQ(FolderConf().getMemberNames(), (Strings{"/video/v"}));
  EXPECT_TRUE(SideEffectCalls().empty());
  ASSERT_TRUE(IndexMgr::ShareRemove("video"));
  EXPECT_EQ(FolderConf(), Json::Value(Json::objectValue));
  EXPECT_EQ(SideEffectCalls(), (Strings{"VLIBServiceStop(fileindexd,1)", "TAVOSMBIsEnableSpotlight()",
                                        "TAVOSMBSetSpotlight(0)", "VLIBServiceRestart(samba)"}));
  EXPECT_TRUE(LockIsFree());
}

// The path rewrite keeps the settings; an unresolvable new name saves nothing.
TEST_F(ShareHooksTest, RenameMovesFoldersAllOrNothing) {
  WriteFolders({Record("/video/a", "A", true, false, true, false),
                Record("/photo/p", "P", false, false, false, true)});
  const std::string before = ReadFile(FolderConfPath());
  EXPECT_FALSE(IndexMgr::ShareRename("video", "unknown"));
  EXPECT_EQ(ErrorHandler::GetError(), FILEINDEX_ERR_BAD_PARAM);
  EXPECT_EQ(ReadFile(FolderConfPath()), before);
  fake::Get().shares.erase("video");  // the platform knows the new name only
  AddShare("movies");
  ASSERT_TRUE(IndexMgr::ShareRename("video", "movies"));
  EXPECT_EQ(FolderConf().getMemberNames(), (Strings{"/movies/a", "/photo/p"}));
  EXPECT_EQ(FolderConf()["/movies/a"], Record("/movies/a", "A", true, false, true, false));
  EXPECT_TRUE(LockIsFree());
}

// Pause tells the daemon before dropping the watch list, resume after restoring it; their failures.
TEST_F(ShareHooksTest, PauseTellsTheDaemonFirstAndResumeLast) {
  WriteFolders({Record("/photo/a", "A", false, false, false, true)});
  EXPECT_FALSE(IndexMgr::SharePause("photo"));  // the daemon is not listening
  EXPECT_TRUE(fake::Get().monitorCalls.empty());
  EXPECT_FALSE(IndexMgr::ShareResume("photo"));
  EXPECT_EQ(fake::Get().monitorCalls.size(), 1u);
  StartDaemon();
  fake::Get().monitorCalls.clear();
  ASSERT_TRUE(IndexMgr::SharePause("photo"));
  ASSERT_TRUE(IndexMgr::ShareResume("photo"));
  EXPECT_EQ(Commands(), (std::vector<Json::Value>{Command("delete_share_worker", "share_name", "photo"),
                                                  Command("revive_share_worker", "share_name", "photo")}));
  ASSERT_EQ(fake::Get().monitorCalls.size(), 2u);
  EXPECT_EQ(fake::Get().monitorCalls[0].op, "delete");
  EXPECT_EQ(fake::Get().monitorCalls[1].config, Watch("photo", {"/photo/a"}));
  fake::Get().monitorUpsertResult = 0;
  EXPECT_FALSE(IndexMgr::ShareResume("photo"));
  EXPECT_TRUE(logcap::Contains(" UpsertTAVotifydCfg failed, share=photo"));
  EXPECT_EQ(Commands().size(), 2u);
}

}  // namespace
