// The one-time migration: services, Spotlight, watch lists and reindex events from folder.conf.
#include <fileindex/utils.h>
#include <sys/stat.h>

#include "support/index_mgr_test.h"

using namespace TAVO::FILEINDEX;
using Strings = std::vector<std::string>;
using MigrationTest = IndexMgrTest;

namespace {

// No folders: only the daemon is stopped; a failed stop is reported under the start call's name.
TEST_F(MigrationTest, WithoutFoldersOnlyStopsTheDaemon) {
  EXPECT_TRUE(Updater_vem60_beta2());
  EXPECT_EQ(SideEffectCalls(), Strings{"VLIBServiceStop(fileindexd,1)"});
  fake::Get().forced["VLIBServiceStop"] = -1;
  EXPECT_FALSE(Updater_vem60_beta2());
  EXPECT_TRUE(logcap::Contains(" VLIBServiceStart failed: err=[0x3001 service.c:20]"));
}

// Start, Spotlight (no Samba restart), one watch list per share, then reindex events in path order.
TEST_F(MigrationTest, RebuildsEachShareOnceAndReindexesEveryFolderInOrder) {
  AddShare("photo");
  AddShare("music");
  WriteFile(FolderConfPath(), R"({"/photo/b": {}, "/photo/a": {}, "/music/x": {}})");
  ASSERT_TRUE(Updater_vem60_beta2());
  EXPECT_EQ(SideEffectCalls(),
            (Strings{"VLIBServiceStart(fileindexd,1)", "TAVOSMBSetSpotlight(1)",
                     "MonitorQueue::Upsert(fileindex)", "MonitorQueue::Upsert(fileindex)"}));
  EXPECT_EQ(QueueEvents("photo"), (std::vector<Json::Value>{Event(65536, Full("/photo/a"), Json::Value()),
                                                            Event(65536, Full("/photo/b"), Json::Value())}));
}

// Each failing step is logged and stops everything after it.
TEST_F(MigrationTest, StopsAtTheFirstFailingStep) {
  AddShare("photo");
  WriteFile(FolderConfPath(), R"({"/photo/a": {}})");
  fake::Get().forced["TAVOSMBSetSpotlight"] = -1;
  EXPECT_FALSE(Updater_vem60_beta2());
  EXPECT_TRUE(logcap::Contains(" TAVOSMBSetSpotlight failed: err=[0x3100 smb.c:40]"));
  EXPECT_TRUE(fake::Get().monitorCalls.empty());
  fake::Get().forced.clear();
  ::mkdir(EaDir("photo").c_str(), 0755);
  ASSERT_EQ(::mkdir(Queue("photo").c_str(), 0755), 0);  // the queue cannot be written
  EXPECT_FALSE(Updater_vem60_beta2());
  EXPECT_TRUE(logcap::Contains(" Reindex failed"));
}

}  // namespace
