// Adding and changing folders end to end: folder.conf, watch lists, services, daemon
// commands and settings events.
#include <fileindex/error.h>
#include <fileindex/index_mgr.h>

#include "support/index_mgr_test.h"

using namespace TAVO::FILEINDEX;
using Strings = std::vector<std::string>;
using Values = std::vector<Json::Value>;

namespace {

class UpsertTest : public IndexMgrTest {
 protected:
  void SetUp() override { IndexMgrTest::SetUp(), AddShare("photo"), AddShare("video"); }
};

// The step order: watch lists per share, daemon start, Spotlight, Samba, commands, events.
TEST_F(UpsertTest, FoldersInTwoSharesRunEveryStepInOrder) {
  StartDaemon();
  ASSERT_TRUE(IndexMgr::Upsert(Array({Record("/video/v", "V", false, false, true, false),
                                      Record("/photo/p", "P", false, false, false, true)})));
  EXPECT_EQ(SideEffectCalls(), (Strings{"MonitorQueue::Upsert(fileindex)", "MonitorQueue::Upsert(fileindex)",
                                        "VLIBServiceStart(fileindexd,1)", "TAVOSMBIsEnableSpotlight()",
                                        "TAVOSMBSetSpotlight(1)", "VLIBServiceRestart(samba)"}));
  ASSERT_EQ(fake::Get().monitorCalls.size(), 2u);
  EXPECT_EQ(fake::Get().monitorCalls[0].config, Watch("photo", {"/photo/p"}));
  EXPECT_EQ(fake::Get().monitorCalls[1].config, Watch("video", {"/video/v"}));
  EXPECT_EQ(Commands(), (Values{Command("upsert_folder_setting", "folder_path", "/video/v"),
                                Command("upsert_folder_setting", "folder_path", "/photo/p")}));
  EXPECT_EQ(QueueEvents("video"), Values{Event(131072, Full("/video/v"), Flags(true, true, true, true))});
  EXPECT_TRUE(logcap::Texts().empty());
}

// One watch list per share, Samba left alone when Spotlight is already on, and a repeated path
// merged into one event carrying the later report's changes.
TEST_F(UpsertTest, FoldersOfOneShareShareOneWatchListAndRepeatsMerge) {
  StartDaemon();
  fake::Get().spotlight = true;
  Json::Value again = ParseJson(R"({"path":"/photo/a","video":true})");
  ASSERT_TRUE(IndexMgr::Set(Array({Record("/photo/b", "B", true, false, false, false),
                                   Record("/photo/a", "A", false, false, false, true), again})));
  ASSERT_EQ(fake::Get().monitorCalls.size(), 1u);
  EXPECT_EQ(fake::Get().monitorCalls[0].config, Watch("photo", {"/photo/a", "/photo/b"}));
  EXPECT_TRUE(fake::CallsStartingWith("VLIBServiceRestart").empty());
  EXPECT_EQ(FolderConf()["/photo/a"], Record("/photo/a", "A", false, false, true, true));
  EXPECT_EQ(Commands().size(), 3u);
  EXPECT_EQ(QueueEvents("photo"), (Values{Event(131072, Full("/photo/a"), Flags(false, false, true, false)),
                                          Event(131072, Full("/photo/b"), Flags(true, true, true, true))}));
}

// Validation comes before the lock and the save: a bad element loses the whole request; a watch
// list for an unknown share fails.
TEST_F(UpsertTest, RefusedRequestsChangeNothing) {
  StartDaemon();
  EXPECT_FALSE(IndexMgr::Add(Record("/photo/a", "A", false, false, false, true)));
  EXPECT_EQ(ErrorHandler::GetError(), FILEINDEX_ERR_BAD_PARAM);
  EXPECT_TRUE(logcap::Contains(" Bad param: {\"audio\":false"));
  EXPECT_FALSE(Exists(LockPath()));
  WriteFolders({Record("/photo/a", "A", false, false, false, true)});
  const std::string before = ReadFile(FolderConfPath());
  EXPECT_FALSE(IndexMgr::Upsert(Array({Record("/photo/a", "changed", true, true, true, true),
                                       Record("/nosuch/x", "X", true, false, false, false)})));
  EXPECT_TRUE(logcap::Contains(" Upsert failed, folder={"));
  EXPECT_EQ(ReadFile(FolderConfPath()), before);
  EXPECT_TRUE(Commands().empty());
  EXPECT_TRUE(LockIsFree());
  EXPECT_FALSE(IndexMgr::UpsertTAVotifydCfg("nosuch"));
  EXPECT_TRUE(logcap::Contains(" FILEIDXQueuePathGet failed, share=nosuch"));
}

// Later failures keep the saved folder, stop the remaining steps and free the lock.
TEST_F(UpsertTest, FailuresAfterTheSaveKeepFolderConf) {
  const Json::Value request = Array({Record("/photo/a", "A", false, false, false, true)});
  EXPECT_FALSE(IndexMgr::Upsert(request));  // the daemon is not listening
  EXPECT_TRUE(logcap::Contains(" SendCammandToDaemon failed"));
  EXPECT_TRUE(FolderConf().isMember("/photo/a"));
  EXPECT_TRUE(LockIsFree());
  StartDaemon();
  fake::Get().forced["VLIBServiceStart"] = -1;
  EXPECT_FALSE(IndexMgr::Upsert(request));
  EXPECT_TRUE(logcap::Contains(" VLIBServiceStart failed: err=[0x3000 service.c:10]"));
  EXPECT_TRUE(Commands().empty());
  fake::Get().forced = {{"TAVOSMBSetSpotlight", -1}};  // only logged
  fake::Get().spotlight = false;
  fake::Get().calls.clear();
  EXPECT_TRUE(IndexMgr::Upsert(request));
  EXPECT_TRUE(logcap::Contains(" TAVOSMBSetSpotlight failed: err=[0x3100 smb.c:40]"));
  EXPECT_TRUE(fake::CallsStartingWith("VLIBServiceRestart").empty());
  // An unwritable queue fails the call (Spotlight still failing) and marks a reindex.
  ::unlink(Queue("photo").c_str());
  ASSERT_EQ(::mkdir(Queue("photo").c_str(), 0755), 0);
  EXPECT_FALSE(IndexMgr::Upsert(request));
  EXPECT_TRUE(logcap::Contains(" AddCustomEvent failed"));
  EXPECT_TRUE(ReadJson(StatusConfPath())["need_reindex"].isMember("photo"));
}

}  // namespace
