// The overall and per-folder status words, from the queue files, the pause time and the
// no-space flags; and the queue line reading they rest on.
#include <fileindex/status_mgr.h>
#include <sys/resource.h>
#include <sys/stat.h>
#include <unistd.h>

#include <string>
#include <vector>

#include "internal/queue_line_view.h"
#include "internal/queue_scan.h"
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
  }

  // Writes folder.conf with these share paths and makes their directories on volume1.
  void WriteFolders(const std::vector<std::string>& paths) {
    Json::Value conf(Json::objectValue);
    for (const std::string& path : paths) {
      conf[path]["name"] = path;
      ::mkdir(Rooted("/volume1" + path).c_str(), 0755);
    }
    WriteFile(FolderConfPath(), conf.toStyledString());
  }
  std::string Full(const std::string& path) const { return Rooted("/volume1" + path); }
  std::string Queue(const std::string& share = "photo") const {
    ::mkdir(Rooted("/volume1/" + share + "/@eaDir").c_str(), 0755);
    return Rooted("/volume1/" + share + "/@eaDir/TAVO@file_index_queue");
  }
  void SetResumeTime(const std::string& value) {
    WriteFile(StatusConfPath(), "{\"resume_time\":" + value + "}");
  }
  static std::string Line(int event, const std::string& path) {
    return "{\"event\":" + std::to_string(event) + ",\"path\":\"" + path + "\",\"data\":{}}\n";
  }
  std::string Overall() {
    std::string status = "unset";
    EXPECT_TRUE(StatusMgr::GetStatus(status));
    return status;
  }
};

}  // namespace

TEST_F(StatusReportTest, OverallStatusFollowsQueuesAndPause) {
  EXPECT_EQ(Overall(), "finished");

  WriteFolders({"/photo/2019"});
  SetResumeTime("0");
  // Idle while paused is still finished.
  EXPECT_EQ(Overall(), "finished");
  WriteFile(Queue(), "");
  EXPECT_EQ(Overall(), "paused");

  SetResumeTime(std::to_string(kNow + 5));
  EXPECT_EQ(Overall(), "paused");
  fake::SetClock(kNow + 5);
  EXPECT_EQ(Overall(), "processing");
  EXPECT_EQ(ReadFile(StatusConfPath()), "{\"resume_time\":" + std::to_string(kNow + 5) + "}");
  SetResumeTime("-1");
  EXPECT_EQ(Overall(), "processing");

  // Only the companion file present counts as a queue.
  ASSERT_EQ(::rename(Queue().c_str(), (Queue() + ".tmp").c_str()), 0);
  EXPECT_EQ(Overall(), "processing");
  ::unlink((Queue() + ".tmp").c_str());
  EXPECT_EQ(Overall(), "finished");
}

TEST_F(StatusReportTest, OverallStatusSkipsUnindexableSharesAndFailsWithoutChangingTheAnswer) {
  AddShare("video");
  // video's folder has no directory, so its queue is not looked at.
  WriteFolders({"/photo/2019", "/video/gone"});
  ASSERT_EQ(::rmdir(Full("/video/gone").c_str()), 0);
  WriteFile(Queue("video"), Line(2, Full("/video/gone/a")));
  EXPECT_EQ(Overall(), "finished");

  // The pause time cannot be read: failure, the argument untouched.
  WriteFile(Queue(), "");
  SetResumeTime("\"soon\"");
  std::string status = "before";
  EXPECT_FALSE(StatusMgr::GetStatus(status));
  EXPECT_EQ(status, "before");

  // A folder without a share name fails the call even before the indexability test.
  WriteFile(FolderConfPath(), R"({"":{"name":"x"},"/photo/2019":{"name":"y"}})");
  logcap::Clear();
  EXPECT_FALSE(StatusMgr::GetStatus(status));
  EXPECT_EQ(status, "before");
  // Loading folder.conf logs the unresolvable path first.
  ASSERT_FALSE(logcap::Texts().empty());
  EXPECT_EQ(logcap::Texts().back(), "status_mgr:135 Failed to get share name from path: ");
  EXPECT_EQ(logcap::Count("status_mgr:"), 1);

  WriteFile(FolderConfPath(), "[");
  EXPECT_FALSE(StatusMgr::GetStatus(status));
}

