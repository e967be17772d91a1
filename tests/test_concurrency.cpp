// Writers and readers in several processes at once: every call succeeds or fails with the
// lock's code 9 (and then changed nothing), the files always parse and queue lines are whole.
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

#include <cerrno>
#include <cstdlib>
#include <fstream>
#include <random>
#include <set>

#include "internal/json_io.h"
#include "support/index_mgr_test.h"

using namespace TAVO::FILEINDEX;

namespace {

const int kWriters = 4, kReaders = 2, kOpsPerWriter = 400;
const char* const kShares[] = {"photo", "video"};

class ConcurrencyTest : public IndexMgrTest {
 protected:
  void SetUp() override {
    IndexMgrTest::SetUp();
    for (const char* share : kShares) {
      AddShare(share);
      ::mkdir(EaDir(share).c_str(), 0755);
      ::mkdir(Full(std::string("/") + share + "/base").c_str(), 0755);
    }
    // Folders nobody deletes: no share is ever cleaned up and readers always find something.
    WriteFolders({Record("/photo/base", "base", 1, 1, 1, 1), Record("/video/base", "base", 1, 1, 1, 1)});
  }
  void TearDown() override {  // children never outlive the test, however it ends
    for (pid_t pid : pids_)
      if (pid > 0 && ::kill(pid, SIGKILL) == 0) ::waitpid(pid, nullptr, 0);
    IndexMgrTest::TearDown();
  }
  int Wait(int i) {  // the child's wait status: 0 for a clean exit
    int status = -1;
    ::waitpid(pids_[i], &status, 0);
    return pids_[i] = 0, status;
  }
  std::string ReportPath(const std::string& who) const { return Rooted("/report-" + who + ".json"); }

  // Mixed calls on the writer's own folders, share flag and queue; the report records what each
  // successful call left. A failure must carry code 9 (where a lock is taken) and changed nothing.
  void RunWriter(int writer) {
    std::mt19937 rng(1000 + writer);
    auto pick = [&rng](int n) { return static_cast<int>(rng() % static_cast<unsigned>(n)); };
    const std::string flagShare = "w" + std::to_string(writer);
    Json::Value report(Json::objectValue);
    for (int n = 0; n < kOpsPerWriter; ++n) {
      const int k = pick(4), choice = pick(100);
      const std::string path = "/" + std::string(kShares[k % 2]) + "/" + flagShare + "-" + std::to_string(k);
      bool ok = false, lockable = choice < 55 || choice >= 75;
      ErrorHandler::g_error_code = FILEINDEX_ERR_NONE;
      if (choice < 35) {
        const auto records =
            Array({Record(path, "n" + std::to_string(n), pick(2), pick(2), pick(2), pick(2))});
        if ((ok = pick(2) ? IndexMgr::Upsert(records) : IndexMgr::Set(records)))
          report["folders"][path] = true;
      } else if (choice < 55) {
        if ((ok = IndexMgr::Delete(Array({Json::Value(path)})))) report["folders"][path] = false;
      } else if (choice < 75) {
        ok = AddCustomEvent(131072, Full("/photo/events-" + flagShare), Json::Value(n));
      } else {
        const bool set = pick(2) != 0;
        if ((ok = StatusMgr::ShareSetNeedReindex(flagShare, set))) report["needReindex"] = set;
      }
      if (!ok && !(lockable && ErrorHandler::GetError() == FILEINDEX_ERR_LOCK))
        report["errors"].append(std::to_string(choice) + ": " + std::to_string(ErrorHandler::GetError()));
      report["succeeded"] = report["succeeded"].asInt() + (ok ? 1 : 0);
    }
    std::ofstream(ReportPath(flagShare)) << internal::JsonToString(report);
  }
  // Queries until told to stop (or the child's alarm): readers only ever see what a save left.
  void RunReader(int reader) {
    Json::Value errors(Json::arrayValue);
    auto fail = [&errors](const std::string& what) {
      if (errors.size() < 20) errors.append(what + ": " + std::to_string(ErrorHandler::GetError()));
    };
    while (!Exists(Rooted("/stop"))) {
      ErrorHandler::g_error_code = FILEINDEX_ERR_NONE;
      for (const std::string& file : {FolderConfPath(), StatusConfPath()}) {
        Json::Value doc;
        if (Exists(file) && !internal::JsonFromString(doc, ReadFile(file))) fail("torn " + file);
      }
      std::vector<Folder> folders;
      if (!IndexMgr::List(folders) || folders.size() < 2) fail("IndexMgr::List");
      Json::Value got;  // Get waits on folder.conf's lock and may give up with code 9
      if (IndexMgr::Get(got, "/video/base") ? got["name"] != "base" : ErrorHandler::GetError() != 9)
        fail("Get");
    }
    std::ofstream(ReportPath("r" + std::to_string(reader))) << internal::JsonToString(errors);
  }
  std::vector<pid_t> pids_;
};

TEST_F(ConcurrencyTest, WritersAndReadersInSeveralProcesses) {
  // Children fork before the fake daemon's thread exists, then wait at a gate until it listens.
  int gate[2];
  ASSERT_EQ(::pipe2(gate, O_CLOEXEC), 0);
  for (int i = 0; i < kReaders + kWriters; ++i) {
    pid_t pid = ::fork();
    if (pid == 0) {
      ::prctl(PR_SET_PDEATHSIG, SIGKILL), ::alarm(90);
      std::srand(static_cast<unsigned>(::getpid()));  // own lock back-off sleeps
      ::close(gate[1]);
      for (char c; ::read(gate[0], &c, 1) < 0 && errno == EINTR;) continue;
      i < kReaders ? RunReader(i) : RunWriter(i - kReaders);
      ::_exit(0);
    }
    ASSERT_GT(pid, 0);
    pids_.push_back(pid);
  }
  StartDaemon();
  ::close(gate[1]), ::close(gate[0]);
  for (int i = kReaders; i < kReaders + kWriters; ++i) EXPECT_EQ(Wait(i), 0) << "writer " << i;
  WriteFile(Rooted("/stop"), "");
  for (int i = 0; i < kReaders; ++i) {
    EXPECT_EQ(Wait(i), 0) << "reader " << i;
    EXPECT_EQ(ReadJson(ReportPath("r" + std::to_string(i))), Json::Value(Json::arrayValue)) << "reader " << i;
  }
  // folder.conf and status.conf hold exactly what each writer's successful calls left.
  std::set<std::string> expected{"/photo/base", "/video/base"};
  Json::Value status = ReadJson(StatusConfPath());
  for (int w = 0; w < kWriters; ++w) {
    const std::string name = "w" + std::to_string(w);
    Json::Value report = ReadJson(ReportPath(name));
    ASSERT_GT(report["succeeded"].asInt(), kOpsPerWriter / 4) << name;  // contention starves no writer
    EXPECT_TRUE(report["errors"].empty()) << report["errors"];
    for (const std::string& path : report["folders"].getMemberNames())
      if (report["folders"][path].asBool()) expected.insert(path);
    EXPECT_EQ(status["need_reindex"].isMember(name), report["needReindex"].asBool()) << name;
  }
  EXPECT_EQ(FolderConf().getMemberNames(), std::vector<std::string>(expected.begin(), expected.end()));
  for (const char* share : kShares) {  // every queue line is one whole event
    const std::string queue = ReadFile(Queue(share));
    EXPECT_TRUE(queue.empty() || queue.back() == '\n') << share;
    for (const Json::Value& event : QueueEvents(share)) EXPECT_TRUE(event.isObject()) << event;
  }
}

}  // namespace
