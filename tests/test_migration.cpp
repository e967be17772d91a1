// The one-time migration: services, Spotlight, watch lists and reindex events brought
// into line with an existing folder.conf.
#include <fileindex/utils.h>
#include <sys/stat.h>

#include <cerrno>
#include <string>
#include <vector>

#include "support/sysroot_test.h"

using namespace TAVO::FILEINDEX;

namespace {

class MigrationTest : public SysrootTest {
 protected:
  void WriteFolders(const std::vector<std::string>& paths) {
    Json::Value conf(Json::objectValue);
    for (const std::string& path : paths) {
      conf[path]["name"] = path;
      ::mkdir(Rooted("/volume1" + path).c_str(), 0755);
    }
    WriteFile(FolderConfPath(), conf.toStyledString());
  }
  std::string Queue(const std::string& share) const {
    return Rooted("/volume1/" + share + "/@eaDir/TAVO@file_index_queue");
  }
  // The platform calls that change the services, in order.
  static std::vector<std::string> ServiceCalls() {
    std::vector<std::string> out;
    for (const std::string& call : fake::Get().calls) {
      if (call.rfind("VLIBService", 0) == 0 || call.rfind("TAVOSMBSetSpotlight", 0) == 0) out.push_back(call);
    }
    return out;
  }
  using Strings = std::vector<std::string>;
};

}  // namespace

TEST_F(MigrationTest, WithoutFoldersOnlyStopsTheDaemon) {
  for (const char* conf : {"", "{}"}) {
    fake::Reset();
    if (*conf != '\0') WriteFile(FolderConfPath(), conf);
    EXPECT_TRUE(Updater_vem60_beta2()) << conf;
    EXPECT_EQ(ServiceCalls(), Strings{"VLIBServiceStop(fileindexd,1)"});
    EXPECT_TRUE(fake::Get().monitorCalls.empty());
    EXPECT_TRUE(logcap::Texts().empty());
  }

  // The stop failure names the start call.
  fake::Get().forced["VLIBServiceStop"] = -1;
  EXPECT_FALSE(Updater_vem60_beta2());
  ASSERT_EQ(logcap::Texts().size(), 1u);
  EXPECT_NE(logcap::Texts()[0].find("VLIBServiceStart failed: err=[0x3001 service.c:20]"), std::string::npos);
  EXPECT_EQ(logcap::Texts()[0].compare(0, 6, "utils:"), 0);

  // A configuration that cannot be read does nothing at all.
  fake::Reset();
  WriteFile(FolderConfPath(), "[]");
  EXPECT_FALSE(Updater_vem60_beta2());
  EXPECT_TRUE(ServiceCalls().empty());
}

TEST_F(MigrationTest, RebuildsEachShareOnceAndReindexesEveryFolderInOrder) {
  AddShare("photo");
  AddShare("music");
  WriteFolders({"/photo/b", "/photo/a", "/music/x"});
  ASSERT_TRUE(Updater_vem60_beta2());

  // Samba is not restarted here.
  EXPECT_EQ(ServiceCalls(), (Strings{"VLIBServiceStart(fileindexd,1)", "TAVOSMBSetSpotlight(1)"}));
  ASSERT_EQ(fake::Get().monitorCalls.size(), 2u);
  EXPECT_EQ(fake::Get().monitorCalls[0].op, "upsert");
  EXPECT_EQ(fake::Get().monitorCalls[0].config["queue"].asString(), Queue("music"));
  EXPECT_EQ(fake::Get().monitorCalls[1].config["queue"].asString(), Queue("photo"));
  EXPECT_EQ(fake::Get().monitorCalls[1].config["config"].size(), 2u);

  // One reindex event per folder, in folder.conf's ascending path order.
  const Strings photo = ReadLines(Queue("photo"));
  ASSERT_EQ(photo.size(), 2u);
  EXPECT_EQ(ParseJson(photo[0])["event"], Json::Value(65536));
  EXPECT_EQ(ParseJson(photo[0])["path"].asString(), Rooted("/volume1/photo/a"));
  EXPECT_EQ(ParseJson(photo[1])["path"].asString(), Rooted("/volume1/photo/b"));
  const Strings music = ReadLines(Queue("music"));
  ASSERT_EQ(music.size(), 1u);
  EXPECT_EQ(ParseJson(music[0])["path"].asString(), Rooted("/volume1/music/x"));
}

TEST_F(MigrationTest, StopsAtTheFirstFailingStep) {
  AddShare("photo");
  WriteFolders({"/photo/a"});

  fake::Get().forced["VLIBServiceStart"] = -1;
  EXPECT_FALSE(Updater_vem60_beta2());
  EXPECT_EQ(ServiceCalls(), Strings{"VLIBServiceStart(fileindexd,1)"});
  EXPECT_TRUE(logcap::Contains("VLIBServiceStart failed: err=[0x3000 service.c:10]"));

  fake::Reset();
  AddShare("photo");
  logcap::Clear();
  fake::Get().forced["TAVOSMBSetSpotlight"] = -1;
  EXPECT_FALSE(Updater_vem60_beta2());
  EXPECT_TRUE(logcap::Contains("TAVOSMBSetSpotlight failed: err=[0x3100 smb.c:40]"));
  EXPECT_TRUE(fake::Get().monitorCalls.empty());

  // A folder without a share name.
  fake::Reset();
  AddShare("photo");
  logcap::Clear();
  WriteFile(FolderConfPath(), R"({"":{"name":"x"},"/photo/a":{"name":"a"}})");
  EXPECT_FALSE(Updater_vem60_beta2());
  // Loading folder.conf logs the same message once; the migration's is the last line.
  EXPECT_EQ(logcap::Count("GetShareNameByPath failed, path="), 2);
  ASSERT_FALSE(logcap::Texts().empty());
  const std::string last = logcap::Texts().back();
  EXPECT_EQ(last.compare(0, 6, "utils:"), 0);
  EXPECT_EQ(last.substr(last.find(' ')), " GetShareNameByPath failed, path=");
  EXPECT_TRUE(fake::Get().monitorCalls.empty());

  // The watch list is refused: no event is queued.
  WriteFolders({"/photo/a"});
  fake::Reset();
  AddShare("photo");
  logcap::Clear();
  fake::Get().monitorUpsertResult = 0;
  EXPECT_FALSE(Updater_vem60_beta2());
  EXPECT_TRUE(logcap::Contains("UpsertTAVotifydCfg failed, share=photo"));
  EXPECT_FALSE(Exists(Queue("photo")));

  // The queue cannot be written: the reindex fails after the watch lists were rebuilt.
  fake::Reset();
  AddShare("photo");
  logcap::Clear();
  ASSERT_TRUE(::mkdir(Rooted("/volume1/photo/@eaDir").c_str(), 0755) == 0 || errno == EEXIST);
  ASSERT_EQ(::mkdir(Queue("photo").c_str(), 0755), 0);
  EXPECT_FALSE(Updater_vem60_beta2());
  EXPECT_EQ(fake::Get().monitorCalls.size(), 1u);
  EXPECT_TRUE(logcap::Contains("Reindex failed"));
}