TEST_F(StatusReportTest, FolderStatusMatchesEventsInsideTheFolderOnly) {
  WriteFolders({"/photo/2019"});
  const std::string folder = Full("/photo/2019");
  EXPECT_EQ(StatusMgr::GetFolderStatus("/photo/2019"), "finished");

  // A sibling whose name begins with the folder's name, and a parent, do not match.
  WriteFile(Queue(), Line(2, folder + "x/a.jpg") + Line(2, Full("/photo")));
  EXPECT_EQ(StatusMgr::GetFolderStatus("/photo/2019"), "finished");

  // A rename out of the folder counts only as event 256.
  WriteFile(Queue(),
            "{\"event\":2,\"path\":\"" + Full("/photo/x") + "\",\"path_old\":\"" + folder + "/a\"}\n");
  EXPECT_EQ(StatusMgr::GetFolderStatus("/photo/2019"), "finished");
  WriteFile(Queue(),
            "{\"event\":256,\"path\":\"" + Full("/photo/x") + "\",\"path_old\":\"" + folder + "/a\"}\n");
  EXPECT_EQ(StatusMgr::GetFolderStatus("/photo/2019"), "processing");

  // The folder itself, and a file inside it.
  WriteFile(Queue(), Line(65536, folder));
  EXPECT_EQ(StatusMgr::GetFolderStatus("/photo/2019"), "processing");
  WriteFile(Queue(), Line(2, folder + "/a.jpg"));
  EXPECT_EQ(StatusMgr::GetFolderStatus("/photo/2019"), "processing");

  SetResumeTime("0");
  EXPECT_EQ(StatusMgr::GetFolderStatus("/photo/2019"), "paused");
  SetResumeTime(std::to_string(kNow + 5));
  EXPECT_EQ(StatusMgr::GetFolderStatus("/photo/2019"), "paused");
  fake::SetClock(kNow + 5);
  EXPECT_EQ(StatusMgr::GetFolderStatus("/photo/2019"), "processing");
  // An unreadable pause time counts as not paused.
  SetResumeTime("{}");
  EXPECT_EQ(StatusMgr::GetFolderStatus("/photo/2019"), "processing");

  // Only the companion file: read instead of the missing queue.
  ASSERT_EQ(::rename(Queue().c_str(), (Queue() + ".tmp").c_str()), 0);
  EXPECT_EQ(StatusMgr::GetFolderStatus("/photo/2019"), "processing");
  WriteFile(Queue(), Line(2, folder + "x"));
  EXPECT_EQ(StatusMgr::GetFolderStatus("/photo/2019"), "processing");
}

TEST_F(StatusReportTest, NoSpaceAndUnindexableOutrankTheQueue) {
  WriteFolders({"/photo/2019"});
  SetResumeTime("0");
  EXPECT_EQ(StatusMgr::GetFolderStatus("/photo/2019"), "finished");
  WriteFile(StatusConfPath(), R"({"resume_time":0,"no_space":{"photo":true}})");
  EXPECT_EQ(StatusMgr::GetFolderStatus("/photo/2019"), "err_no_space");
  WriteFile(Queue(), Line(2, Full("/photo/2019/a")));
  EXPECT_EQ(StatusMgr::GetFolderStatus("/photo/2019"), "err_no_space");
  // The overall status never reports it.
  EXPECT_EQ(Overall(), "paused");

  // A folder that may not be indexed (no directory, unknown share) is paused whatever
  // its queue holds, and nothing is logged for it here.
  WriteFile(StatusConfPath(), "{}");
  logcap::Clear();
  EXPECT_EQ(StatusMgr::GetFolderStatus("/photo/none"), "paused");
  EXPECT_EQ(StatusMgr::GetFolderStatus("/nosuch/a"), "paused");
  EXPECT_FALSE(logcap::Contains("status_mgr:"));
}

