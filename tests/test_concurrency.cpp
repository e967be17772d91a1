// Several processes at once, as on the appliance: writers changing folders, status and
// queues while readers query. Every call succeeds or fails with a defined code, nothing is
// lost or torn, and every queued event is there.
#include <fcntl.h>
#include <fileindex/error.h>
#include <fileindex/index_mgr.h>
#include <fileindex/status_mgr.h>
#include <fileindex/utils.h>
#include <signal.h>
#include <sys/prctl.h>
#include <sys/stat.h>
#include <sys/wait.h>
#include <unistd.h>

#include <algorithm>
#include <cerrno>
#include <chrono>
#include <cstdlib>
#include <fstream>
#include <functional>
#include <map>
#include <random>
#include <set>
#include <sstream>

#include "internal/json_io.h"
#include "internal/queue_scan.h"
#include "support/index_mgr_test.h"

using namespace TAVO::FILEINDEX;

namespace {

const int kWriters = 4;
const int kReaders = 2;
const int kOpsPerWriter = 400;
const int kFoldersPerWriter = 4;
const int kChildWatchdogSeconds = 90;
const char* const kShares[] = {"photo", "video"};

// Forked children, killed and reaped on every way out of the test.
class Children {
 public:
  ~Children() {
    for (pid_t pid : pids_) {
      if (pid <= 0) continue;  // already reaped
      ::kill(pid, SIGKILL);
      ::waitpid(pid, nullptr, 0);
    }
  }

  // Runs body in a child that ends with _exit (never returning into the test runner).
  void Spawn(const std::function<void()>& body) {
    pid_t pid = ::fork();
    if (pid == 0) {
      // Never outlives the test, whatever happens to it.
      ::prctl(PR_SET_PDEATHSIG, SIGKILL);
      ::alarm(kChildWatchdogSeconds);
      // Each child draws its own lock back-off sleeps; the library never seeds rand().
      std::srand(static_cast<unsigned>(::getpid()));
      try {
        body();
      } catch (...) {
        ::_exit(3);
      }
      ::_exit(0);
    }
    ASSERT_GT(pid, 0);
    pids_.push_back(pid);
  }

  // Waits for one child; "" when it exited with 0, else how it ended.
  std::string Wait(size_t index) {
    int status = 0;
    if (::waitpid(pids_[index], &status, 0) != pids_[index]) return "waitpid failed";
    pids_[index] = 0;  // reaped: never signalled again
    if (WIFEXITED(status) && WEXITSTATUS(status) == 0) return "";
    if (WIFSIGNALED(status)) return "killed by signal " + std::to_string(WTERMSIG(status));
    return "exit status " + std::to_string(WEXITSTATUS(status));
  }

  size_t size() const { return pids_.size(); }

 private:
  std::vector<pid_t> pids_;
};

class ConcurrencyTest : public IndexMgrTest {
 protected:
  void SetUp() override {
    IndexMgrTest::SetUp();
    for (const char* share : kShares) {
      AddShare(share);
      ::mkdir(EaDir(share).c_str(), 0755);
      ::mkdir(Full(std::string("/") + share + "/base").c_str(), 0755);
    }
    // A folder per share that nobody deletes, so no share is ever cleaned up (which would
    // remove its queue) and readers always have something to find.
    WriteFolders({Record("/photo/base", "base", true, true, true, true),
                  Record("/video/base", "base", true, true, true, true)});
  }

  std::string ReportPath(const std::string& who) const { return Rooted("/report-" + who + ".json"); }
  std::string StopPath() const { return Rooted("/stop"); }

  void WriteReport(const std::string& who, const Json::Value& report) const {
    std::ofstream out(ReportPath(who));
    out << internal::JsonToString(report);
  }

  static std::string FolderPath(int writer, int k) {
    return std::string("/") + kShares[k % 2] + "/w" + std::to_string(writer) + "-" + std::to_string(k);
  }
  std::string EventPath(int writer) const { return Full("/photo/events-w" + std::to_string(writer)); }

