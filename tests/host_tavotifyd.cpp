// tavotifyd end to end: the real binary over a temporary system root, watch lists written by
// the host platform's MonitorQueue, and the queue read back with the consumers' line parser.
#include <fcntl.h>
#include <sys/file.h>
#include <sys/stat.h>
#include <tavo/tavotifyd.h>

#include "host_support.h"
#include "queue_events.h"

namespace fs = std::filesystem;
using namespace fileindex_queue;
using host_test::ReadFile;
using host_test::WriteFile;

namespace {
const std::string kDaemon = FILEINDEX_BINARY_DIR "/daemons/tavotifyd/tavotifyd";
bool WaitUntil(const std::function<bool()>& done, int millis = 3000) {
  return host_test::WaitUntil(done, std::chrono::milliseconds(millis));
}

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
  // Every run ends as the service manager ends it, and must end cleanly (under the
  // sanitizers too: their reports go to the daemon's log).
  void TearDown() override {
    if (pid_ > 0) {
      EXPECT_EQ(Stop(), 0) << Log();
    }
    if (pid_ > 0) ::kill(pid_, SIGKILL), ::waitpid(pid_, nullptr, 0);
    EXPECT_FALSE(Logged("Sanitizer")) << Log();
    EXPECT_FALSE(Logged("runtime error")) << Log();
    ::unsetenv("FILEINDEX_SYSROOT");
    fs::remove_all(root_);
  }
  // The list of queue_ through the platform's own writer; no folders watches nothing.
  void SetList(const std::vector<std::string>& folders) {
    Json::Value config;
    config["queue"] = queue_;
    config["config"] = Json::Value(Json::arrayValue);
    for (const std::string& folder : folders) {
      Json::Value& entry = config["config"].append(Json::Value());
      entry["path"] = folder;
      entry["mask"] = 65486;
      entry["ignore"].append("@eaDir");
    }
    ASSERT_EQ(TAVO::TAVOTIFYD::MonitorQueue::Upsert(TAVO::TAVOTIFYD::MonitorQueue(config), "fileindex",
                                                    TAVO::TAVOTIFYD::MONITOR_QUEUE_TYPE_FILE),
              1);
  }
  // Runs the daemon (through `wrapper`, a command that ends by exec'ing its arguments) as
  // this process's child pid_, and waits until it watches.
  void Start(const std::string& wrapper = "", const std::string& options = "") {
    pid_ = ::fork();
    ASSERT_GE(pid_, 0);
    if (pid_ == 0) {
      int log = ::open((root_ + "/daemon.log").c_str(), O_WRONLY | O_CREAT | O_APPEND | O_CLOEXEC, 0644);
      ::dup2(log, 1), ::dup2(log, 2);
      const std::string command = "exec " + wrapper + " \"$0\" --sysroot \"$1\" --foreground " + options;
      ::execl("/bin/sh", "sh", "-c", command.c_str(), kDaemon.c_str(), root_.c_str(), nullptr);
      ::_exit(127);
    }
    ASSERT_TRUE(WaitUntil([&] { return Logged("started:"); }, 10000)) << Log();
    // Folders listed before the start are reindexed once; the cases look at what follows.
    if (Logged("watched before this start")) {
      ASSERT_TRUE(WaitUntil([&] { return !Events().empty(); }, 5000)) << Log();
      for (const QueueEvent& event : Events()) EXPECT_EQ(event.code, kReindex) << event.path;
      fs::remove(queue_);
    }
  }
  int Stop() {
    ::kill(pid_, SIGTERM);
    int status = -1;
    bool exited = WaitUntil([&] { return ::waitpid(pid_, &status, WNOHANG) == pid_; }, 5000);
    EXPECT_TRUE(exited) << "no exit within 5 s of SIGTERM";
    if (exited) pid_ = -1;
    return exited && WIFEXITED(status) ? WEXITSTATUS(status) : -1;
  }
  std::string Log() { return ReadFile(root_ + "/daemon.log"); }
  bool Logged(const std::string& text) { return Log().find(text) != std::string::npos; }
  // Read without the queue's lock, so a line being written may show in part: only whole lines count.
  std::vector<QueueEvent> Events() {
    std::vector<QueueEvent> events;
    const std::string text = ReadFile(queue_);
    for (size_t start = 0, end; (end = text.find('\n', start)) != std::string::npos; start = end + 1)
      EXPECT_TRUE(ParseQueueLine(text.data() + start, end - start, events.emplace_back()))
          << text.substr(start, end - start);
    return events;
  }
  size_t Count(std::uint32_t code, const std::string& path, const std::string& pathOld = "") {
    // Parsing a long queue on every poll is slow; a path not even in the text is not there.
    if (ReadFile(queue_).find('"' + path + '"') == std::string::npos) return 0;
    size_t count = 0;
    for (const QueueEvent& event : Events())
      count += event.code == code && event.path == path && event.pathOld == pathOld;
    return count;
  }
  bool WaitFor(std::uint32_t code, const std::string& path, int millis = 3000) {
    return WaitUntil([&] { return Count(code, path) > 0; }, millis);
  }
  int LockQueue() {
    int lock = ::open(queue_.c_str(), O_RDWR | O_CREAT | O_CLOEXEC, 0600);
    EXPECT_EQ(::flock(lock, LOCK_EX), 0);
    return lock;
  }

