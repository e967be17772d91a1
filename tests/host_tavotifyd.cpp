// tavotifyd end to end: the real binary over a temporary system root, watch lists written by
// the host platform's MonitorQueue, and the queue read back with the consumers' line parser.
#include <fcntl.h>
#include <spawn.h>
#include <sys/file.h>
#include <sys/stat.h>
#include <tavo/tavotifyd.h>

#include "host_support.h"
#include "queue_events.h"

namespace fs = std::filesystem;
using namespace std::chrono_literals;
using namespace fileindex_queue;
using namespace host_test;
using namespace TAVO::TAVOTIFYD;

namespace {
const std::string kDaemon = FILEINDEX_BINARY_DIR "/daemons/tavotifyd/tavotifyd";

class TavotifydTest : public ::testing::Test {
 protected:
  void SetUp() override {
    char pattern[] = "/tmp/host_tavotifyd.XXXXXX";
    ASSERT_NE(::mkdtemp(pattern), nullptr);
    root_ = fs::canonical(pattern).string();
    share_ = root_ + "/volume1/share";
    queue_ = share_ + "/@eaDir/TAVO@file_index_queue";
    ::setenv("FILEINDEX_SYSROOT", root_.c_str(), 1);  // where MonitorQueue writes the lists
    for (const char* dir : {"/var/run", "/volume1/share/@eaDir", "/volume1/share/docs", "/outside"})
      fs::create_directories(root_ + dir);
  }
  // SIGTERM, as the service manager sends it, ends every run cleanly: sanitizers log to the daemon's log.
  void TearDown() override {
    if (pid_ > 0) {
      int status = -1;
      ::kill(pid_, SIGTERM);
      if (!WaitUntil([&] { return ::waitpid(pid_, &status, WNOHANG) == pid_; }, 5s)) ::kill(pid_, SIGKILL);
      EXPECT_TRUE(WIFEXITED(status) && WEXITSTATUS(status) == 0) << status << Log();
    }
    EXPECT_FALSE(Logged("Sanitizer") || Logged("runtime error")) << Log();
    ::unsetenv("FILEINDEX_SYSROOT");
    fs::remove_all(root_);
  }
  // The list of queue_ through the platform's own writer; no folders watches nothing.
  void SetList(const std::vector<std::string>& folders) {
    Json::Value config = ParseJson(R"({"config": []})");
    config["queue"] = queue_;
    for (const std::string& folder : folders)
      config["config"].append(ParseJson(R"({"mask": 65486, "ignore": ["@eaDir"]})"))["path"] = folder;
    ASSERT_EQ(MonitorQueue::Upsert(MonitorQueue(config), "fileindex", MONITOR_QUEUE_TYPE_FILE), 1);
  }
  // Runs the daemon as pid_ (through `wrapper`, which ends by exec'ing its arguments).
  void Start(const std::string& wrapper = "", const std::string& options = "") {
    const std::string command =
        "exec " + wrapper + " \"$0\" --sysroot \"$1\" --foreground " + options + " >>\"$1/daemon.log\" 2>&1";
    const char* argv[] = {"sh", "-c", command.c_str(), kDaemon.c_str(), root_.c_str(), nullptr};
    ASSERT_EQ(::posix_spawn(&pid_, "/bin/sh", nullptr, nullptr, const_cast<char**>(argv), environ), 0);
    ASSERT_TRUE(WaitUntil([&] { return Logged("started:"); }, 10s)) << Log();
    // Folders listed before the start are reindexed once; the cases look at what follows.
    if (Logged("watched before this start")) {
      ASSERT_TRUE(WaitUntil([&] { return !Events().empty(); }, 5s)) << Log();
      for (const QueueEvent& event : Events()) EXPECT_EQ(event.code, kReindex) << event.path;
      fs::remove(queue_);
    }
  }
  std::string Log() { return ReadFile(root_ + "/daemon.log"); }
  bool Logged(const std::string& text) { return Log().find(text) != std::string::npos; }
  // Read without the queue's lock, so a line being written may show in part: only whole lines count.
  std::vector<QueueEvent> Events() {
    std::vector<QueueEvent> events;
    std::istringstream text(ReadFile(queue_));
    for (std::string line; std::getline(text, line) && !text.eof();)
      EXPECT_TRUE(ParseQueueLine(line.data(), line.size(), events.emplace_back())) << line;
    return events;
  }
  // Parsing a long queue on every poll is slow: a path not even in the text is not there.
  size_t Count(std::uint32_t code, const std::string& path, const std::string& pathOld = "") {
    if (ReadFile(queue_).find('"' + path + '"') == std::string::npos) return 0;
    size_t count = 0;
    for (const QueueEvent& event : Events())
      count += event.code == code && event.path == path && event.pathOld == pathOld;
    return count;
  }
  bool WaitFor(std::uint32_t code, const std::string& path, std::chrono::milliseconds limit = 3s) {
    return WaitUntil([&] { return Count(code, path) > 0; }, limit);
  }

