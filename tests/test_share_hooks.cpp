// folder.conf, watch lists and the daemon's share workers kept in step with whole shares.
#include <fileindex/index_mgr.h>

#include "support/index_mgr_test.h"

using namespace TAVO::FILEINDEX;
using ShareHooksTest = IndexMgrTest;

namespace {

// Rename moves folders with their settings, all or nothing; removing the last folders stops indexing.
TEST_F(ShareHooksTest, FoldersFollowTheirShareThroughRenameAndRemove) {
  WriteFile(FolderConfPath(), R"({"/photo/a": {}, "/video/v": {"name": "V", "video": true}})");
  const std::string before = ReadFile(FolderConfPath());
  EXPECT_FALSE(IndexMgr::ShareRename("video", "unknown"));
  EXPECT_EQ(ReadFile(FolderConfPath()), before);
  AddShare("movies");
  ASSERT_TRUE(IndexMgr::ShareRename("video", "movies"));
  ASSERT_TRUE(IndexMgr::ShareRemove("photo"));
  EXPECT_EQ(FolderConf().getMemberNames(), std::vector<std::string>{"/movies/v"});
  EXPECT_EQ(FolderConf()["/movies/v"], Record("/movies/v", "V", false, false, true, false));
  EXPECT_TRUE(fake::CallsStartingWith("VLIBServiceStop").empty());
  ASSERT_TRUE(IndexMgr::ShareRemove("movies"));
  EXPECT_EQ(fake::CallsStartingWith("VLIBServiceStop").size(), 1u);
}

// Pause tells the daemon before dropping the watch list; resume restores it before reviving the worker.
TEST_F(ShareHooksTest, PauseTellsTheDaemonFirstAndResumeLast) {
  AddShare("photo");
  WriteFolders({Record("/photo/a", "A", false, false, false, true)});
  EXPECT_FALSE(IndexMgr::SharePause("photo"));  // the daemon is not listening
  EXPECT_TRUE(fake::Get().monitorCalls.empty());
  StartDaemon();
  ASSERT_TRUE(IndexMgr::SharePause("photo"));
  ASSERT_TRUE(IndexMgr::ShareResume("photo"));
  EXPECT_EQ(fake::Get().monitorCalls.at(0).op, "delete");
  EXPECT_EQ(fake::Get().monitorCalls.at(1).config, Watch("photo", {"/photo/a"}));
  fake::Get().monitorUpsertResult = 0;
  EXPECT_FALSE(IndexMgr::ShareResume("photo"));
  EXPECT_TRUE(logcap::Contains(" UpsertTAVotifydCfg failed, share=photo"));
  EXPECT_EQ(Commands(), (std::vector<Json::Value>{Command("delete_share_worker", "share_name", "photo"),
                                                  Command("revive_share_worker", "share_name", "photo")}));
}

}  // namespace
