// Adding and changing folders end to end: folder.conf, watch lists, services, commands, events.
#include <fileindex/error.h>
#include <fileindex/index_mgr.h>

#include "support/index_mgr_test.h"

using namespace TAVO::FILEINDEX;
using Values = std::vector<Json::Value>;
using UpsertTest = IndexMgrTest;

namespace {

// The step order: watch lists per share, daemon start, Spotlight, Samba, commands, events. A
// repeated path is announced twice but saved and reported once, with the later report's changes.
TEST_F(UpsertTest, FoldersInTwoSharesRunEveryStepInOrder) {
  AddShare("photo");
  AddShare("video");
  StartDaemon();
  ASSERT_TRUE(IndexMgr::Upsert(Array({Record("/video/v", "V", false, false, true, false),
                                      Record("/photo/p", "P", false, false, false, true),
                                      ParseJson(R"({"path":"/photo/p","video":true})")})));
  EXPECT_EQ(SideEffectCalls(),
            (std::vector<std::string>{"MonitorQueue::Upsert(fileindex)", "MonitorQueue::Upsert(fileindex)",
                                      "VLIBServiceStart(fileindexd,1)", "TAVOSMBIsEnableSpotlight()",
                                      "TAVOSMBSetSpotlight(1)", "VLIBServiceRestart(samba)"}));
  EXPECT_EQ(Commands(), (Values{Command("upsert_folder_setting", "folder_path", "/video/v"),
                                Command("upsert_folder_setting", "folder_path", "/photo/p"),
                                Command("upsert_folder_setting", "folder_path", "/photo/p")}));
  EXPECT_EQ(FolderConf()["/photo/p"], Record("/photo/p", "P", false, false, true, true));
  EXPECT_EQ(QueueEvents("photo"), Values{Event(131072, Full("/photo/p"), Flags(false, false, true, false))});
}

// Validation comes before the save: a bad element loses the whole request, and the lock is freed.
TEST_F(UpsertTest, RefusedRequestsChangeNothing) {
  AddShare("photo");
  EXPECT_FALSE(IndexMgr::Add(Record("/photo/a", "A", false, false, false, true)));
  EXPECT_EQ(ErrorHandler::GetError(), FILEINDEX_ERR_BAD_PARAM);
  EXPECT_TRUE(logcap::Contains(" Bad param: {\"audio\":false"));
  EXPECT_FALSE(IndexMgr::Set(Array({Record("/photo/a", "A", true, true, true, true),
                                    Record("/nosuch/x", "X", true, false, false, false)})));
  EXPECT_TRUE(logcap::Contains(" Upsert failed, folder={"));
  EXPECT_FALSE(Exists(FolderConfPath()));
  EXPECT_TRUE(LockIsFree());
}

// Later failures keep the saved folder and stop the remaining steps; a Spotlight failure is only logged.
TEST_F(UpsertTest, FailuresAfterTheSaveKeepFolderConf) {
  AddShare("photo");
  const Json::Value request = Array({Record("/photo/a", "A", false, false, false, true)});
  StartDaemon();
  fake::Get().forced["TAVOSMBSetSpotlight"] = -1;
  ::mkdir(EaDir("photo").c_str(), 0755);
  ASSERT_EQ(::mkdir(Queue("photo").c_str(), 0755), 0);  // an unwritable queue marks a reindex
  EXPECT_FALSE(IndexMgr::Upsert(request));
  EXPECT_TRUE(logcap::Contains(" TAVOSMBSetSpotlight failed: err=[0x3100 smb.c:40]"));
  EXPECT_TRUE(logcap::Contains(" AddCustomEvent failed"));
  EXPECT_TRUE(ReadJson(StatusConfPath())["need_reindex"].isMember("photo"));
  EXPECT_TRUE(FolderConf().isMember("/photo/a"));
  fake::Get().forced = {{"VLIBServiceStart", -1}};
  EXPECT_FALSE(IndexMgr::Upsert(request));
  EXPECT_TRUE(logcap::Contains(" VLIBServiceStart failed: err=[0x3000 service.c:10]"));
  EXPECT_EQ(Commands().size(), 1u);
}

}  // namespace