  std::string root_, share_, queue_;
  pid_t pid_ = -1;
};

// File events (IN_MODIFY is not a line), none of "@eaDir"; a renamed directory (one line) and a tree
// moved in (entry by entry) are followed; a move out is a deletion; a reindex at start; one instance.
TEST_F(TavotifydTest, ReportsFileEventsRenamesAndMovedTrees) {
  fs::create_directories(share_ + "/docs/sub/deep");
  WriteFile(root_ + "/outside/tree/deep/b", "b");
  SetList({share_});
  Start();
  EXPECT_TRUE(Logged("1 folders watched before this start are reindexed")) << Log();
  EXPECT_EQ(WEXITSTATUS(std::system((kDaemon + " --sysroot " + root_ + " 2>" + root_ + "/err").c_str())), 1);
  EXPECT_NE(ReadFile(root_ + "/err").find("already running (pid " + std::to_string(pid_)), std::string::npos);

  const std::string file = share_ + "/docs/a.txt";
  int fd = ::open(file.c_str(), O_WRONLY | O_CREAT | O_CLOEXEC, 0644);
  for (int i = 0; i < 3; ++i) ASSERT_EQ(::write(fd, "x", 1), 1);
  ::close(fd);
  WriteFile(share_ + "/docs/@eaDir/inner/thumb", "x");
  ASSERT_EQ(::chmod(file.c_str(), 0600), 0);
  ASSERT_EQ(::unlink(file.c_str()), 0);
  WriteFile(share_ + "/docs/out.txt", "x");
  fs::rename(share_ + "/docs/sub", share_ + "/moved");
  fs::rename(root_ + "/outside/tree", share_ + "/tree");
  ASSERT_TRUE(WaitFor(kCreated, share_ + "/tree/deep/b")) << ReadFile(queue_);
  WriteFile(share_ + "/moved/deep/c", "c");
  WriteFile(share_ + "/tree/deep/c", "c");
  fs::rename(share_ + "/docs/out.txt", root_ + "/outside/out.txt");
  ASSERT_TRUE(WaitFor(kDeleted, share_ + "/docs/out.txt")) << ReadFile(queue_);

  for (std::uint32_t code : {kCreated, kModified, kAttributes, kDeleted})
    EXPECT_EQ(Count(code, file), 1u) << code;
  EXPECT_EQ(Count(kRenamed, share_ + "/moved", share_ + "/docs/sub"), 1u);
  for (const char* path : {"/tree", "/tree/deep", "/tree/deep/b", "/tree/deep/c", "/moved/deep/c"})
    EXPECT_GE(Count(kCreated, share_ + path), 1u) << path << "\n" << ReadFile(queue_);
  EXPECT_EQ(ReadFile(queue_).find("@eaDir"), std::string::npos) << ReadFile(queue_);
}

// While the queue is locked nothing is written, then every line once. While it cannot be written
// the reason is logged, and past the bound the held lines become one reindex of the folder.
TEST_F(TavotifydTest, BusyOrFailingQueueLosesNothing) {
  SetList({share_});
  Start("", "--max-held-lines 500");
  int lock = ::open(queue_.c_str(), O_RDWR | O_CREAT | O_CLOEXEC, 0600);
  ASSERT_EQ(::flock(lock, LOCK_EX), 0);
  for (int i = 0; i < 200; ++i) WriteFile(share_ + "/docs/f" + std::to_string(i), "x");
  std::this_thread::sleep_for(700ms);
  EXPECT_EQ(ReadFile(queue_), "");
  ::close(lock);
  ASSERT_TRUE(WaitFor(kModified, share_ + "/docs/f199"));
  EXPECT_EQ(Events().size(), 400u);

  fs::remove_all(share_ + "/@eaDir");
  ASSERT_EQ(::kill(pid_, SIGSTOP), 0);  // so that it reads all the events at once
  for (int i = 0; i < 300; ++i) WriteFile(share_ + "/docs/g" + std::to_string(i), "x");
  ASSERT_EQ(::kill(pid_, SIGCONT), 0);
  ASSERT_TRUE(WaitUntil([&] { return Logged("No such file or directory; keeping 1 lines"); }, 3s)) << Log();
  EXPECT_TRUE(Logged("500 lines held (the queue could not be written); replacing them by 1 reindex"));
  fs::create_directories(share_ + "/@eaDir");
  ASSERT_TRUE(WaitFor(kReindex, share_));
  EXPECT_EQ(Events().size(), 1u) << ReadFile(queue_);
}

// Lost events (the kernel's event queue overflowed while the daemon was stopped) make a reindex.
TEST_F(TavotifydTest, QueueOverflowAsksForReindex) {
  const int maxQueued = std::atoi(ReadFile("/proc/sys/fs/inotify/max_queued_events").c_str());
  if (maxQueued <= 0 || maxQueued > 200000) GTEST_SKIP() << "max_queued_events is " << maxQueued;
  SetList({share_});
  Start();
  ASSERT_EQ(::kill(pid_, SIGSTOP), 0);
  for (int i = 0; i < maxQueued / 2 + 1000; ++i)  // two events a file: created, closed after writing
    std::ofstream(share_ + "/docs/n" + std::to_string(i));
  ASSERT_EQ(::kill(pid_, SIGCONT), 0);
  EXPECT_TRUE(WaitFor(kReindex, share_, 10s)) << Log();
  EXPECT_TRUE(Logged("queue overflow; see fs.inotify.max_queued_events")) << Log();
}

// Directories past the watch limit (7, in a user namespace: the list tree takes 5) make a reindex.
TEST_F(TavotifydTest, WatchLimitAsksForReindex) {
  const std::string setLimit = "echo 7 >/proc/sys/user/max_inotify_watches";
  if (std::system(("unshare -U -r sh -c '" + setLimit + "' 2>/dev/null").c_str()) != 0)
    GTEST_SKIP() << "cannot lower the inotify watch limit in a user namespace here";
  for (int i = 0; i < 6; ++i) fs::create_directories(share_ + "/docs/d" + std::to_string(i));
  SetList({});
  Start("unshare -U -r sh -c '" + setLimit + " && exec \"$0\" \"$@\"'");
  SetList({share_});
  EXPECT_TRUE(WaitFor(kReindex, share_)) << Log();
  EXPECT_TRUE(Logged("the inotify watch limit is reached (raise fs.inotify.max_user_watches)")) << Log();
}

}  // namespace