TEST_F(StatusReportTest, MalformedLinesAreLoggedAndTheWholeFileIsRead) {
  WriteFolders({"/photo/2019"});
  const std::string inside = Line(2, Full("/photo/2019/a"));
  // The match comes first: the lines after it are still read and logged.
  WriteFile(Queue(), inside + "not json\n" + "{\"event\":-1,\"path\":\"/x\"}\n" + "{\"event\":2}\n" +
                         "[1,2]\n" + "{\"event\":2,\"path\":5}\n" + "{\"event\":2,\"path\":\"/x\"} x\n" +
                         std::string(2000, '[') + "\n" + "{\"event\":2,\"path\":\"/x\"");
  EXPECT_EQ(StatusMgr::GetFolderStatus("/photo/2019"), "processing");
  const std::vector<std::string> expected{
      "status_mgr:47 Malformed command: not json",
      "status_mgr:47 Malformed command: {\"event\":-1,\"path\":\"/x\"}",
      "status_mgr:47 Malformed command: {\"event\":2}",
      "status_mgr:47 Malformed command: [1,2]",
      "status_mgr:47 Malformed command: {\"event\":2,\"path\":5}",
      "status_mgr:47 Malformed command: {\"event\":2,\"path\":\"/x\"} x",
      "status_mgr:47 Malformed command: " + std::string(2000, '['),
      // A half-written last line.
      "status_mgr:47 Malformed command: {\"event\":2,\"path\":\"/x\"",
  };
  EXPECT_EQ(logcap::Texts(), expected);

  // A queue of malformed lines only is no pending work; an empty line is malformed too.
  WriteFile(Queue(), "\n{\"path\":\"" + Full("/photo/2019/a") + "\"}\n");
  logcap::Clear();
  EXPECT_EQ(StatusMgr::GetFolderStatus("/photo/2019"), "finished");
  EXPECT_EQ(logcap::Count("status_mgr:47 Malformed command: "), 2);

  // Lines that only a full parser reads still match: escapes, a value convertible to an
  // unsigned event, a repeated member whose last value wins.
  const std::string escaped = Full("/photo/2019/a");
  for (const std::string& line :
       {"{\"event\":2,\"path\":\"" + Full("/photo/2019\\/b") + "\"}",
        "{\"event\":true,\"path\":\"" + escaped + "\"}",
        "{\"path\":\"/x\",\"event\":2.0,\"path\":\"" + escaped + "\"}",
        "{\"event\":256,\"path\":\"/x\",\"path_old\":\"" + Full("/photo/2019/\\u0041") + "/c\"}"}) {
    WriteFile(Queue(), line + "\n");
    logcap::Clear();
    EXPECT_EQ(StatusMgr::GetFolderStatus("/photo/2019"), "processing") << line;
    EXPECT_TRUE(logcap::Texts().empty()) << line;
  }
  // "\u0041" makes the old path .../2019A/c: outside the folder.
  WriteFile(Queue(),
            "{\"event\":256,\"path\":\"/x\",\"path_old\":\"" + Full("/photo/2019") + "\\u0041/c\"}\n");
  EXPECT_EQ(StatusMgr::GetFolderStatus("/photo/2019"), "finished");
}

TEST_F(StatusReportTest, UnopenableQueueIsLoggedAndCountsAsNoWork) {
  WriteFolders({"/photo/2019"});
  WriteFile(Queue(), Line(2, Full("/photo/2019/a")));
  // No descriptor left: the queue exists but cannot be opened, even by root.
  struct rlimit saved;
  ASSERT_EQ(::getrlimit(RLIMIT_NOFILE, &saved), 0);
  const int lowest = ::dup(0);
  ASSERT_GE(lowest, 0);
  ::close(lowest);
  struct rlimit tight = saved;
  tight.rlim_cur = static_cast<rlim_t>(lowest);
  ASSERT_EQ(::setrlimit(RLIMIT_NOFILE, &tight), 0);
  const std::string status = StatusMgr::GetFolderStatus("/photo/2019");
  ASSERT_EQ(::setrlimit(RLIMIT_NOFILE, &saved), 0);
  EXPECT_EQ(status, "finished");
  EXPECT_EQ(logcap::Count("status_mgr:"), 1);
  EXPECT_TRUE(
      logcap::Contains("status_mgr:37 Failed to open queue=" + Queue() + ", reason=Too many open files"));
}

