// Adding and changing folders end to end: folder.conf, watch lists, services, daemon
// commands and settings events.
#include <fileindex/error.h>
#include <fileindex/index_mgr.h>

#include "support/index_mgr_test.h"

using namespace TAVO::FILEINDEX;

namespace {

class UpsertTest : public IndexMgrTest {
 protected:
  void SetUp() override {
    IndexMgrTest::SetUp();
    AddShare("photo");
    AddShare("video");
  }
};

TEST_F(UpsertTest, FoldersInTwoSharesRunEveryStepInOrder) {
  StartDaemon();
  ASSERT_TRUE(IndexMgr::Upsert(Array({Record("/video/v", "V", false, false, true, false),
                                      Record("/photo/p", "P", false, false, false, true)})));

  Json::Value conf(Json::objectValue);
  conf["/photo/p"] = Record("/photo/p", "P", false, false, false, true);
  conf["/video/v"] = Record("/video/v", "V", false, false, true, false);
  EXPECT_EQ(FolderConf(), conf);

  // Watch lists in share order, then the daemon, then Spotlight (off here, so Samba restarts).
  EXPECT_EQ(SideEffectCalls(),
            (std::vector<std::string>{"MonitorQueue::Upsert(fileindex)", "MonitorQueue::Upsert(fileindex)",
                                      "VLIBServiceStart(fileindexd,1)", "TAVOSMBIsEnableSpotlight()",
                                      "TAVOSMBSetSpotlight(1)", "VLIBServiceRestart(samba)"}));
  ASSERT_EQ(fake::Get().monitorCalls.size(), 2u);
  EXPECT_EQ(fake::Get().monitorCalls[0].config, Watch("photo", {"/photo/p"}));
  EXPECT_EQ(fake::Get().monitorCalls[1].config, Watch("video", {"/video/v"}));
  for (const fake::MonitorCall& call : fake::Get().monitorCalls) {
    EXPECT_EQ(call.name, "fileindex");
    EXPECT_EQ(call.type, 1);
  }

  // Commands in array order; one event per folder, in its own share's queue.
  EXPECT_EQ(Commands(),
            (std::vector<Json::Value>{Command("upsert_folder_setting", "folder_path", "/video/v"),
                                      Command("upsert_folder_setting", "folder_path", "/photo/p")}));
  const Json::Value allChanged = Flags(true, true, true, true);
  EXPECT_EQ(QueueEvents("photo"), (std::vector<Json::Value>{Event(131072, Full("/photo/p"), allChanged)}));
  EXPECT_EQ(QueueEvents("video"), (std::vector<Json::Value>{Event(131072, Full("/video/v"), allChanged)}));
  EXPECT_TRUE(LockIsFree());
  EXPECT_TRUE(logcap::Texts().empty());
}

TEST_F(UpsertTest, FoldersOfOneShareShareOneWatchList) {
  StartDaemon();
  fake::Get().spotlight = true;
  ASSERT_TRUE(IndexMgr::Upsert(Array({Record("/photo/b", "B", true, false, false, false),
                                      Record("/photo/a", "A", false, true, false, false)})));
  ASSERT_EQ(fake::Get().monitorCalls.size(), 1u);
  EXPECT_EQ(fake::Get().monitorCalls[0].config, Watch("photo", {"/photo/a", "/photo/b"}));
  // Spotlight already on: Samba is left alone.
  EXPECT_EQ(SideEffectCalls(),
            (std::vector<std::string>{"MonitorQueue::Upsert(fileindex)", "VLIBServiceStart(fileindexd,1)",
                                      "TAVOSMBIsEnableSpotlight()"}));
  // Events in path order, commands in array order.
  std::vector<Json::Value> events = QueueEvents("photo");
  ASSERT_EQ(events.size(), 2u);
  EXPECT_EQ(events[0]["path"].asString(), Full("/photo/a"));
  EXPECT_EQ(events[1]["path"].asString(), Full("/photo/b"));
  ASSERT_EQ(Commands().size(), 2u);
  EXPECT_EQ(Commands()[0]["data"]["folder_path"].asString(), "/photo/b");
}

TEST_F(UpsertTest, SamePathTwiceGivesTwoCommandsAndOneEventWithTheLaterReport) {
  StartDaemon();
  Json::Value second(Json::objectValue);
  second["path"] = "/photo/a";
  second["video"] = true;
  ASSERT_TRUE(IndexMgr::Upsert(Array({Record("/photo/a", "A", false, false, false, true), second})));
  EXPECT_EQ(FolderConf()["/photo/a"], Record("/photo/a", "A", false, false, true, true));
  EXPECT_EQ(Commands().size(), 2u);
  // The first report says every flag changed; the later one only video.
  EXPECT_EQ(QueueEvents("photo"),
            (std::vector<Json::Value>{Event(131072, Full("/photo/a"), Flags(false, false, true, false))}));
}

TEST_F(UpsertTest, SetAndAddAreUpsert) {
  StartDaemon();
  ASSERT_TRUE(IndexMgr::Add(Array({Record("/photo/a", "A", false, false, false, true)})));
  Json::Value change(Json::objectValue);
  change["path"] = "/photo/a";
  change["document"] = true;
  ASSERT_TRUE(IndexMgr::Set(Array({change})));
  // An existing folder through Add is an update as well.
  change["document"] = false;
  change["name"] = "renamed";
  ASSERT_TRUE(IndexMgr::Add(Array({change})));
  EXPECT_EQ(FolderConf()["/photo/a"], Record("/photo/a", "renamed", false, false, false, true));
  EXPECT_EQ(Commands().size(), 3u);
  EXPECT_EQ(QueueEvents("photo"),
            (std::vector<Json::Value>{Event(131072, Full("/photo/a"), Flags(true, true, true, true)),
                                      Event(131072, Full("/photo/a"), Flags(true, false, false, false)),
                                      Event(131072, Full("/photo/a"), Flags(true, false, false, false))}));
}

TEST_F(UpsertTest, EmptyArraySavesStartsTheDaemonAndSendsNothing) {
  StartDaemon();
  WriteFolders({Record("/photo/a", "A", false, false, false, true)});
  const Json::Value before = FolderConf();
  ASSERT_TRUE(IndexMgr::Upsert(Json::Value(Json::arrayValue)));
  EXPECT_EQ(FolderConf(), before);
  EXPECT_EQ(SideEffectCalls(),
            (std::vector<std::string>{"VLIBServiceStart(fileindexd,1)", "TAVOSMBIsEnableSpotlight()",
                                      "TAVOSMBSetSpotlight(1)", "VLIBServiceRestart(samba)"}));
  EXPECT_TRUE(Commands().empty());
  EXPECT_FALSE(Exists(Queue("photo")));
}

TEST_F(UpsertTest, NonArrayFailsBeforeTheLock) {
  StartDaemon();
  EXPECT_FALSE(IndexMgr::Upsert(Record("/photo/a", "A", false, false, false, true)));
  EXPECT_EQ(ErrorHandler::GetError(), FILEINDEX_ERR_BAD_PARAM);
  EXPECT_TRUE(logcap::Contains("index_mgr:"));
  EXPECT_TRUE(logcap::Contains(" Bad param: {\"audio\":false"));
  EXPECT_FALSE(Exists(LockPath()));
  EXPECT_FALSE(Exists(FolderConfPath()));
  EXPECT_TRUE(fake::Get().calls.empty());
  EXPECT_TRUE(Commands().empty());
}

TEST_F(UpsertTest, FailingElementLosesTheWholeRequest) {
  StartDaemon();
  WriteFolders({Record("/photo/a", "A", false, false, false, true)});
  const std::string before = ReadFile(FolderConfPath());
  EXPECT_FALSE(IndexMgr::Upsert(Array({Record("/photo/a", "changed", true, true, true, true),
                                       Record("/nosuch/x", "X", true, false, false, false)})));
  EXPECT_EQ(ErrorHandler::GetError(), FILEINDEX_ERR_BAD_PARAM);
  EXPECT_TRUE(logcap::Contains(" Upsert failed, folder={"));
  EXPECT_EQ(ReadFile(FolderConfPath()), before);
  EXPECT_TRUE(SideEffectCalls().empty());
  EXPECT_TRUE(Commands().empty());
  EXPECT_FALSE(Exists(Queue("photo")));
  EXPECT_TRUE(LockIsFree());
}

TEST_F(UpsertTest, FailuresAfterTheSaveKeepFolderConf) {
  const Json::Value request = Array({Record("/photo/a", "A", false, false, false, true)});

  // The daemon does not listen: the watch list and the service are done, no event is queued.
  EXPECT_FALSE(IndexMgr::Upsert(request));
  EXPECT_TRUE(logcap::Contains(" SendCammandToDaemon failed"));
  EXPECT_TRUE(FolderConf().isMember("/photo/a"));
  EXPECT_EQ(fake::CallsStartingWith("VLIBServiceStart").size(), 1u);
  EXPECT_FALSE(Exists(Queue("photo")));
  EXPECT_TRUE(LockIsFree());

  // The service cannot be started: the platform's error goes into the line.
  StartDaemon();
  fake::Get().forced["VLIBServiceStart"] = -1;
  fake::Get().calls.clear();
  logcap::Clear();
  EXPECT_FALSE(IndexMgr::Upsert(request));
  EXPECT_TRUE(logcap::Contains(" VLIBServiceStart failed: err=[0x3000 service.c:10]"));
  EXPECT_TRUE(fake::CallsStartingWith("TAVOSMB").empty());
  EXPECT_TRUE(Commands().empty());

  // The watch list is refused, or its description cannot even be built.
  fake::Reset();
  AddShare("photo");
  fake::Get().monitorUpsertResult = 0;
  logcap::Clear();
  EXPECT_FALSE(IndexMgr::Upsert(request));
  EXPECT_EQ(logcap::Texts().size(), 2u);
  EXPECT_TRUE(logcap::Contains(" MonitorQueue::Add failed"));
  EXPECT_TRUE(logcap::Contains(" UpsertTAVtifydCfg failed, share=photo"));
  EXPECT_TRUE(fake::CallsStartingWith("VLIBServiceStart").empty());
  fake::Get().monitorUpsertResult = 1;
  fake::Get().monitorThrows = true;
  logcap::Clear();
  EXPECT_FALSE(IndexMgr::Upsert(request));
  EXPECT_EQ(logcap::Texts().size(), 1u);
  EXPECT_TRUE(logcap::Contains(" UpsertTAVtifydCfg failed, share=photo"));
  EXPECT_TRUE(Commands().empty());
  EXPECT_TRUE(LockIsFree());
}

TEST_F(UpsertTest, SpotlightFailuresAreOnlyLogged) {
  StartDaemon();
  const Json::Value request = Array({Record("/photo/a", "A", false, false, false, true)});
  fake::Get().forced["TAVOSMBSetSpotlight"] = -1;
  EXPECT_TRUE(IndexMgr::Upsert(request));
  EXPECT_TRUE(logcap::Contains(" TAVOSMBSetSpotlight failed: err=[0x3100 smb.c:40]"));
  EXPECT_TRUE(fake::CallsStartingWith("VLIBServiceRestart").empty());

  fake::Get().forced.clear();
  fake::Get().forced["VLIBServiceRestart"] = -1;
  logcap::Clear();
  EXPECT_TRUE(IndexMgr::Upsert(request));
  EXPECT_TRUE(logcap::Contains(" VLIBServiceRestart failed: err=[0x3002 service.c:30]"));
  EXPECT_EQ(Commands().size(), 2u);
}

TEST_F(UpsertTest, UnwritableEventFailsTheUpsert) {
  StartDaemon();
  // A directory where the queue file belongs cannot be opened for appending.
  ASSERT_EQ(::mkdir(EaDir("photo").c_str(), 0755), 0);
  ASSERT_EQ(::mkdir(Queue("photo").c_str(), 0755), 0);
  EXPECT_FALSE(IndexMgr::Upsert(Array({Record("/photo/a", "A", false, false, false, true)})));
  EXPECT_TRUE(logcap::Contains(" AddCustomEvent failed"));
  EXPECT_EQ(Commands().size(), 1u);
  EXPECT_TRUE(ReadJson(StatusConfPath())["need_reindex"].isMember("photo"));
}

TEST_F(UpsertTest, WatchListsOnTheirOwn) {
  WriteFolders({Record("/photo/a", "A", false, false, false, true),
                Record("/video/v", "V", false, false, true, false)});
  ASSERT_TRUE(IndexMgr::UpsertTAVotifydCfg("video"));
  // A share without folders still sends its (empty) list.
  AddShare("music");
  ASSERT_TRUE(IndexMgr::UpsertTAVotifydCfg("music"));
  ASSERT_TRUE(IndexMgr::DeleteTAVotifydCfg("photo"));
  ASSERT_EQ(fake::Get().monitorCalls.size(), 3u);
  EXPECT_EQ(fake::Get().monitorCalls[0].config, Watch("video", {"/video/v"}));
  EXPECT_EQ(fake::Get().monitorCalls[1].config, Watch("music", {}));
  EXPECT_EQ(fake::Get().monitorCalls[2].op, "delete");
  EXPECT_EQ(fake::Get().monitorCalls[2].queuePath, Queue("photo"));
  EXPECT_EQ(fake::Get().monitorCalls[2].name, "fileindex");
  EXPECT_EQ(fake::Get().monitorCalls[2].type, 1);

  EXPECT_FALSE(IndexMgr::UpsertTAVotifydCfg("nosuch"));
  EXPECT_FALSE(IndexMgr::DeleteTAVotifydCfg("nosuch"));
  EXPECT_EQ(logcap::Count(" FILEIDXQueuePathGet failed, share=nosuch"), 2);
  fake::Get().monitorDeleteResult = 0;
  EXPECT_FALSE(IndexMgr::DeleteTAVotifydCfg("photo"));
  EXPECT_TRUE(logcap::Contains(" MonitorQueue::Delete failed"));
}

}  // namespace