  void RunWriter(int writer);
  void RunReader(int reader);
};

// A few hundred mixed operations on the writer's own folders, share flags and marks. The
// model records what every successful call left; a call that fails must fail with the
// lock's code 9 and is taken to have changed nothing.
void ConcurrencyTest::RunWriter(int writer) {
  LOG_LEVEL = 7;  // the queue writer then logs the events it drops on a busy queue
  std::mt19937 rng(1000 + writer);
  auto pick = [&rng](int n) { return static_cast<int>(rng() % static_cast<unsigned>(n)); };
  const std::string flagShare = "w" + std::to_string(writer);

  std::map<std::string, bool> present;
  bool needReindex = false;
  bool noSpace = false;
  std::set<std::string> marks;
  Json::Value errors(Json::arrayValue);
  Json::Value events(Json::arrayValue);
  int succeeded = 0, lockFailures = 0, dropped = 0;

  for (int n = 0; n < kOpsPerWriter; ++n) {
    const int choice = pick(100);
    const std::string path = FolderPath(writer, pick(kFoldersPerWriter));
    std::string what;
    bool ok = false;
    bool lockable = true;
    ErrorHandler::g_error_code = FILEINDEX_ERR_NONE;
    if (choice < 30) {
      Json::Value records(Json::arrayValue);
      records.append(Record(path, "n" + std::to_string(n), pick(2), pick(2), pick(2), pick(2)));
      const std::string second = FolderPath(writer, pick(kFoldersPerWriter));
      if (pick(3) == 0) records.append(Record(second, "m", true, false, true, false));
      what = "Upsert " + path;
      ok = pick(2) ? IndexMgr::Upsert(records) : IndexMgr::Set(records);
      for (const Json::Value& record : records) {
        if (ok) present[record["path"].asString()] = true;
      }
    } else if (choice < 45) {
      Json::Value paths(Json::arrayValue);
      paths.append(path);
      what = "Delete " + path;
      ok = IndexMgr::Delete(paths);
      if (ok) present[path] = false;
    } else if (choice < 53) {
      Json::Value paths(Json::arrayValue);
      paths.append(path);
      what = "Reindex " + path;
      lockable = false;
      ok = IndexMgr::Reindex(paths);
    } else if (choice < 68) {
      // An event nobody reindexes, so no pending reindex absorbs it: if the append took
      // the queue's lock, the line must be in the queue at the end.
      Json::Value data(Json::objectValue);
      data["writer"] = writer;
      data["seq"] = n;
      what = "AddCustomEvent";
      lockable = false;
      const int droppedBefore = logcap::Count("try lock too many times");
      ok = AddCustomEvent(131072, EventPath(writer), data);
      if (ok && logcap::Count("try lock too many times") == droppedBefore) {
        events.append(n);
      } else if (ok) {
        ++dropped;
      }
    } else if (choice < 76) {
      what = "Pause/Resume";
      ok = pick(2) ? StatusMgr::Pause(pick(3)) : StatusMgr::Resume();
    } else if (choice < 88) {
      const bool set = pick(2) != 0;
      if (pick(2)) {
        what = "ShareSetNeedReindex";
        ok = StatusMgr::ShareSetNeedReindex(flagShare, set);
        if (ok) needReindex = set;
      } else {
        what = "ShareSetNoSpace";
        ok = StatusMgr::ShareSetNoSpace(flagShare, set);
        if (ok) noSpace = set;
      }
    } else {
      const std::string mark = flagShare + "-mark" + std::to_string(n);
      what = "SetUpdated";
      ok = StatusMgr::SetUpdated(mark);
      if (ok) marks.insert(mark);
    }

    if (ok) {
      ++succeeded;
    } else if (lockable && ErrorHandler::GetError() == FILEINDEX_ERR_LOCK) {
      ++lockFailures;
    } else {
      errors.append(what + " failed with code " + std::to_string(ErrorHandler::GetError()));
    }
  }

  Json::Value report(Json::objectValue);
  report["ops"] = kOpsPerWriter;
  report["succeeded"] = succeeded;
  report["lockFailures"] = lockFailures;
  report["dropped"] = dropped;
  report["errors"] = errors;
  report["events"] = events;
  report["needReindex"] = needReindex;
  report["noSpace"] = noSpace;
  for (const auto& entry : present) report["folders"][entry.first] = entry.second;
  for (const std::string& mark : marks) report["marks"].append(mark);
  WriteReport("w" + std::to_string(writer), report);
}

// Queries in a loop until told to stop. Readers take no lock (but Get, which waits on
// folder.conf's lock and may fail with 9), so what they see is what a save left on disk.
void ConcurrencyTest::RunReader(int reader) {
  Json::Value errors(Json::arrayValue);
  int iterations = 0;
  auto fail = [&errors](const std::string& what) {
    if (errors.size() < 20) errors.append(what + " (code " + std::to_string(ErrorHandler::GetError()) + ")");
  };
  const auto deadline = std::chrono::steady_clock::now() + std::chrono::seconds(60);
  while (!Exists(StopPath()) && std::chrono::steady_clock::now() < deadline) {
    ++iterations;
    ErrorHandler::g_error_code = FILEINDEX_ERR_NONE;
    for (const std::string& file : {FolderConfPath(), StatusConfPath()}) {
      // status.conf only comes into being with the first status write.
      std::ifstream in(file, std::ios::binary);
      if (!in) continue;
      std::stringstream text;
      text << in.rdbuf();
      Json::Value doc;
      if (!internal::JsonFromString(doc, text.str()) || !doc.isObject()) fail("torn " + file);
    }
    std::vector<Folder> folders;
    if (!IndexMgr::List(folders) || folders.size() < 2) fail("IndexMgr::List");
    Json::Value page;
    Json::Value additional(Json::arrayValue);
    additional.append("status");
    if (!IndexMgr::List(page, 0, 5, "name", "", additional) || page["total"].asUInt() < 2 ||
        page["folder"].size() != std::min(5u, page["total"].asUInt())) {
      fail("paged IndexMgr::List");
    }
    Json::Value record;
    if (IndexMgr::Get(record, "/video/base")) {
      if (record["name"] != "base") fail("IndexMgr::Get read " + internal::JsonToString(record));
    } else if (ErrorHandler::GetError() != FILEINDEX_ERR_LOCK) {
      fail("IndexMgr::Get");
    }
    if (!IndexMgr::IsShareIndexed("photo") || !IndexMgr::IsPathIndexed("/video/base/x")) fail("queries");
    long long resume = 0;
    if (!StatusMgr::GetPauseInfo(resume)) fail("StatusMgr::GetPauseInfo");
    std::string status;
    if (!StatusMgr::GetStatus(status)) fail("StatusMgr::GetStatus");
    StatusMgr::IsUpdated("w0-mark1");
    StatusMgr::ShareIsNoSpace("w" + std::to_string(reader));
    // Whole lines only: an append may be in progress at the end of the file.
    for (const char* share : kShares) {
      std::istringstream queue(ReadFile(Queue(share)));
      std::string line;
      while (std::getline(queue, line) && !queue.eof()) {
        internal::QueueEvent event;
        if (!internal::ParseQueueLine(line.data(), line.size(), event)) fail("queue line " + line);
      }
    }
  }
  Json::Value report(Json::objectValue);
  report["iterations"] = iterations;
  report["errors"] = errors;
  WriteReport("r" + std::to_string(reader), report);
}

TEST_F(ConcurrencyTest, WritersAndReadersInSeveralProcesses) {
  // The children are forked before the fake daemon's thread exists (a forked copy of a
  // running thread's state would only be lost memory in every child) and wait at a gate
  // that opens once it listens; they then all start at the same moment.
  int gate[2];
  ASSERT_EQ(::pipe2(gate, O_CLOEXEC), 0);
  auto passGate = [&gate] {
    ::close(gate[1]);
    char c;
    while (::read(gate[0], &c, 1) < 0 && errno == EINTR) {
    }
  };
  Children writers;
  Children readers;
  for (int r = 0; r < kReaders; ++r)
    readers.Spawn([this, r, &passGate] {
      passGate();
      RunReader(r);
    });
  for (int w = 0; w < kWriters; ++w)
    writers.Spawn([this, w, &passGate] {
      passGate();
      RunWriter(w);
    });
  StartDaemon();
  ::close(gate[1]);
  ::close(gate[0]);
  for (size_t i = 0; i < writers.size(); ++i) EXPECT_EQ(writers.Wait(i), "") << "writer " << i;
  WriteFile(StopPath(), "");
  for (size_t i = 0; i < readers.size(); ++i) EXPECT_EQ(readers.Wait(i), "") << "reader " << i;

  // folder.conf holds the two permanent folders and exactly what each writer left.
  std::set<std::string> expectedFolders{"/photo/base", "/video/base"};
  Json::Value status = ReadJson(StatusConfPath());
  ASSERT_TRUE(status.isObject());
  int totalOps = 0, totalSucceeded = 0, totalLockFailures = 0, totalDropped = 0;
  std::map<std::string, std::set<int>> eventsByWriter;
  for (int w = 0; w < kWriters; ++w) {
    const std::string name = "w" + std::to_string(w);
    Json::Value report = ReadJson(ReportPath(name));
    ASSERT_TRUE(report.isObject()) << name;
    EXPECT_EQ(report["errors"], Json::Value(Json::arrayValue)) << name;
    totalOps += report["ops"].asInt();
    totalSucceeded += report["succeeded"].asInt();
    totalLockFailures += report["lockFailures"].asInt();
    totalDropped += report["dropped"].asInt();
    for (const std::string& path : report["folders"].getMemberNames()) {
      if (report["folders"][path].asBool()) expectedFolders.insert(path);
    }
    EXPECT_EQ(status["need_reindex"].isMember(name), report["needReindex"].asBool()) << name;
    EXPECT_EQ(status["no_space"].isMember(name), report["noSpace"].asBool()) << name;
    std::set<std::string> marks;
    for (const std::string& key : status.getMemberNames()) {
      if (key.compare(0, name.size() + 5, name + "-mark") == 0) marks.insert(key);
    }
    std::set<std::string> expectedMarks;
    for (const Json::Value& mark : report["marks"]) expectedMarks.insert(mark.asString());
    EXPECT_EQ(marks, expectedMarks) << name;
    for (const Json::Value& seq : report["events"]) eventsByWriter[name].insert(seq.asInt());
  }
  std::set<std::string> folders;
  for (const std::string& key : FolderConf().getMemberNames()) folders.insert(key);
  EXPECT_EQ(folders, expectedFolders);

  // Every queue line is one whole event, and every appended custom event is there once.
  std::map<std::string, std::multiset<int>> queued;
  for (const char* share : kShares) {
    const std::string text = ReadFile(Queue(share));
    EXPECT_TRUE(text.empty() || text.back() == '\n') << share;
    for (const std::string& line : ReadLines(Queue(share))) {
      Json::Value event;
      ASSERT_TRUE(internal::JsonFromString(event, line) && event.isObject()) << line;
      EXPECT_TRUE(event["event"] == 131072 || event["event"] == 65536) << line;
      EXPECT_TRUE(event["path"].isString()) << line;
      const Json::Value& data = event["data"];
      if (data.isObject() && data.isMember("seq")) {
        queued["w" + data["writer"].asString()].insert(data["seq"].asInt());
      }
    }
  }
  for (const auto& entry : eventsByWriter) {
    for (int seq : entry.second) EXPECT_EQ(queued[entry.first].count(seq), 1u) << entry.first << " " << seq;
  }

  int readerIterations = 0;
  for (int r = 0; r < kReaders; ++r) {
    Json::Value report = ReadJson(ReportPath("r" + std::to_string(r)));
    EXPECT_EQ(report["errors"], Json::Value(Json::arrayValue)) << "reader " << r;
    readerIterations += report["iterations"].asInt();
  }
  // Every command frame arrived whole.
  for (const auto& frame : daemon_.Frames()) EXPECT_TRUE(frame.ok);

  // Contention must actually have happened, and most work must still have gone through.
  EXPECT_GT(totalSucceeded, totalOps / 4);
  EXPECT_GT(readerIterations, 0);
  std::printf(
      "%d processes: %d writer operations (%d succeeded, %d refused by a held lock, %d events "
      "dropped on a busy queue), %d reader iterations, %zu daemon frames\n",
      kWriters + kReaders, totalOps, totalSucceeded, totalLockFailures, totalDropped, readerIterations,
      daemon_.Frames().size());
}

}  // namespace
