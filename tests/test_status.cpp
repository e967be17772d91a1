// status.conf, the status manager's pause and flag operations, and the space check.
#include <fileindex/error.h>
#include <fileindex/status.h>
#include <fileindex/status_mgr.h>
#include <fileindex/utils.h>

#include "support/fake_daemon.h"
#include "support/sysroot_test.h"

using namespace TAVO::FILEINDEX;
using Strings = std::vector<std::string>;

namespace {

class StatusTest : public SysrootTest {
 protected:
  void SetUp() override { SysrootTest::SetUp(), fake::SetClock(1700000000); }
  Json::Value Saved() { return ReadJson(StatusConfPath()); }
};

// Hours to time (with the 32-bit wrap), bad input, the commands, saves that survive an absent daemon
// (exact log lines, lock freed); the pause time reads any number, unset as -1, and refuses other types.
TEST_F(StatusTest, PauseStoresResumeTimeAndTellsDaemon) {
  long long resume = 42;
  ASSERT_TRUE(StatusMgr::GetPauseInfo(resume));
  EXPECT_EQ(resume, -1);
  WriteFile(StatusConfPath(), R"({"no_space":{"photo":true,"video":true}})");
  EXPECT_FALSE(StatusMgr::Pause(1));
  EXPECT_EQ(Saved()["resume_time"].asInt64(), 1700003600);
  EXPECT_FALSE(StatusMgr::Resume());
  EXPECT_FALSE(StatusMgr::ShareRevive("photo"));
  EXPECT_EQ(Saved()["no_space"], ParseJson(R"({"video":true})"));
  EXPECT_EQ(logcap::Texts(),
            (Strings{"status_mgr:198 SendCammandToDaemon failed", "status_mgr:221 SendCammandToDaemon failed",
                     "status_mgr:321 SendCammandToDaemon failed"}));
  EXPECT_TRUE(StatusMgr::SetUpdated("k"));  // every failed call unlocked
  FakeDaemon daemon;
  ASSERT_TRUE(daemon.Start(SocketPath()));
  EXPECT_FALSE(StatusMgr::Pause(-1));
  EXPECT_EQ(ErrorHandler::GetError(), FILEINDEX_ERR_BAD_PARAM);
  ASSERT_TRUE(StatusMgr::Pause(2));
  fake::SetClock(2000000000);  // 2000000000 + 360000000 wraps in 32 bits
  ASSERT_TRUE(StatusMgr::Pause(100000));
  EXPECT_EQ(Saved()["resume_time"].asInt64(), -1934967296LL);
  ASSERT_TRUE(StatusMgr::Resume());
  EXPECT_EQ(Saved()["resume_time"], Json::Value(-1));
  const std::vector<Json::Value> sent = daemon.Commands();
  ASSERT_EQ(sent.size(), 3u);
  EXPECT_EQ(sent[0], ParseJson(R"({"type":"pause","data":{"resume_time":1700007200}})"));
  EXPECT_EQ(sent[2], ParseJson(R"({"type":"resume","data":{}})"));
  WriteFile(StatusConfPath(), R"({"resume_time":5.0})");
  ASSERT_TRUE(StatusMgr::GetPauseInfo(resume));
  EXPECT_EQ(resume, 5);
  WriteFile(StatusConfPath(), R"({"resume_time":"5"})");
  EXPECT_FALSE(StatusMgr::GetPauseInfo(resume));
  EXPECT_EQ(resume, 5);
  EXPECT_TRUE(logcap::Contains(" json exception"));
}

// The notifier's exact command, sent on first marking only; its failure is only logged. Only the
// quota errors 0x2900 and 0x2400 mean "short"; an unknown share fails.
TEST_F(StatusTest, NoSpaceNotifiesOnceAndOnlyTwoQuotaErrorsMeanShort) {
  ASSERT_TRUE(StatusMgr::ShareSetNoSpace("photo", true));
  ASSERT_TRUE(StatusMgr::ShareSetNoSpace("photo", true));
  EXPECT_TRUE(StatusMgr::ShareIsNoSpace("photo"));
  const Strings notify{"/usr/tavo/bin/tavovemnotify",
                       "-e",
                       "false",
                       "-c",
                       "TAVO.KOR.AdminCenter.Application",
                       "@administrators",
                       "fileindex:fileindex_title",
                       "fileindex:notify_no_space",
                       "<a data-tavo-app=\"TAVO.KOR.AdminCenter.Application\" "
                       "data-tavo-fn=\"TAVO.KOR.AdminCenter.MediaIndex.Main\" data-tavo-tab=\"fileIndex\">",
                       "</a>"};
  EXPECT_EQ(fake::Get().execs, std::vector<Strings>{notify});
  fake::Get().execvResult = 1;
  ASSERT_TRUE(StatusMgr::ShareSetNoSpace("video", true));
  EXPECT_EQ(logcap::Count("NotifyNoSpace failed"), 1);
  const std::string dir = AddShare("photo").dir;
  EXPECT_TRUE(IsShareSpaceEnough("photo"));
  EXPECT_EQ(fake::CallsStartingWith("TAVOQuotaIsEnough"),
            Strings{"TAVOQuotaIsEnough(0," + dir + ",10485760)"});
  fake::Get().quotaResult = 0;
  for (int code : {0x2900, 0x2400, 0x1234}) {
    fake::Get().quotaError = code;
    EXPECT_EQ(IsShareSpaceEnough("photo"), code == 0x1234) << code;
  }
  EXPECT_FALSE(IsShareSpaceEnough("nope"));
  EXPECT_TRUE(logcap::Contains("TAVOShareGet failed, share=nope"));
}

}  // namespace