// Every line the one-pass reader decides must be read the same by the full parser;
// otherwise the status would depend on which of the two looked at a line.
TEST(QueueLineViewTest, AgreesWithTheFullParserWhereverItDecides) {
  using namespace TAVO::FILEINDEX::internal;
  const std::vector<std::string> seeds{
      R"({"event":2,"path":"/v/p/a","data":{}})",
      R"( {"path" : "/v/p", "event" : 256 , "path_old":"/v/q/b", "data":[1,-2,0,true,false,null,"s\n\"\u00e9"]} )",
      R"({"event":4294967295,"path":"","path_old":7})",
      R"({"event":4294967296,"path":"/a"})",
      R"({"event":1,"event":"x","path":"/a"})",
      R"({"event":"x","event":3,"path":"/a","path":"/b"})",
      R"({"event":01,"path":"/a"})",
      R"({"event":1,"path":"/a","data":{"k":1.5e3}})",
      R"({"event":1,"path":"/a","data":{"k":[1,]}})",
      R"({"event":1,"path":"/a",})",
      R"({"":1,"event":1,"path":"/a"})",
      R"({"event":1,"path":"/a","data":"\ud800"})",
      R"({"event":1,"path":"/a","data":"\x"})",
      R"({"event":1,"path":"/a"}/**/)",
      R"({"event":null,"path":"/a"})",
      R"({"event":-0,"path":"/a"})",
      R"({"path":"/x","event":1,"data":{"path":"/y"},"path":"/b","event":3})",
      "{\"event\":1,\"path\":\"/a\tb\"}",
      "{\"event\":1,\"path\":\"/\xc3\xa9\"}\r",
  };
  // Every seed, and every variant with one byte removed or one delimiter inserted.
  std::vector<std::string> lines = seeds;
  for (const std::string& seed : seeds) {
    for (size_t i = 0; i < seed.size(); ++i) {
      lines.push_back(seed.substr(0, i) + seed.substr(i + 1));
      for (char c : std::string("\"{}[],:\\ 0-e")) lines.push_back(seed.substr(0, i) + c + seed.substr(i));
    }
  }
  int decided = 0;
  for (const std::string& line : lines) {
    QueueEventView view;
    if (!ViewQueueLine(line.data(), line.size(), view)) continue;
    ++decided;
    QueueEvent event;
    bool parsed = false;
    try {
      parsed = ParseQueueLine(line.data(), line.size(), event);
    } catch (const std::exception&) {
    }
    ASSERT_TRUE(parsed) << line;
    EXPECT_EQ(view.event, event.event) << line;
    EXPECT_EQ(std::string(view.path, view.pathSize), event.path) << line;
    EXPECT_EQ(view.pathOld != nullptr, event.hasPathOld) << line;
    if (view.pathOld != nullptr) {
      EXPECT_EQ(std::string(view.pathOld, view.pathOldSize), event.pathOld) << line;
    }
  }
  // The common lines must be decided here, or every line would pay for a document.
  QueueEventView view;
  for (int i = 0; i < 3; ++i) {
    ASSERT_TRUE(ViewQueueLine(seeds[i].data(), seeds[i].size(), view)) << seeds[i];
  }
  const std::string repeated = R"({"path":"/x","event":1,"data":{"path":"/y"},"path":"/b","event":3})";
  ASSERT_TRUE(ViewQueueLine(repeated.data(), repeated.size(), view));
  EXPECT_EQ(view.event, 3u);
  EXPECT_EQ(std::string(view.path, view.pathSize), "/b");
  EXPECT_GT(decided, 100);
}
