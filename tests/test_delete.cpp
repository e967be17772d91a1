// Removing folders, reindex requests, settings events and a share's index data.
#include <fileindex/error.h>
#include <fileindex/index_mgr.h>
#include <sys/stat.h>

#include "support/index_mgr_test.h"

using namespace TAVO::FILEINDEX;

namespace {

class DeleteTest : public IndexMgrTest {
 protected:
  void SetUp() override {
    IndexMgrTest::SetUp();
    AddShare("photo");
    AddShare("video");
    AddShare("music");
  }

  // Index data as the daemon leaves it: a queue, its ".tmp" companion and a database.
  void MakeIndexData(const std::string& share) {
    ::mkdir(EaDir(share).c_str(), 0755);
    ::mkdir(Db(share).c_str(), 0755);
    WriteFile(Db(share) + "/data", "x");
    WriteFile(Queue(share), "");
    WriteFile(Queue(share) + ".tmp", "");
  }
  bool HasIndexData(const std::string& share) {
    return Exists(Queue(share)) || Exists(Queue(share) + ".tmp") || Exists(Db(share));
  }
  static Json::Value Paths(std::initializer_list<std::string> paths) {
    Json::Value array(Json::arrayValue);
    for (const std::string& path : paths) array.append(path);
    return array;
  }
};

TEST_F(DeleteTest, LastFolderStopsIndexingAndRemovesTheShareData) {
  StartDaemon();
  fake::Get().spotlight = true;
  WriteFolders({Record("/photo/a", "A", false, false, false, true)});
  MakeIndexData("photo");

  ASSERT_TRUE(IndexMgr::Delete(Paths({"/photo/a"})));
  EXPECT_EQ(FolderConf(), Json::Value(Json::objectValue));
  EXPECT_EQ(SideEffectCalls(),
            (std::vector<std::string>{"VLIBServiceStop(fileindexd,1)", "TAVOSMBIsEnableSpotlight()",
                                      "TAVOSMBSetSpotlight(0)", "VLIBServiceRestart(samba)",
                                      "MonitorQueue::Delete(" + Queue("photo") + ")"}));
  EXPECT_EQ(fake::Get().execs,
            (std::vector<std::vector<std::string>>{{"/bin/rm", "-rf", Queue("photo")},
                                                   {"/bin/rm", "-rf", Queue("photo") + ".tmp"},
                                                   {"/bin/rm", "-rf", Db("photo")}}));
  EXPECT_FALSE(HasIndexData("photo"));
  // Nobody is left to tell.
  EXPECT_TRUE(Commands().empty());
  EXPECT_TRUE(LockIsFree());
  EXPECT_TRUE(logcap::Texts().empty());
}

TEST_F(DeleteTest, OneOfTwoFoldersReannouncesTheCoveringSettings) {
  StartDaemon();
  WriteFolders({Record("/photo/a", "A", false, false, false, true),
                Record("/photo/a/b", "B", false, false, true, false)});
  MakeIndexData("photo");

  ASSERT_TRUE(IndexMgr::Delete(Paths({"/photo/a/b"})));
  EXPECT_EQ(FolderConf().getMemberNames(), (std::vector<std::string>{"/photo/a"}));
  EXPECT_EQ(Commands(),
            (std::vector<Json::Value>{Command("delete_folder_setting", "folder_path", "/photo/a/b")}));
  // /photo/a now governs the deleted path: video and photo changed there.
  EXPECT_EQ(QueueEvents("photo"),
            (std::vector<Json::Value>{Event(131072, Full("/photo/a/b"), Flags(false, false, true, true))}));
  EXPECT_EQ(SideEffectCalls(), (std::vector<std::string>{"MonitorQueue::Upsert(fileindex)"}));
  ASSERT_EQ(fake::Get().monitorCalls.size(), 1u);
  EXPECT_EQ(fake::Get().monitorCalls[0].config, Watch("photo", {"/photo/a"}));
  EXPECT_TRUE(fake::Get().execs.empty());
  EXPECT_TRUE(Exists(Db("photo")));
}

TEST_F(DeleteTest, OnlyTheLastReportIsAnnouncedAndEachShareIsSettled) {
  StartDaemon();
  WriteFolders(
      {Record("/photo/a", "A", false, false, false, true), Record("/photo/b", "B", true, false, false, false),
       Record("/photo/c", "C", false, false, false, true), Record("/video/v", "V", false, false, true, false),
       Record("/music/m", "M", false, true, false, false)});
  MakeIndexData("video");
  MakeIndexData("music");

  ASSERT_TRUE(IndexMgr::Delete(Paths({"/photo/c", "/video/v", "/photo/a"})));
  EXPECT_EQ(FolderConf().getMemberNames(), (std::vector<std::string>{"/music/m", "/photo/b"}));
  EXPECT_EQ(Commands(),
            (std::vector<Json::Value>{Command("delete_folder_setting", "folder_path", "/photo/c"),
                                      Command("delete_folder_setting", "folder_path", "/video/v"),
                                      Command("delete_folder_setting", "folder_path", "/photo/a")}));
  EXPECT_EQ(QueueEvents("photo"),
            (std::vector<Json::Value>{Event(131072, Full("/photo/a"), Flags(true, true, true, true))}));
  // photo keeps a folder and gets its list rebuilt; video is emptied and loses everything.
  EXPECT_EQ(SideEffectCalls(), (std::vector<std::string>{"MonitorQueue::Upsert(fileindex)",
                                                         "MonitorQueue::Delete(" + Queue("video") + ")"}));
  EXPECT_EQ(fake::Get().monitorCalls[0].config, Watch("photo", {"/photo/b"}));
  EXPECT_FALSE(HasIndexData("video"));
  EXPECT_TRUE(Exists(Queue("music")));
}

TEST_F(DeleteTest, RefusedRequestsChangeNothing) {
  StartDaemon();
  WriteFolders({Record("/photo/a", "A", false, false, false, true),
                Record("/video/v", "V", false, false, true, false)});
  const std::string before = ReadFile(FolderConfPath());

  EXPECT_FALSE(IndexMgr::Delete(Json::Value("/photo/a")));
  EXPECT_EQ(ErrorHandler::GetError(), FILEINDEX_ERR_BAD_PARAM);
  EXPECT_TRUE(logcap::Contains(" Bad param: \"/photo/a\""));
  EXPECT_FALSE(Exists(LockPath()));

  // A path without a share name, after a good one: nothing is saved or cleaned.
  ErrorHandler::SetError(FILEINDEX_ERR_NONE);
  EXPECT_FALSE(IndexMgr::Delete(Paths({"/video/v", ""})));
  EXPECT_TRUE(logcap::Contains("index_mgr:"));
  EXPECT_TRUE(logcap::Contains(" GetShareNameByPath failed, path="));
  EXPECT_EQ(ErrorHandler::GetError(), FILEINDEX_ERR_NONE);

  // An element with no string form.
  Json::Value request = Paths({"/video/v"});
  request.append(Json::Value(Json::objectValue));
  EXPECT_FALSE(IndexMgr::Delete(request));
  EXPECT_EQ(ErrorHandler::GetError(), FILEINDEX_ERR_BAD_PARAM);
  EXPECT_TRUE(logcap::Contains(" Bad param: {}"));

  EXPECT_EQ(ReadFile(FolderConfPath()), before);
  EXPECT_TRUE(Commands().empty());
  EXPECT_TRUE(fake::Get().monitorCalls.empty());
  EXPECT_TRUE(fake::Get().execs.empty());
  EXPECT_TRUE(LockIsFree());
}

TEST_F(DeleteTest, EmptyArraySavesAndStopsOnlyAnEmptyConfiguration) {
  StartDaemon();
  WriteFolders({Record("/photo/a", "A", false, false, false, true)});
  const Json::Value before = FolderConf();
  ASSERT_TRUE(IndexMgr::Delete(Json::Value(Json::arrayValue)));
  EXPECT_EQ(FolderConf(), before);
  EXPECT_TRUE(SideEffectCalls().empty());

  // An unknown path is no error; with nothing configured the daemon is stopped.
  WriteFolders({});
  ASSERT_TRUE(IndexMgr::Delete(Paths({"/music/none"})));
  ASSERT_TRUE(IndexMgr::Delete(Json::Value(Json::arrayValue)));
  EXPECT_EQ(fake::CallsStartingWith("VLIBServiceStop(fileindexd,1)").size(), 2u);
  EXPECT_TRUE(Commands().empty());
}

TEST_F(DeleteTest, FailuresAfterTheSaveEndTheOperation) {
  WriteFolders({Record("/photo/a", "A", false, false, false, true),
                Record("/photo/b", "B", false, false, false, true),
                Record("/video/v", "V", false, false, true, false)});
  // The daemon is not listening.
  EXPECT_FALSE(IndexMgr::Delete(Paths({"/photo/a"})));
  EXPECT_TRUE(logcap::Contains(" SendCammandToDaemon failed"));
  EXPECT_FALSE(FolderConf().isMember("/photo/a"));
  EXPECT_TRUE(fake::Get().monitorCalls.empty());
  EXPECT_TRUE(LockIsFree());

  StartDaemon();
  fake::Get().monitorDeleteResult = 0;
  logcap::Clear();
  EXPECT_FALSE(IndexMgr::Delete(Paths({"/video/v"})));
  EXPECT_TRUE(logcap::Contains(" DeleteTAVtifydCfg failed, share=video"));

  fake::Get().monitorUpsertResult = 0;
  logcap::Clear();
  EXPECT_FALSE(IndexMgr::Delete(Paths({"/photo/x"})));
  EXPECT_TRUE(logcap::Contains(" UpsertTAVotifydCfg failed, share=photo"));

  // The settings event cannot be written: a directory stands where the queue belongs.
  ::unlink(Queue("photo").c_str());
  ASSERT_EQ(::mkdir(Queue("photo").c_str(), 0755), 0);
  logcap::Clear();
  EXPECT_FALSE(IndexMgr::Delete(Paths({"/photo/y"})));
  EXPECT_TRUE(logcap::Contains(" AddCustomEvent failed"));
  EXPECT_TRUE(logcap::Contains(" Update failed"));
}

TEST_F(DeleteTest, ReindexChecksEveryPathBeforeWritingAny) {
  WriteFolders({Record("/photo/a", "A", false, false, false, true)});

  // A share without folders ends it silently, even after a good path.
  EXPECT_FALSE(IndexMgr::Reindex(Paths({"/photo/a", "/video/v"})));
  EXPECT_TRUE(logcap::Texts().empty());
  EXPECT_EQ(ErrorHandler::GetError(), FILEINDEX_ERR_NONE);
  EXPECT_FALSE(Exists(Queue("photo")));

  EXPECT_FALSE(IndexMgr::Reindex(Json::Value(Json::objectValue)));
  EXPECT_TRUE(logcap::Contains(" Malformed jsArrPath: {}"));
  EXPECT_EQ(ErrorHandler::GetError(), FILEINDEX_ERR_BAD_PARAM);
  Json::Value request = Paths({"/photo/a"});
  request.append(7);
  EXPECT_FALSE(IndexMgr::Reindex(request));
  EXPECT_TRUE(logcap::Contains(" Malformed jsArrPath: 7"));
  EXPECT_FALSE(IndexMgr::Reindex(Paths({""})));
  EXPECT_TRUE(logcap::Contains(" Failed to get share name from path: "));
  EXPECT_FALSE(Exists(Queue("photo")));

  EXPECT_TRUE(IndexMgr::Reindex(Json::Value(Json::arrayValue)));
  ASSERT_TRUE(IndexMgr::Reindex(Paths({"/photo/a", "/photo/a/sub"})));
  EXPECT_EQ(QueueEvents("photo"),
            (std::vector<Json::Value>{Event(65536, Full("/photo/a"), Json::Value()),
                                      Event(65536, Full("/photo/a/sub"), Json::Value())}));
  // A pending reindex absorbs a repeated request.
  ASSERT_TRUE(IndexMgr::Reindex(Paths({"/photo/a"})));
  EXPECT_EQ(QueueEvents("photo").size(), 2u);
}

TEST_F(DeleteTest, ReindexRevivesSharesOutOfSpaceFirst) {
  WriteFolders({Record("/photo/a", "A", false, false, false, true),
                Record("/video/v", "V", false, false, true, false)});
  WriteFile(StatusConfPath(), "{\"no_space\":{\"photo\":true,\"video\":true,\"music\":true}}");
  StartDaemon();
  ASSERT_TRUE(IndexMgr::Reindex(Paths({"/video/v", "/photo/a", "/video/v/x"})));
  EXPECT_EQ(ReadJson(StatusConfPath())["no_space"].getMemberNames(), (std::vector<std::string>{"music"}));
  EXPECT_EQ(Commands(), (std::vector<Json::Value>{Command("revive_share_worker", "share_name", "photo"),
                                                  Command("revive_share_worker", "share_name", "video")}));
  EXPECT_EQ(QueueEvents("video").size(), 2u);
  EXPECT_EQ(QueueEvents("photo").size(), 1u);

  // A revival the daemon does not hear of is logged; the events are written all the same.
  daemon_.Stop();
  WriteFile(StatusConfPath(), "{\"no_space\":{\"photo\":true}}");
  ::unlink(Queue("photo").c_str());
  ASSERT_TRUE(IndexMgr::Reindex(Paths({"/photo/a"})));
  EXPECT_TRUE(logcap::Contains(" ShareRevice failed, share=photo"));
  EXPECT_EQ(QueueEvents("photo").size(), 1u);
}

TEST_F(DeleteTest, UpdateAndCleanShareIndexData) {
  ASSERT_TRUE(IndexMgr::Update("/photo/a", Flags(true, false, false, false)));
  EXPECT_EQ(QueueEvents("photo"),
            (std::vector<Json::Value>{Event(131072, Full("/photo/a"), Flags(true, false, false, false))}));
  EXPECT_FALSE(IndexMgr::Update("/nosuch/a", Json::Value()));
  EXPECT_TRUE(logcap::Contains(" GetFullPath failed, path=/nosuch/a"));
  EXPECT_EQ(ErrorHandler::GetError(), FILEINDEX_ERR_BAD_PATH);

  MakeIndexData("video");
  ASSERT_TRUE(IndexMgr::CleanShareIndexData("video"));
  EXPECT_FALSE(HasIndexData("video"));
  EXPECT_TRUE(Exists(EaDir("video")));
  // Nothing there to remove is no failure either.
  ASSERT_TRUE(IndexMgr::CleanShareIndexData("video"));
  EXPECT_FALSE(IndexMgr::CleanShareIndexData("nosuch"));
  EXPECT_TRUE(logcap::Contains(" FILEIDXQueuePathGet failed, share=nosuch"));
  EXPECT_EQ(fake::Get().execs.size(), 6u);
}

}  // namespace
