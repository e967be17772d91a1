// The overall and per-folder status words, and the queue line reading they rest on.
#include <fileindex/status_mgr.h>
#include <sys/stat.h>
#include <unistd.h>

#include <string>
#include <vector>

#include "internal/queue_line_view.h"
#include "internal/queue_scan.h"
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
    ::mkdir(Full("/photo/@eaDir").c_str(), 0755);
    WriteFile(FolderConfPath(), R"({"/photo/2019":{"name":"y"}})");
    queue_ = Full("/photo/@eaDir/TAVO@file_index_queue");
  }
  std::string Full(const std::string& p) const { return Rooted("/volume1" + p); }
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

// Wherever the one-pass reader decides a line, the full parser must read it the same way.
TEST(QueueLineViewTest, AgreesWithTheFullParserWhereverItDecides) {
  using namespace TAVO::FILEINDEX::internal;
  const Lines seeds{
      R"({"event":2,"path":"/v/p/a","data":{}})",
      R"( {"path" : "/v/p", "event" : 256 , "path_old":"/v/q/b", "data":[1,-2,true,null,"s\n\"\u00e9"]} )",
      R"({"event":4294967295,"path":"","path_old":7})",
      R"({"path":"/x","event":1,"data":{"path":"/y"},"path":"/b","event":3})",
      R"({"event":01,"path":"/a","data":"\ud800"})",
      // The daemon's own compact forms, which the reader takes in fewer steps.
      R"({"event":256,"path":"/v/p/b","path_old":"/v/q/c"})",
      R"({"event":4294967296,"path":"/v/p","data":{"inode":12,"size":0,"mtime":-1,"x":[1.5]}})",
      R"({"event":8,"path":"/v/\u0070","path_old":"/v/q\"","data":null})"};
  Lines lines = seeds;  // plus every one-byte deletion and delimiter insertion
  for (const std::string& s : seeds)
    for (size_t i = 0; i < s.size(); ++i) {
      lines.push_back(s.substr(0, i) + s.substr(i + 1));
      for (char c : std::string("\"{}[],:\\ 0-e")) lines.push_back(s.substr(0, i) + c + s.substr(i));
    }
  int decided = 0;
  for (const std::string& line : lines) {
    QueueEventView view;
    if (!ViewQueueLine(line.data(), line.size(), view)) continue;
    ++decided;
    QueueEvent event;
    bool parsed = false;  // a throw counts as a disagreement
    try {
      parsed = ParseQueueLine(line.data(), line.size(), event);
    } catch (const std::exception&) {
    }
    ASSERT_TRUE(parsed) << line;
    EXPECT_EQ(view.event, event.event) << line;
    EXPECT_EQ(std::string(view.path, view.pathSize), event.path) << line;
    EXPECT_EQ(view.pathOld ? std::string(view.pathOld, view.pathOldSize) : "(none)",
              event.hasPathOld ? event.pathOld : "(none)")
        << line;
  }
  EXPECT_GT(decided, 100);
}
