// Removing folders, reindex requests, settings events and a share's index data.
#include <fileindex/index_mgr.h>
#include <sys/stat.h>

#include "support/index_mgr_test.h"

using namespace TAVO::FILEINDEX;
using Values = std::vector<Json::Value>;
using DeleteTest = IndexMgrTest;

namespace {

// The covering folder's settings are re-announced; the last folder stops indexing, keeping @eaDir.
TEST_F(DeleteTest, FoldersGoAndTheLastStopsIndexingAndRemovesTheShareData) {
  AddShare("photo");
  StartDaemon();
  fake::Get().spotlight = true;
  WriteFolders({Record("/photo/a", "A", false, false, false, true),
                Record("/photo/a/b", "B", false, false, true, false)});
  ASSERT_TRUE(IndexMgr::Delete(Array({"/photo/a/b"})));
  EXPECT_EQ(QueueEvents("photo"),
            (Values{Event(131072, Full("/photo/a/b"), Flags(false, false, true, true))}));
  ::mkdir(Db("photo").c_str(), 0755);
  WriteFile(Queue("photo") + ".tmp", "");  // left by the daemon while rewriting the queue
  fake::Get().calls.clear();
  ASSERT_TRUE(IndexMgr::Delete(Array({"/photo/a"})));
  EXPECT_EQ(Commands(), (Values{Command("delete_folder_setting", "folder_path", "/photo/a/b")}));
  EXPECT_EQ(SideEffectCalls(),
            (std::vector<std::string>{"VLIBServiceStop(fileindexd,1)", "TAVOSMBIsEnableSpotlight()",
                                      "TAVOSMBSetSpotlight(0)", "VLIBServiceRestart(samba)",
                                      "MonitorQueue::Delete(" + Queue("photo") + ")"}));
  EXPECT_FALSE(Exists(Queue("photo")) || Exists(Queue("photo") + ".tmp") || Exists(Db("photo")));
  EXPECT_TRUE(Exists(EaDir("photo")));
}

// A bad element saves nothing or writes no event; a failing daemon keeps the save and frees the lock.
TEST_F(DeleteTest, RefusedRequestsAndDaemonFailure) {
  AddShare("photo");
  WriteFolders({Record("/photo/a", "A", false, false, false, true),
                Record("/photo/b", "B", false, false, false, true)});
  EXPECT_FALSE(IndexMgr::Delete(Array({"/photo/a", ""})));
  EXPECT_TRUE(logcap::Contains(" GetShareNameByPath failed, path="));
  EXPECT_TRUE(FolderConf().isMember("/photo/a"));
  EXPECT_FALSE(IndexMgr::Reindex(ParseJson(R"(["/photo/a", 7])")));
  EXPECT_TRUE(logcap::Contains(" Malformed jsArrPath: 7"));
  EXPECT_FALSE(Exists(Queue("photo")));
  EXPECT_FALSE(IndexMgr::Delete(Array({"/photo/a"})));
  EXPECT_TRUE(logcap::Contains(" SendCammandToDaemon failed"));
  EXPECT_FALSE(FolderConf().isMember("/photo/a"));
  EXPECT_TRUE(LockIsFree());
}

// A reindex revives a share out of space once, leaving other shares marked; a repeated path gets one event.
TEST_F(DeleteTest, ReindexRevivesAShareOutOfSpaceOnce) {
  AddShare("photo");
  WriteFolders({Record("/photo/a", "A", false, false, false, true)});
  WriteFile(StatusConfPath(), R"({"no_space":{"photo":true,"music":true}})");
  StartDaemon();
  ASSERT_TRUE(IndexMgr::Reindex(Array({"/photo/a", "/photo/a/sub", "/photo/a"})));
  EXPECT_EQ(ReadJson(StatusConfPath())["no_space"].getMemberNames(), (std::vector<std::string>{"music"}));
  EXPECT_EQ(Commands(), (Values{Command("revive_share_worker", "share_name", "photo")}));
  EXPECT_EQ(QueueEvents("photo").size(), 2u);
}

}  // namespace