  std::string root_, share_, queue_;
  pid_t pid_ = -1;
};

// Files created, written, changed and removed; IN_MODIFY is not a line; "@eaDir" is neither
// watched nor reported; a rename is one line; directories renamed or moved in keep being
// followed under their new paths, a tree moved in is reported entry by entry, and a move
// out is a deletion. A single instance, and SIGTERM stops it cleanly.
TEST_F(TavotifydTest, ReportsFileEventsRenamesAndMovedTrees) {
  fs::create_directories(share_ + "/docs/sub/deep");
  WriteFile(root_ + "/outside/tree/deep/b", "b");
  SetList({share_});
  Start();
  // Changes made while no daemon watched are caught by reindexing what was listed before.
  EXPECT_TRUE(Logged("1 folders watched before this start are reindexed")) << Log();
  EXPECT_EQ(ReadFile(root_ + "/var/run/tavotifyd.pid"), std::to_string(pid_) + "\n");
  int second = std::system((kDaemon + " --sysroot " + root_ + " 2>" + root_ + "/second.err").c_str());
  EXPECT_EQ(WEXITSTATUS(second), 1);
  EXPECT_NE(ReadFile(root_ + "/second.err").find("already running (pid " + std::to_string(pid_) + ")"),
            std::string::npos);

  const std::string file = share_ + "/docs/a.txt";
  {
    std::ofstream out(file);
    for (int i = 0; i < 3; ++i) out << std::string(100000, 'x') << std::flush;  // several write()s
  }
  WriteFile(share_ + "/docs/@eaDir/inner/thumb", "x");
  WriteFile(share_ + "/@eaDir/other", "x");
  ASSERT_EQ(::chmod(file.c_str(), 0600), 0);
  ASSERT_EQ(::unlink(file.c_str()), 0);
  WriteFile(share_ + "/docs/old.txt", "x");
  fs::rename(share_ + "/docs/old.txt", share_ + "/docs/new.txt");
  fs::rename(share_ + "/docs/sub", share_ + "/moved");
  fs::rename(root_ + "/outside/tree", share_ + "/tree");
  ASSERT_TRUE(WaitFor(kCreated, share_ + "/tree/deep/b")) << ReadFile(queue_);
  WriteFile(share_ + "/moved/deep/c", "c");
  WriteFile(share_ + "/tree/deep/d", "d");
  fs::rename(share_ + "/docs/new.txt", root_ + "/outside/new.txt");
  ASSERT_TRUE(WaitFor(kDeleted, share_ + "/docs/new.txt")) << ReadFile(queue_);

  for (std::uint32_t code : {kCreated, kModified, kAttributes, kDeleted})
    EXPECT_EQ(Count(code, file), 1u) << code;
  EXPECT_EQ(Count(kRenamed, share_ + "/docs/new.txt", share_ + "/docs/old.txt"), 1u);
  EXPECT_EQ(Count(kDeleted, share_ + "/docs/old.txt"), 0u);
  EXPECT_EQ(Count(kRenamed, share_ + "/moved", share_ + "/docs/sub"), 1u);
  for (const char* path : {"/tree", "/tree/deep", "/tree/deep/b", "/moved/deep/c", "/tree/deep/d"})
    EXPECT_GE(Count(kCreated, share_ + path), 1u) << path << "\n" << ReadFile(queue_);
  const std::string queue = ReadFile(queue_);
  EXPECT_EQ(queue.find(share_ + "/docs/sub/deep/c"), std::string::npos) << "stale path";
  EXPECT_EQ(queue.find("@eaDir"), std::string::npos) << queue;
  EXPECT_EQ(Stop(), 0);
  EXPECT_TRUE(Logged("stopped")) << Log();
}

// Lists added, changed (a nested folder: still one line per event) and removed while running
// take effect within a second.
TEST_F(TavotifydTest, FollowsWatchListChanges) {
  const std::string second = root_ + "/volume1/second";
  fs::create_directories(second);
  Start();
  SetList({share_});
  std::this_thread::sleep_for(std::chrono::seconds(1));
  WriteFile(share_ + "/docs/one", "1");
  EXPECT_TRUE(WaitFor(kCreated, share_ + "/docs/one")) << Log();

  SetList({share_, share_ + "/docs", second});
  std::this_thread::sleep_for(std::chrono::seconds(1));
  WriteFile(second + "/two", "2");
  WriteFile(share_ + "/docs/three", "3");
  EXPECT_TRUE(WaitFor(kCreated, second + "/two")) << Log();
  EXPECT_TRUE(WaitFor(kModified, share_ + "/docs/three"));
  EXPECT_EQ(Count(kCreated, share_ + "/docs/three"), 1u);

  ASSERT_EQ(
      TAVO::TAVOTIFYD::MonitorQueue::Delete(queue_, "fileindex", TAVO::TAVOTIFYD::MONITOR_QUEUE_TYPE_FILE),
      1);
  std::this_thread::sleep_for(std::chrono::seconds(1));
  WriteFile(share_ + "/docs/four", "4");
  EXPECT_FALSE(WaitFor(kCreated, share_ + "/docs/four", 500)) << "still watched";
}

