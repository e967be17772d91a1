// status.conf, the status manager's pause and flag operations, and the space check.
#include <fileindex/error.h>
#include <fileindex/status.h>
#include <fileindex/status_mgr.h>
#include <fileindex/utils.h>
#include <unistd.h>

#include "support/fake_daemon.h"
#include "support/sysroot_test.h"

using namespace TAVO::FILEINDEX;

namespace {

class StatusTest : public SysrootTest {
 protected:
  void SetUp() override {
    SysrootTest::SetUp();
    fake::SetClock(1700000000);
  }
  Json::Value Saved() { return ReadJson(StatusConfPath()); }
};

const char kNotifyTag[] =
    "<a data-tavo-app=\"TAVO.KOR.AdminCenter.Application\" "
    "data-tavo-fn=\"TAVO.KOR.AdminCenter.MediaIndex.Main\" "
    "data-tavo-tab=\"fileIndex\">";

TEST_F(StatusTest, PauseStoresResumeTimeAndTellsDaemon) {
  FakeDaemon daemon;
  ASSERT_TRUE(daemon.Start(SocketPath()));

  EXPECT_FALSE(StatusMgr::Pause(-1));
  EXPECT_EQ(ErrorHandler::GetError(), FILEINDEX_ERR_BAD_PARAM);
  EXPECT_FALSE(Exists(StatusConfPath()));
  EXPECT_TRUE(daemon.Commands().empty());

  ASSERT_TRUE(StatusMgr::Pause(0));
  EXPECT_EQ(Saved()["resume_time"], Json::Value(0));
  ASSERT_TRUE(StatusMgr::Pause(2));
  EXPECT_EQ(Saved()["resume_time"].asInt64(), 1700007200);
  // 2000000000 + 360000000 passes 2^31 and wraps in 32 bits.
  fake::SetClock(2000000000);
  ASSERT_TRUE(StatusMgr::Pause(100000));
  EXPECT_EQ(Saved()["resume_time"].asInt64(), -1934967296LL);
  long long resume = 0;
  ASSERT_TRUE(StatusMgr::GetPauseInfo(resume));
  EXPECT_EQ(resume, -1934967296LL);

  std::vector<Json::Value> sent = daemon.Commands();
  ASSERT_EQ(sent.size(), 3u);
  EXPECT_EQ(sent[0], ParseJson(R"({"type":"pause","data":{"resume_time":0}})"));
  EXPECT_EQ(sent[1], ParseJson(R"({"type":"pause","data":{"resume_time":1700007200}})"));
  EXPECT_EQ(sent[2]["data"]["resume_time"].asInt64(), -1934967296LL);

  // Resuming when not paused still writes -1 and tells the daemon.
  daemon.Clear();
  ASSERT_TRUE(StatusMgr::Resume());
  ASSERT_TRUE(StatusMgr::Resume());
  EXPECT_EQ(Saved()["resume_time"], Json::Value(-1));
  sent = daemon.Commands();
  ASSERT_EQ(sent.size(), 2u);
  EXPECT_EQ(sent[1], ParseJson(R"({"type":"resume","data":{}})"));
}

TEST_F(StatusTest, DaemonDownKeepsTheSaveAndReleasesTheLock) {
  WriteFile(StatusConfPath(), R"({"no_space":{"photo":true,"video":true}})");
  EXPECT_FALSE(StatusMgr::Pause(1));
  EXPECT_EQ(Saved()["resume_time"].asInt64(), 1700003600);
  EXPECT_FALSE(StatusMgr::Resume());
  EXPECT_EQ(Saved()["resume_time"], Json::Value(-1));
  EXPECT_FALSE(StatusMgr::ShareRevive("photo"));
  EXPECT_EQ(Saved()["no_space"], ParseJson(R"({"video":true})"));
  EXPECT_EQ(logcap::Texts(), (std::vector<std::string>{"status_mgr:198 SendCammandToDaemon failed",
                                                       "status_mgr:221 SendCammandToDaemon failed",
                                                       "status_mgr:321 SendCammandToDaemon failed"}));
  // Every failed call unlocked: a writer can still take the lock.
  EXPECT_TRUE(StatusMgr::SetUpdated("k"));

  FakeDaemon daemon;
  ASSERT_TRUE(daemon.Start(SocketPath()));
  ASSERT_TRUE(StatusMgr::ShareRevive("video"));
  ASSERT_EQ(daemon.Commands().size(), 1u);
  EXPECT_EQ(daemon.Commands()[0],
            ParseJson(R"({"type":"revive_share_worker","data":{"share_name":"video"}})"));
}

TEST_F(StatusTest, PauseInfoReadsAnyNumberAndRejectsOtherTypes) {
  long long resume = 42;
  ASSERT_TRUE(StatusMgr::GetPauseInfo(resume));
  EXPECT_EQ(resume, -1);

  WriteFile(StatusConfPath(), R"({"resume_time":5.0})");
  ASSERT_TRUE(StatusMgr::GetPauseInfo(resume));
  EXPECT_EQ(resume, 5);

  resume = 42;
  WriteFile(StatusConfPath(), R"({"resume_time":"5"})");
  EXPECT_FALSE(StatusMgr::GetPauseInfo(resume));
  EXPECT_EQ(resume, 42);
  ASSERT_EQ(logcap::Lines().size(), 1u);
  EXPECT_EQ(logcap::Lines()[0].priority, 3);
  EXPECT_EQ(logcap::Lines()[0].text.find("status:"), 0u);
  EXPECT_NE(logcap::Lines()[0].text.find(" json exception"), std::string::npos);

  // A document of another shape loads unchecked and reads as not paused.
  WriteFile(StatusConfPath(), "[1,2]");
  ASSERT_TRUE(StatusMgr::GetPauseInfo(resume));
  EXPECT_EQ(resume, -1);
  EXPECT_FALSE(StatusMgr::ShareIsNoSpace("photo"));
  EXPECT_FALSE(StatusMgr::IsUpdated("k"));

  WriteFile(StatusConfPath(), "{");
  EXPECT_FALSE(StatusMgr::GetPauseInfo(resume));
  EXPECT_EQ(ErrorHandler::GetError(), FILEINDEX_ERR_LOAD_CONFIG);

  // An updated mark may overwrite the pause time; true then reads as 1.
  ::unlink(StatusConfPath().c_str());
  ASSERT_TRUE(StatusMgr::SetUpdated("resume_time"));
  ASSERT_TRUE(StatusMgr::GetPauseInfo(resume));
  EXPECT_EQ(resume, 1);
}

TEST_F(StatusTest, NoSpaceNotifiesOnFirstMarkingOnly) {
  ASSERT_TRUE(StatusMgr::ShareSetNoSpace("photo", true));
  ASSERT_TRUE(StatusMgr::ShareSetNoSpace("photo", true));
  EXPECT_TRUE(StatusMgr::ShareIsNoSpace("photo"));
  EXPECT_FALSE(StatusMgr::ShareIsNoSpace("video"));
  ASSERT_EQ(fake::Get().execs.size(), 1u);
  EXPECT_EQ(
      fake::Get().execs[0],
      (std::vector<std::string>{
          "/usr/tavo/bin/tavovemnotify", "-e", "false", "-c", "TAVO.KOR.AdminCenter.Application",
          "@administrators", "fileindex:fileindex_title", "fileindex:notify_no_space", kNotifyTag, "</a>"}));
  EXPECT_EQ(fake::CallsStartingWith("VLIBCExecv"),
            std::vector<std::string>{"VLIBCExecv(/usr/tavo/bin/tavovemnotify,1)"});

  ASSERT_TRUE(StatusMgr::ShareSetNoSpace("photo", false));
  EXPECT_FALSE(StatusMgr::ShareIsNoSpace("photo"));
  EXPECT_EQ(fake::Get().execs.size(), 1u);

  // A failing notifier is logged; the flag is set all the same.
  fake::Get().execvResult = 1;
  ASSERT_TRUE(StatusMgr::ShareSetNoSpace("video", true));
  EXPECT_TRUE(StatusMgr::ShareIsNoSpace("video"));
  EXPECT_EQ(logcap::Count("NotifyNoSpace failed"), 1);
  EXPECT_EQ(logcap::Texts()[0].find("status:"), 0u);
}

TEST_F(StatusTest, ShareFlagsCountMembershipAndKeepMistypedMembers) {
  ASSERT_TRUE(StatusMgr::ShareSetNeedReindex("photo", false));
  Json::Value saved = Saved();
  ASSERT_TRUE(saved.isMember("need_reindex"));
  EXPECT_TRUE(saved["need_reindex"].isNull());

  ASSERT_TRUE(StatusMgr::ShareSetNeedReindex("photo", true));
  EXPECT_EQ(Saved()["need_reindex"], ParseJson(R"({"photo":true})"));

  WriteFile(StatusConfPath(), R"({"need_reindex":{"photo":false},"k":"yes","n":1})");
  EXPECT_TRUE(StatusMgr::ShareIsNeedReindex("photo"));
  EXPECT_FALSE(StatusMgr::ShareIsNeedReindex("video"));
  EXPECT_FALSE(StatusMgr::IsUpdated("k"));
  EXPECT_TRUE(StatusMgr::IsUpdated("n"));
  EXPECT_FALSE(StatusMgr::IsUpdated("absent"));
  EXPECT_FALSE(StatusMgr::IsUpdated("need_reindex"));

  // A flag member of the wrong type is not replaced: the JSON error reaches the caller,
  // the file stays as it was and the lock is released.
  WriteFile(StatusConfPath(), R"({"no_space":"photo"})");
  EXPECT_THROW(StatusMgr::ShareSetNoSpace("photo", true), Json::LogicError);
  EXPECT_THROW(StatusMgr::ShareRevive("photo"), Json::LogicError);
  EXPECT_EQ(Saved(), ParseJson(R"({"no_space":"photo"})"));
  EXPECT_TRUE(fake::Get().execs.empty());
  EXPECT_TRUE(StatusMgr::SetUpdated("k"));
}

TEST_F(StatusTest, SpaceIsShortOnlyForTheTwoQuotaErrors) {
  const std::string dir = AddShare("photo").dir;
  EXPECT_TRUE(IsShareSpaceEnough("photo"));
  EXPECT_EQ(fake::CallsStartingWith("TAVOQuotaIsEnough"),
            std::vector<std::string>{"TAVOQuotaIsEnough(0," + dir + ",10485760)"});

  fake::Get().quotaResult = 0;
  for (int code : {0x2900, 0x2400}) {
    fake::Get().quotaError = code;
    EXPECT_FALSE(IsShareSpaceEnough("photo")) << code;
  }
  fake::Get().quotaError = 0x1234;
  EXPECT_TRUE(IsShareSpaceEnough("photo"));
  EXPECT_EQ(fake::CallsStartingWith("TAVOShareFree").size(), 4u);
  EXPECT_TRUE(logcap::Texts().empty());

  EXPECT_FALSE(IsShareSpaceEnough("nope"));
  EXPECT_TRUE(logcap::Contains("TAVOShareGet failed, share=nope"));
}

}  // namespace
