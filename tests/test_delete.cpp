// Removing folders, reindex requests, settings events and a share's index data.
#include <fileindex/error.h>
#include <fileindex/index_mgr.h>
#include <sys/stat.h>

#include "support/index_mgr_test.h"

using namespace TAVO::FILEINDEX;
using Values = std::vector<Json::Value>;

namespace {

class DeleteTest : public IndexMgrTest {
 protected:
  void SetUp() override { IndexMgrTest::SetUp(), AddShare("photo"), AddShare("video"); }
};

// The stop/Spotlight/Samba/watch-list order and the removal of every index file but @eaDir; cleaning
// an unknown share fails.
TEST_F(DeleteTest, LastFolderStopsIndexingAndRemovesTheShareData) {
  StartDaemon();
  fake::Get().spotlight = true;
  WriteFolders({Record("/photo/a", "A", false, false, false, true)});
  // Index data as the daemon leaves it: a queue, its ".tmp" companion and a database.
  ::mkdir(EaDir("photo").c_str(), 0755), ::mkdir(Db("photo").c_str(), 0755);
  WriteFile(Queue("photo"), ""), WriteFile(Queue("photo") + ".tmp", "");
  ASSERT_TRUE(IndexMgr::Delete(Array({"/photo/a"})));
  EXPECT_EQ(FolderConf(), Json::Value(Json::objectValue));
  EXPECT_EQ(SideEffectCalls(),
            (std::vector<std::string>{"VLIBServiceStop(fileindexd,1)", "TAVOSMBIsEnableSpotlight()",
                                      "TAVOSMBSetSpotlight(0)", "VLIBServiceRestart(samba)",
                                      "MonitorQueue::Delete(" + Queue("photo") + ")"}));
  EXPECT_FALSE(Exists(Queue("photo")) || Exists(Queue("photo") + ".tmp") || Exists(Db("photo")));
  EXPECT_TRUE(Exists(EaDir("photo")));
  EXPECT_TRUE(Commands().empty());
  EXPECT_FALSE(IndexMgr::CleanShareIndexData("nosuch"));
  EXPECT_TRUE(logcap::Contains(" FILEIDXQueuePathGet failed, share=nosuch"));
}

// The covering folder's settings event and the rebuilt watch list of a kept share.
TEST_F(DeleteTest, OneOfTwoFoldersReannouncesTheCoveringSettings) {
  StartDaemon();
  WriteFolders({Record("/photo/a", "A", false, false, false, true),
                Record("/photo/a/b", "B", false, false, true, false)});
  ASSERT_TRUE(IndexMgr::Delete(Array({"/photo/a/b"})));
  EXPECT_EQ(FolderConf().getMemberNames(), (std::vector<std::string>{"/photo/a"}));
  EXPECT_EQ(Commands(), (Values{Command("delete_folder_setting", "folder_path", "/photo/a/b")}));
  EXPECT_EQ(QueueEvents("photo"),
            (Values{Event(131072, Full("/photo/a/b"), Flags(false, false, true, true))}));
  ASSERT_EQ(fake::Get().monitorCalls.size(), 1u);
  EXPECT_EQ(fake::Get().monitorCalls[0].config, Watch("photo", {"/photo/a"}));
}

// Validation before anything is saved; a daemon that is not listening fails the request only after
// the save, still releasing folder.conf's lock.
TEST_F(DeleteTest, RefusedRequestsAndDaemonFailure) {
  WriteFolders({Record("/photo/a", "A", false, false, false, true),
                Record("/photo/b", "B", false, false, false, true)});
  const std::string before = ReadFile(FolderConfPath());
  EXPECT_FALSE(IndexMgr::Delete(Json::Value("/photo/a")));
  EXPECT_EQ(ErrorHandler::GetError(), FILEINDEX_ERR_BAD_PARAM);
  EXPECT_TRUE(logcap::Contains(" Bad param: \"/photo/a\""));
  EXPECT_FALSE(IndexMgr::Delete(Array({"/photo/a", ""})));
  EXPECT_TRUE(logcap::Contains(" GetShareNameByPath failed, path="));
  EXPECT_EQ(ReadFile(FolderConfPath()), before);
  EXPECT_FALSE(IndexMgr::Delete(Array({"/photo/a"})));
  EXPECT_TRUE(logcap::Contains(" SendCammandToDaemon failed"));
  EXPECT_FALSE(FolderConf().isMember("/photo/a"));
  EXPECT_TRUE(fake::Get().monitorCalls.empty());
  EXPECT_TRUE(LockIsFree());
}

// All-or-nothing validation, event order and de-duplication of pending reindexes.
TEST_F(DeleteTest, ReindexChecksEveryPathBeforeWritingAny) {
  WriteFolders({Record("/photo/a", "A", false, false, false, true)});
  EXPECT_FALSE(IndexMgr::Reindex(Array({"/photo/a", "/video/v"})));
  Json::Value request = Array({"/photo/a"});
  request.append(7);
  EXPECT_FALSE(IndexMgr::Reindex(request));
  EXPECT_TRUE(logcap::Contains(" Malformed jsArrPath: 7"));
  EXPECT_FALSE(Exists(Queue("photo")));
  ASSERT_TRUE(IndexMgr::Reindex(Array({"/photo/a", "/photo/a/sub", "/photo/a"})));
  EXPECT_EQ(QueueEvents("photo"), (Values{Event(65536, Full("/photo/a"), Json::Value()),
                                          Event(65536, Full("/photo/a/sub"), Json::Value())}));
}

// Out-of-space shares are revived once each, in share order, before reindexing.
TEST_F(DeleteTest, ReindexRevivesSharesOutOfSpaceFirst) {
  WriteFolders({Record("/photo/a", "A", false, false, false, true),
                Record("/video/v", "V", false, false, true, false)});
  WriteFile(StatusConfPath(), "{\"no_space\":{\"photo\":true,\"video\":true,\"music\":true}}");
  StartDaemon();
  ASSERT_TRUE(IndexMgr::Reindex(Array({"/video/v", "/photo/a", "/video/v/x"})));
  EXPECT_EQ(ReadJson(StatusConfPath())["no_space"].getMemberNames(), (std::vector<std::string>{"music"}));
  EXPECT_EQ(Commands(), (Values{Command("revive_share_worker", "share_name", "photo"),
                                Command("revive_share_worker", "share_name", "video")}));
  EXPECT_EQ(QueueEvents("video").size(), 2u);
}

}  // namespace
