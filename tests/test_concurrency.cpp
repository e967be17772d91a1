// Writers and readers in several processes at once: calls fail only with the lock's code 9, files stay whole.
#include <fileindex/error.h>
#include <fileindex/index_mgr.h>
#include <fileindex/status_mgr.h>
#include <fileindex/utils.h>
#include <signal.h>
#include <sys/prctl.h>
#include <sys/wait.h>
#include <unistd.h>

#include <cstdlib>
#include <random>
#include <set>

#include "internal/json_io.h"
#include "support/index_mgr_test.h"

using namespace TAVO::FILEINDEX;

const int kWriters = 4, kReaders = 2, kOpsPerWriter = 400;
const char* const kShares[] = {"photo", "video"};

class ConcurrencyTest : public IndexMgrTest {
 protected:
  // Mixed calls on the writer's own folders, share flag and queue; the report records what each
  // successful call left. A failure must carry code 9 where a lock is taken (not for events).
  void RunWriter(const std::string& name, unsigned seed) {
    std::mt19937 rng(seed);
    auto pick = [&rng](int n) { return static_cast<int>(rng() % static_cast<unsigned>(n)); };
    Json::Value report(Json::objectValue);
    for (int n = 0; n < kOpsPerWriter; ++n) {
      const int op = pick(4);
      const std::string path = "/" + std::string(kShares[n % 2]) + "/" + name + "-" + std::to_string(pick(4));
      const bool coin = pick(2) != 0;
      ErrorHandler::SetError(FILEINDEX_ERR_NONE);
      const auto records = Array({Record(path, "x", pick(2), pick(2), pick(2), pick(2))});
      const bool ok = op == 0   ? (coin ? IndexMgr::Upsert(records) : IndexMgr::Set(records))
                      : op == 1 ? IndexMgr::Delete(Array({Json::Value(path)}))
                      : op == 2 ? AddCustomEvent(131072, Full("/photo/events-" + name), Json::Value(n))
                                : StatusMgr::ShareSetNeedReindex(name, coin);
      if (ok && op < 2) report["folders"][path] = op == 0;
      if (ok && op == 3) report["needReindex"] = coin;
      if (!ok && (op == 2 || ErrorHandler::GetError() != FILEINDEX_ERR_LOCK))
        report["errors"].append(std::to_string(op) + ": " + std::to_string(ErrorHandler::GetError()));
      report["succeeded"] = report["succeeded"].asInt() + ok;
    }
    WriteFile(Rooted("/report-" + name), internal::JsonToString(report));
  }
  // Queries until told to stop, reporting the first thing seen wrong: readers only ever see what
  // a save left, and Get, which waits on folder.conf's lock, gives up only with code 9.
  void RunReader(const std::string& name) {
    std::string error;
    while (error.empty() && !Exists(Rooted("/stop"))) {
      ErrorHandler::SetError(FILEINDEX_ERR_NONE);
      Json::Value doc;
      for (const std::string& file : {FolderConfPath(), StatusConfPath()})
        if (Exists(file) && !internal::JsonFromString(doc, ReadFile(file))) error = "torn " + file;
      std::vector<Folder> folders;
      if (!IndexMgr::List(folders) || folders.size() < 2) error += " List";
      if (IndexMgr::Get(doc, "/video/base") ? doc["name"] != "base" : ErrorHandler::GetError() != 9)
        error += " Get " + std::to_string(ErrorHandler::GetError());
    }
    WriteFile(Rooted("/report-" + name), error.empty() ? "clean" : error);
  }
};

TEST_F(ConcurrencyTest, WritersAndReadersInSeveralProcesses) {
  for (const char* share : kShares) AddShare(share);
  // Folders nobody deletes: no share is ever cleaned up and readers always find something.
  WriteFolders({Record("/photo/base", "base", 1, 1, 1, 1), Record("/video/base", "base", 1, 1, 1, 1)});
  // Children fork before the fake daemon's thread exists, wait until it listens, die with the test.
  std::vector<pid_t> pids;  // the writers, then the readers
  for (int i = 0; i < kWriters + kReaders; ++i) {
    const pid_t pid = ::fork();
    if (pid == 0) {
      ::prctl(PR_SET_PDEATHSIG, SIGKILL);
      std::srand(static_cast<unsigned>(::getpid()));  // own lock back-off sleeps
      while (!Exists(Rooted("/go"))) ::usleep(1000);
      const std::string name = (i < kWriters ? "w" : "r") + std::to_string(i);
      i < kWriters ? RunWriter(name, 1000 + i) : RunReader(name);
      ::_exit(0);
    }
    ASSERT_GT(pid, 0);
    pids.push_back(pid);
  }
  StartDaemon();
  WriteFile(Rooted("/go"), "");
  for (int i = 0; i < kWriters; ++i) ::waitpid(pids[i], nullptr, 0);
  WriteFile(Rooted("/stop"), "");
  for (int i = kWriters; i < kWriters + kReaders; ++i) {
    ::waitpid(pids[i], nullptr, 0);
    EXPECT_EQ(ReadFile(Rooted("/report-r" + std::to_string(i))), "clean");
  }
  // folder.conf and status.conf hold exactly what each writer's successful calls left.
  std::set<std::string> expected{"/photo/base", "/video/base"};
  for (int i = 0; i < kWriters; ++i) {
    const std::string name = "w" + std::to_string(i);
    const Json::Value report = ReadJson(Rooted("/report-" + name));
    ASSERT_GT(report["succeeded"].asInt(), kOpsPerWriter / 4) << name;  // contention starves no writer
    EXPECT_TRUE(report["errors"].empty()) << report["errors"];
    for (const std::string& path : report["folders"].getMemberNames())
      if (report["folders"][path].asBool()) expected.insert(path);
    EXPECT_EQ(ReadJson(StatusConfPath())["need_reindex"].isMember(name), report["needReindex"].asBool());
  }
  EXPECT_EQ(FolderConf().getMemberNames(), std::vector<std::string>(expected.begin(), expected.end()));
  const std::string queue = ReadFile(Queue("photo"));  // every line one whole event
  EXPECT_TRUE(queue.empty() || queue.back() == '\n');
  for (const Json::Value& event : QueueEvents("photo")) EXPECT_TRUE(event.isObject()) << event;
}
