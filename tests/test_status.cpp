// status.conf, the status manager's pause and flag operations, and the space check.
#include <fileindex/error.h>
#include <fileindex/status_mgr.h>
#include <fileindex/utils.h>

#include "support/fake_daemon.h"
#include "support/sysroot_test.h"

using namespace TAVO::FILEINDEX;
using Strings = std::vector<std::string>;
using StatusTest = SysrootTest;

namespace {

// The resume time is now plus the hours, wrapped to 32 bits; the save survives an absent daemon.
TEST_F(StatusTest, PauseStoresResumeTimeAndTellsDaemon) {
  fake::SetClock(1700000000);
  EXPECT_FALSE(StatusMgr::Pause(1));
  EXPECT_EQ(ReadJson(StatusConfPath())["resume_time"].asInt64(), 1700003600);
  EXPECT_EQ(logcap::Texts(), Strings{"status_mgr:198 SendCammandToDaemon failed"});
  EXPECT_TRUE(StatusMgr::SetUpdated("k"));  // the failed call freed the lock
  FakeDaemon daemon;
  ASSERT_TRUE(daemon.Start(SocketPath()));
  EXPECT_FALSE(StatusMgr::Pause(-1));
  EXPECT_EQ(ErrorHandler::GetError(), FILEINDEX_ERR_BAD_PARAM);
  fake::SetClock(2000000000);  // 2000000000 + 360000000 wraps in 32 bits
  ASSERT_TRUE(StatusMgr::Pause(100000));
  ASSERT_TRUE(StatusMgr::Resume());
  EXPECT_EQ(ReadJson(StatusConfPath())["resume_time"], Json::Value(-1));
  EXPECT_EQ(daemon.Commands(),
            (std::vector<Json::Value>{ParseJson(R"({"type":"pause","data":{"resume_time":-1934967296}})"),
                                      ParseJson(R"({"type":"resume","data":{}})")}));
}

// The notifier's exact command, run on first marking only and its failure only logged; only the
// quota errors 0x2900 and 0x2400 mean "short".
TEST_F(StatusTest, NoSpaceNotifiesOnceAndOnlyTwoQuotaErrorsMeanShort) {
  ASSERT_TRUE(StatusMgr::ShareSetNoSpace("photo", true));
  ASSERT_TRUE(StatusMgr::ShareSetNoSpace("photo", true));
  ASSERT_EQ(fake::Get().execs.size(), 1u);
  std::string command;  // the arguments, each followed by "|"
  for (const std::string& argument : fake::Get().execs[0]) command += argument + "|";
  EXPECT_EQ(command,
            "/usr/tavo/bin/tavovemnotify|-e|false|-c|TAVO.KOR.AdminCenter.Application|@administrators|"
            "fileindex:fileindex_title|fileindex:notify_no_space|<a data-tavo-app=\"TAVO.KOR.AdminCenter."
            "Application\" data-tavo-fn=\"TAVO.KOR.AdminCenter.MediaIndex.Main\" "
            "data-tavo-tab=\"fileIndex\">|</a>|");
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
}

}  // namespace