// While another holder keeps the queue locked nothing is written, and while the queue
// cannot be written at all (its directory is gone) the reason is logged; once either
// clears, every line arrives, once.
TEST_F(TavotifydTest, BusyOrFailingQueueLosesNothing) {
  SetList({share_});
  Start();
  int lock = LockQueue();
  const int kFiles = 200;
  for (int i = 0; i < kFiles; ++i) WriteFile(share_ + "/docs/f" + std::to_string(i), "x");
  std::this_thread::sleep_for(std::chrono::milliseconds(700));
  EXPECT_EQ(ReadFile(queue_), "");
  ::close(lock);
  ASSERT_TRUE(WaitFor(kModified, share_ + "/docs/f" + std::to_string(kFiles - 1)));
  for (int i = 0; i < kFiles; ++i) {
    ASSERT_EQ(Count(kCreated, share_ + "/docs/f" + std::to_string(i)), 1u) << i;
    ASSERT_EQ(Count(kModified, share_ + "/docs/f" + std::to_string(i)), 1u) << i;
  }

  fs::remove_all(share_ + "/@eaDir");
  WriteFile(share_ + "/docs/while-failing", "x");
  ASSERT_TRUE(WaitUntil([&] { return Logged("No such file or directory; keeping"); })) << Log();
  fs::create_directories(share_ + "/@eaDir");
  EXPECT_TRUE(WaitFor(kModified, share_ + "/docs/while-failing"));
  EXPECT_EQ(Count(kCreated, share_ + "/docs/while-failing"), 1u);
}

// Past the bound on held lines, a queue's lines are replaced by a reindex of its folder.
TEST_F(TavotifydTest, HeldLinesPastTheBoundBecomeAReindex) {
  SetList({share_});
  Start("", "--max-held-lines 50");
  int lock = LockQueue();
  for (int i = 0; i < 100; ++i) WriteFile(share_ + "/docs/f" + std::to_string(i), "x");
  ASSERT_TRUE(WaitUntil([&] { return Logged("replacing them by 1 reindex lines"); })) << Log();
  ::close(lock);
  ASSERT_TRUE(WaitFor(kReindex, share_));
  EXPECT_EQ(Count(kCreated, share_ + "/docs/f99"), 0u);
  EXPECT_LE(Events().size(), 51u);
}

// Lost events (the kernel's event queue overflowed while the daemon was stopped) ask for a
// reindex of the folder, and the daemon goes on watching.
TEST_F(TavotifydTest, QueueOverflowAsksForReindex) {
  const int maxQueued = std::atoi(ReadFile("/proc/sys/fs/inotify/max_queued_events").c_str());
  if (maxQueued <= 0 || maxQueued > 200000) GTEST_SKIP() << "max_queued_events is " << maxQueued;
  SetList({share_});
  Start();
  ASSERT_EQ(::kill(pid_, SIGSTOP), 0);
  for (int i = 0; i < maxQueued / 2 + 1000; ++i) {  // two events a file (created, closed after writing)
    int fd = ::open((share_ + "/docs/n" + std::to_string(i)).c_str(), O_WRONLY | O_CREAT | O_CLOEXEC, 0644);
    ASSERT_GE(fd, 0);
    ::close(fd);
  }
  ASSERT_EQ(::kill(pid_, SIGCONT), 0);
  EXPECT_TRUE(WaitFor(kReindex, share_, 10000)) << Log();
  EXPECT_TRUE(Logged("max_queued_events")) << Log();
  WriteFile(share_ + "/docs/after", "x");
  EXPECT_TRUE(WaitFor(kCreated, share_ + "/docs/after"));
}

// Directories beyond the per-user watch limit (lowered in a user namespace of its own) are
// logged with the setting to raise and ask for a reindex of their folder.
TEST_F(TavotifydTest, WatchLimitAsksForReindex) {
  const std::string setLimit = "echo 7 >/proc/sys/user/max_inotify_watches";
  if (std::system(("unshare -U -r sh -c '" + setLimit + "' 2>/dev/null").c_str()) != 0)
    GTEST_SKIP() << "cannot lower the inotify watch limit in a user namespace here";
  for (int i = 0; i < 6; ++i) fs::create_directories(share_ + "/docs/d" + std::to_string(i));
  // The list tree takes 5 watches (run/tavotifyd down to the list's directory), the folder,
  // listed once the daemon runs, would take 8.
  SetList({});
  Start("unshare -U -r sh -c '" + setLimit + " && exec \"$0\" \"$@\"'");
  SetList({share_});
  EXPECT_TRUE(WaitFor(kReindex, share_)) << Log();
  EXPECT_TRUE(Logged("fs.inotify.max_user_watches")) << Log();
}

}  // namespace
