// The overall and per-folder status words.
#include <fileindex/status_mgr.h>
#include <sys/stat.h>

#include <string>

#include "support/sysroot_test.h"

using namespace TAVO::FILEINDEX;

namespace {
const long long kNow = 1700000000;

class StatusReportTest : public SysrootTest {
 protected:
  void SetUp() override {
    SysrootTest::SetUp();
    fake::SetClock(kNow);
    AddShare("photo");
    ::mkdir(Full("/photo/2019").c_str(), 0755);
    ::mkdir(EaDir("photo").c_str(), 0755);
    WriteFile(FolderConfPath(), R"({"/photo/2019":{"name":"y"}})");
  }
  void SetResumeTime(const std::string& v) { WriteFile(StatusConfPath(), "{\"resume_time\":" + v + "}"); }
  std::string Overall() {  // a failure must leave the answer untouched
    std::string status = "unset";
    return StatusMgr::GetStatus(status) ? status : "failed, " + status;
  }
  std::string Folder() { return StatusMgr::GetFolderStatus("/photo/2019"); }
};
}  // namespace

// Pause state (0 = forever, future, past), the companion file standing in for the queue, and failure.
TEST_F(StatusReportTest, OverallStatusFollowsQueuesAndPause) {
  SetResumeTime("0");
  EXPECT_EQ(Overall(), "finished");  // idle while paused is still finished
  WriteFile(Queue("photo"), "");
  EXPECT_EQ(Overall(), "paused");
  SetResumeTime(std::to_string(kNow + 5));
  EXPECT_EQ(Overall(), "paused");
  fake::SetClock(kNow + 5);
  EXPECT_EQ(Overall(), "processing");
  ASSERT_EQ(::rename(Queue("photo").c_str(), (Queue("photo") + ".tmp").c_str()), 0);
  EXPECT_EQ(Overall(), "processing");
  SetResumeTime("\"soon\"");
  EXPECT_EQ(Overall(), "failed, unset");
}

// A rename out of the folder (event 256) counts; a pause shows unless unreadable; no-space outranks all.
TEST_F(StatusReportTest, FolderStatusFollowsTheQueuePauseAndNoSpace) {
  WriteFile(Queue("photo"), R"({"event":256,"path":"/x","path_old":")" + Full("/photo/2019/a") + "\"}\n");
  EXPECT_EQ(Folder(), "processing");
  SetResumeTime("0");
  EXPECT_EQ(Folder(), "paused");
  SetResumeTime("{}");  // unreadable pause time counts as not paused
  EXPECT_EQ(Folder(), "processing");
  WriteFile(StatusConfPath(), R"({"resume_time":0,"no_space":{"photo":true}})");
  EXPECT_EQ(Folder(), "err_no_space");  // outranks both the queue and the pause
  EXPECT_EQ(Overall(), "paused");       // which ignores no-space
}
