// The overall and per-folder status words.
#include <fileindex/status_mgr.h>
#include <sys/stat.h>
#include <unistd.h>

#include <string>
#include <vector>

#include "support/sysroot_test.h"

using namespace TAVO::FILEINDEX;
using Lines = std::vector<std::string>;

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
    queue_ = Queue("photo");
  }
  void SetResumeTime(const std::string& v) { WriteFile(StatusConfPath(), "{\"resume_time\":" + v + "}"); }
  static std::string Line(int event, const std::string& path) {
    return "{\"event\":" + std::to_string(event) + ",\"path\":\"" + path + "\",\"data\":{}}\n";
  }
  std::string Overall() {
    std::string status = "unset";
    return StatusMgr::GetStatus(status) ? status : "failed";
  }
  std::string Folder() { return StatusMgr::GetFolderStatus("/photo/2019"); }
  std::string queue_;
};
}  // namespace

// Pause state (0 = forever, future, past), the companion file standing in for the queue, and failure.
TEST_F(StatusReportTest, OverallStatusFollowsQueuesAndPause) {
  SetResumeTime("0");
  EXPECT_EQ(Overall(), "finished");  // idle while paused is still finished
  WriteFile(queue_, "");
  EXPECT_EQ(Overall(), "paused");
  SetResumeTime(std::to_string(kNow + 5));
  EXPECT_EQ(Overall(), "paused");
  fake::SetClock(kNow + 5);
  EXPECT_EQ(Overall(), "processing");
  ASSERT_EQ(::rename(queue_.c_str(), (queue_ + ".tmp").c_str()), 0);
  EXPECT_EQ(Overall(), "processing");
  SetResumeTime("\"soon\"");  // a failure leaves the answer untouched
  std::string status = "before";
  EXPECT_FALSE(StatusMgr::GetStatus(status));
  EXPECT_EQ(status, "before");
  ::unlink((queue_ + ".tmp").c_str());
  EXPECT_EQ(Overall(), "finished");
}

// Prefix siblings and parents are outside; a rename out counts only as event 256; no-space outranks all.
TEST_F(StatusReportTest, FolderStatusMatchesEventsInsideTheFolderOnly) {
  const std::string folder = Full("/photo/2019"), out = "\",\"path_old\":\"" + folder + "/a\"}\n";
  const std::pair<std::string, const char*> cases[] = {
      {Line(2, folder + "x/a.jpg") + Line(2, Full("/photo")), "finished"},
      {"{\"event\":2,\"path\":\"/x" + out, "finished"},
      {"{\"event\":256,\"path\":\"/x" + out, "processing"},
      {Line(65536, folder), "processing"},
      {Line(2, folder + "/a.jpg"), "processing"}};
  for (const auto& c : cases) {
    WriteFile(queue_, c.first);
    EXPECT_EQ(Folder(), c.second) << c.first;
  }
  SetResumeTime("0");
  EXPECT_EQ(Folder(), "paused");
  SetResumeTime("{}");  // unreadable pause time counts as not paused
  EXPECT_EQ(Folder(), "processing");
  WriteFile(StatusConfPath(), R"({"resume_time":0,"no_space":{"photo":true}})");
  EXPECT_EQ(Folder(), "err_no_space");  // outranks both the queue and the pause
  EXPECT_EQ(Overall(), "paused");       // which ignores no-space
}

// Reading continues past a match and logs every malformed line; escapes decode before matching.
TEST_F(StatusReportTest, MalformedLinesAreLoggedAndTheWholeFileIsRead) {
  WriteFile(queue_, Line(2, Full("/photo/2019/a")) + "nope\n{\"event\":2}\n\n{\"event\":2,\"path\":\"/x\"");
  EXPECT_EQ(Folder(), "processing");
  const std::string m = "status_mgr:47 Malformed command: ";
  EXPECT_EQ(logcap::Texts(), (Lines{m + "nope", m + "{\"event\":2}", m, m + "{\"event\":2,\"path\":\"/x\""}));
  WriteFile(queue_, R"({"event":256,"path":"/x","path_old":")" + Full("/photo/2019") + R"(\u0041/c"})");
  EXPECT_EQ(Folder(), "finished");
}
