// The indexing service end to end: fileindexd and tavotifyd started by a sandbox's service
// hooks, driven through fileindexctl, the command socket and the queue files, and checked
// against the share's index database and the disk.
#include <fcntl.h>
#include <grp.h>
#include <sqlite3.h>
#include <sys/socket.h>
#include <sys/stat.h>
#include <sys/un.h>

#include <atomic>
#include <cstring>
#include <map>
#include <memory>
#include <random>
#include <set>

#include "host_support.h"

namespace fs = std::filesystem;
using namespace std::chrono_literals;
using namespace host_test;
using Clock = std::chrono::steady_clock;

namespace {

// Generous, for the sanitizer build; a healthy daemon answers in a fraction of it.
bool WaitUntil(const std::function<bool()>& ready, std::chrono::milliseconds limit = 20s) {
  return host_test::WaitUntil(ready, limit);
}

std::size_t Count(const std::string& text, const std::string& what) {
  std::size_t count = 0;
  for (std::size_t at = text.find(what); at != std::string::npos; at = text.find(what, at + 1)) ++count;
  return count;
}

// A connected socket, or -1 with errno kept.
int Connect(const std::string& path) {
  sockaddr_un address{};
  address.sun_family = AF_UNIX;
  std::strncpy(address.sun_path, path.c_str(), sizeof(address.sun_path) - 1);
  int fd = ::socket(AF_UNIX, SOCK_STREAM | SOCK_CLOEXEC, 0);
  if (fd < 0 || ::connect(fd, reinterpret_cast<sockaddr*>(&address), sizeof(address)) == 0) return fd;
  int error = errno;
  ::close(fd);
  errno = error;
  return -1;
}

std::string LengthField(std::uint32_t length) { return std::string(reinterpret_cast<char*>(&length), 4); }

class ServiceTest : public SandboxTest {
 protected:
  void SetUp() override {
    InitSandbox("host_service", {});
    ::chmod(work_.c_str(), 0755);  // other users reach the socket and the index, as on a host
  }
  // Sanitizer builds report into the daemons' logs, some of it only at exit.
  void CheckLogs() override {
    for (const char* log : {"fileindexd.log", "tavotifyd.log"}) {
      std::string text = ReadFile(root_ + "/var/log/" + log);
      EXPECT_EQ(text.find("Sanitizer"), std::string::npos) << log << ":\n" << text;
      EXPECT_EQ(text.find("runtime error"), std::string::npos) << log << ":\n" << text;
    }
  }
  // The share paths that a search for words finds.
  std::set<std::string> Search(const std::string& words) {
    std::set<std::string> paths;
    const Json::Value result = RunJson({"search", "--limit", "100000", words});
    for (const Json::Value& hit : result["hits"]) paths.insert(hit["path"].asString());
    return paths;
  }
  bool Found(const std::string& words, const std::string& path) { return Search(words).count(path) > 0; }
  bool WaitFound(const std::string& words, const std::string& path, bool found = true) {
    return WaitUntil([&] { return Found(words, path) == found; });
  }
  bool Add(std::vector<std::string> args) {
    args.insert(args.begin(), {"folders", "add"});
    return Run(args).status == 0;
  }
  // The service has nothing left to do: status "finished", no queue and no ".tmp" companion.
  bool WaitIdle() {
    return WaitUntil([&] {
      for (const char* share : {"photo", "video"})
        if (fs::exists(Queue(share)) || fs::exists(Queue(share) + ".tmp")) return false;
      return RunJson({"status"})["status"] == "finished";
    });
  }
  std::string Share(const std::string& name) { return root_ + "/volume1/" + name; }
  std::string Queue(const std::string& share) { return Share(share) + "/@eaDir/TAVO@file_index_queue"; }
  std::string Database() { return Share("photo") + "/@eaDir/TAVO@.fileindexdb/index.sqlite3"; }
  std::string Log() { return ReadFile(root_ + "/var/log/fileindexd.log"); }
  int StartDaemon() { return std::system((root_ + "/etc/tavo/services/fileindexd start").c_str()); }
  void KillDaemon(int signal) {
    pid_t pid = DaemonPid("fileindexd");
    ASSERT_GT(pid, 0);
    ASSERT_EQ(::kill(pid, signal), 0);
    ASSERT_EQ(::waitpid(pid, nullptr, 0), pid);
  }

  // The photo share's index: path relative to the share (directories end in "/") -> governing folder.
  std::map<std::string, std::string> IndexEntries() {
    std::map<std::string, std::string> entries;
    sqlite3* db = nullptr;
    sqlite3_stmt* rows = nullptr;
    sqlite3_open_v2(Database().c_str(), &db, SQLITE_OPEN_READONLY, nullptr);  // none: empty
    const char* query =
        "SELECT ltrim(parent || '/' || name, '/') || iif(is_dir, '/', ''), folder"
        " FROM entries";
    sqlite3_prepare_v2(db, query, -1, &rows, nullptr);
    while (rows != nullptr && sqlite3_step(rows) == SQLITE_ROW)
      entries[reinterpret_cast<const char*>(sqlite3_column_text(rows, 0))] =
          reinterpret_cast<const char*>(sqlite3_column_text(rows, 1));
    sqlite3_finalize(rows);
    sqlite3_close(db);
    return entries;
  }
};

// Add, search, create, pause, resume, remove; then an inner folder governs its tree (photos
// off) until it is removed and the outer folder takes its files over.
TEST_F(ServiceTest, FoldersFollowTheFileSystemAndTheSettings) {
  ASSERT_TRUE(Add({"/photo/2019", "/photo/2020"}));
  ASSERT_TRUE(WaitIdle());
  EXPECT_EQ(Search("beach"), std::set<std::string>{"/photo/2019/beach.jpg"});
  WriteFile(Share("photo") + "/2019/sunset.jpg", "sun\n");
  auto created = Clock::now();
  ASSERT_TRUE(WaitFound("sunset", "/photo/2019/sunset.jpg"));
  EXPECT_LT(Clock::now() - created, 2s);

  ASSERT_EQ(Run({"pause", "0"}).status, 0);
  WriteFile(Share("photo") + "/2020/paused.jpg", "p\n");
  ASSERT_TRUE(WaitUntil([&] { return fs::exists(Queue("photo")); }));  // the event waits in the queue
  std::this_thread::sleep_for(300ms);
  EXPECT_FALSE(Found("paused", "/photo/2020/paused.jpg"));
  ASSERT_EQ(Run({"resume"}).status, 0);
  EXPECT_TRUE(WaitFound("paused", "/photo/2020/paused.jpg"));

  ASSERT_EQ(Run({"folders", "remove", "/photo/2020"}).status, 0);
  EXPECT_TRUE(WaitFound("city", "/photo/2020/city.jpg", false));
  EXPECT_TRUE(WaitIdle());
  for (const auto& entry : IndexEntries()) EXPECT_EQ(entry.first.rfind("2020", 0), std::string::npos);

  ASSERT_EQ(Run({"folders", "set", "/photo/2019", "--no-photo"}).status, 0);
  ASSERT_TRUE(WaitFound("beach", "/photo/2019/beach.jpg", false));
  ASSERT_TRUE(Add({"/photo"}));
  ASSERT_TRUE(WaitFound("city", "/photo/2020/city.jpg"));
  ASSERT_TRUE(WaitIdle());
  EXPECT_TRUE(Search("beach").empty());  // nor the recycle bin's or the snapshots'
  ASSERT_EQ(Run({"folders", "remove", "/photo/2019"}).status, 0);
  ASSERT_TRUE(WaitFound("beach", "/photo/2019/beach.jpg"));
  ASSERT_TRUE(WaitIdle());
  EXPECT_EQ(IndexEntries().at("2019/"), "");
}

// Killed again and again while it consumes a queue under a stream of changes, the daemon
// still ends with an index equal to the disk: no event lost, nothing stale.
TEST_F(ServiceTest, IndexEqualsDiskAfterRepeatedKillsUnderChanges) {
  const std::string top = Share("photo") + "/stress";
  const std::vector<std::string> extensions{".jpg", ".txt", ".mp3", ".mkv", ".dat"};
  auto path = [&](std::size_t k) {
    return top + "/d" + std::to_string(k % 6) + "/n" + std::to_string(k) + extensions[k % 5];
  };
  for (std::size_t k = 0; k < 300; ++k) WriteFile(path(k), "x\n");
  WriteFile(top + "/d0/@eaDir/thumb.jpg", "t\n");
  ASSERT_TRUE(Add({"/photo/stress", "--photo", "--document"}));
  ASSERT_TRUE(WaitIdle());

  std::atomic<bool> stop{false};
  std::thread writer([&] {
    std::mt19937 random(18);
    std::string lastDir;
    std::error_code ignored;  // what it picks may be gone already
    for (std::size_t n = 300; !stop; ++n, std::this_thread::sleep_for(2ms)) {
      const std::size_t op = random() % 5;
      if (op < 2) {
        WriteFile(path(n), "x\n");
      } else if (op == 2) {  // within or across directories, maybe to a kind switched off
        fs::rename(path(random() % n), path(n), ignored);
      } else if (op == 3) {
        fs::remove(path(random() % n), ignored);
      } else {  // a new directory with a file, and the one made before it moves with its files
        fs::rename(lastDir, top + "/m" + std::to_string(n), ignored);
        lastDir = top + "/n" + std::to_string(n);
        WriteFile(lastDir + "/f.jpg", "x\n");
      }
    }
  });
  std::shared_ptr<void> join(nullptr, [&](void*) {  // also when an assertion ends the test
    stop = true;
    writer.join();
  });

  std::mt19937 random(2019);
  const std::string inProgress = Queue("photo") + ".tmp";
  int killedWhileConsuming = 0;
  for (int kill = 0; kill < 15; ++kill) {
    if (kill == 0 || kill == 4) {  // a whole crawl queued too, to be cut short
      ASSERT_EQ(Run({"reindex", "/photo/stress"}).status, 0);
    }
    std::this_thread::sleep_for(std::chrono::milliseconds(20 + random() % 80));
    // Every other kill lands while a queue is being consumed; the others at any moment.
    for (auto end = Clock::now() + 300ms; kill % 2 == 0 && !fs::exists(inProgress) && Clock::now() < end;)
      std::this_thread::sleep_for(1ms);
    ASSERT_NO_FATAL_FAILURE(KillDaemon(SIGKILL));
    killedWhileConsuming += fs::exists(inProgress);
    std::this_thread::sleep_for(20ms);  // changes pile up in the queue meanwhile
    ASSERT_EQ(StartDaemon(), 0) << Log();
  }
  join.reset();
  ASSERT_TRUE(WaitIdle());
  EXPECT_GE(killedWhileConsuming, 4);
  // The disk: every directory and every file but audio and video, under the folder; not "@eaDir".
  std::map<std::string, std::string> disk{{"stress/", "stress"}};
  for (auto it = fs::recursive_directory_iterator(top); it != fs::recursive_directory_iterator(); ++it) {
    const std::string relative = it->path().lexically_relative(Share("photo")).string();
    const std::string extension = it->path().extension().string();
    if (it->path().filename() == "@eaDir")
      it.disable_recursion_pending();
    else if (it->is_directory())
      disk[relative + "/"] = "stress";
    else if (extension != ".mp3" && extension != ".mkv")
      disk[relative] = "stress";
  }
  EXPECT_EQ(IndexEntries(), disk);

  // An index found damaged at a start is set aside and the share indexed again.
  ASSERT_NO_FATAL_FAILURE(KillDaemon(SIGTERM));  // a clean stop folds the write-ahead log in
  WriteFile(Database(), std::string(8192, 'x'));
  ASSERT_EQ(StartDaemon(), 0) << Log();
  EXPECT_TRUE(WaitUntil([&] { return IndexEntries() == disk; }));
  EXPECT_NE(Log().find("share photo: its index was damaged"), std::string::npos) << Log();
}

// Malformed, oversized and torn lines are logged and skipped; the good lines around them are
// applied and the queue is finished.
TEST_F(ServiceTest, BadQueueLinesAreSkippedAndTheRestApplied) {
  ASSERT_TRUE(Add({"/photo/2019"}));
  ASSERT_TRUE(WaitIdle());
  ASSERT_EQ(Run({"sandbox", "stop"}).status, 0);
  // Made while nothing watches, and the daemon started without the notification daemon
  // (which reindexes on start): only the queue can tell it about them.
  const std::string dir = Share("photo") + "/2019";
  for (const char* name : {"first", "second", "third", "unqueued"})
    WriteFile(dir + "/" + name + ".jpg", "q\n");
  auto line = [&](const std::string& name) {
    return "{\"event\":1,\"path\":\"" + dir + "/" + name + ".jpg\",\"data\":null}\n";
  };
  const std::string lines = line("first") + "{\"event\":1,\"pa\n" + "{\"event\":\"x\",\"path\":7}\n" +
                            line("second") + "{\"event\":1,\"path\":\"" + std::string(300 * 1024, 'x') +
                            "\"}\n" + line("third") + "{\"event\":1,\"path\":\"" + dir;  // its writer died
  WriteFile(Queue("photo"), lines);
  ASSERT_EQ(std::system((FILEINDEX_BINARY_DIR "/daemons/fileindexd/fileindexd --sysroot " + Quote(root_) +
                         " --log-stderr </dev/null >>" + Quote(root_ + "/var/log/fileindexd.log") + " 2>&1 &")
                            .c_str()),
            0);
  ASSERT_TRUE(WaitIdle()) << Log();
  for (const char* name : {"first", "second", "third"})
    EXPECT_TRUE(Found(name, "/photo/2019/" + std::string(name) + ".jpg")) << name;
  EXPECT_TRUE(Search("unqueued").empty());
  const std::string log = Log();
  EXPECT_EQ(Count(log, "malformed line skipped"), 2u) << log;
  EXPECT_NE(log.find("line over"), std::string::npos) << log;
  EXPECT_NE(log.find("torn last line skipped"), std::string::npos) << log;
  EXPECT_EQ(::kill(DaemonPid("fileindexd"), 0), 0);
}

// Clients that lie about a frame's length, send garbage or nothing at all neither crash
// nor block the daemon: it keeps serving real commands meanwhile.
TEST_F(ServiceTest, HostileSocketClientsNeitherCrashNorBlockTheDaemon) {
  ASSERT_TRUE(Add({"/photo/2019"}));
  ASSERT_TRUE(WaitIdle());
  const pid_t pid = DaemonPid("fileindexd");
  const std::string socket = root_ + "/var/run/fileindexd.sock";
  const std::string stop = "{\"type\":\"delete_share_worker\",\"data\":{\"share_name\":\"photo\"}}";
  std::vector<int> held;
  for (const std::string& bytes :
       {LengthField(0x80000000u) + "{\"type\":\"pause\"",
        LengthField(1000) + "{\"type\":", LengthField(6) + "hello" + std::string(1, '\0'),
        LengthField(static_cast<std::uint32_t>(stop.size() + 1)) + stop}) {  // no terminating zero
    int fd = Connect(socket);
    ASSERT_GE(fd, 0);
    ::send(fd, bytes.data(), bytes.size(), MSG_NOSIGNAL);
    held.push_back(fd);
  }
  // More clients that connect and never send than the daemon serves at once.
  for (int i = 0; i < 100; ++i) held.push_back(Connect(socket));
  ASSERT_EQ(std::count(held.begin(), held.end(), -1), 0);

  // While they hold their connections, real commands are still served.
  ASSERT_EQ(Run({"send", "delete_share_worker", "{\"share_name\":\"photo\"}"}).status, 0);
  ASSERT_TRUE(WaitUntil([&] { return Count(Log(), "share photo: worker stopped") > 0; })) << Log();
  EXPECT_EQ(Count(Log(), "worker stopped"), 1u) << "a malformed frame was obeyed";

  // Every one of them is dropped in time, and it is the same daemon all along.
  char byte;
  for (int fd : held) {
    EXPECT_TRUE(WaitUntil([&] { return ::recv(fd, &byte, 1, MSG_DONTWAIT) == 0; }, 10s));
    ::close(fd);
  }
  EXPECT_EQ(::kill(pid, 0), 0);
  EXPECT_NE(Log().find("frame length out of range"), std::string::npos) << Log();
}

// A share short of space is marked and its indexing stops (other shares go on) until it
// is revived.
TEST_F(ServiceTest, ShareOutOfSpaceStopsUntilRevived) {
  ASSERT_TRUE(Add({"/photo/2019", "/video/movies"}));
  ASSERT_TRUE(WaitIdle());
  const std::string table = root_ + "/etc/tavo/shares.json";
  auto setFree = [&](const Json::Value& bytes) {
    Json::Value shares = ParseJson(ReadFile(table));
    for (Json::Value& share : shares["shares"]) {
      if (share["name"] == "photo") share["free_bytes"] = bytes;
    }
    WriteFile(table + ".new", Json::writeString(Json::StreamWriterBuilder(), shares));
    fs::rename(table + ".new", table);
  };
  setFree(Json::Int64(1 << 20));
  auto noSpace = [&] {
    return ParseJson(ReadFile(root_ + "/usr/tavo/etc/fileindex/status.conf"))["no_space"]["photo"] == true;
  };
  // Space is looked at before work, at most once a second: changes come until it is.
  for (int i = 0; i < 20 && !noSpace(); ++i) {
    WriteFile(Share("photo") + "/2019/fill" + std::to_string(i) + ".jpg", "f\n");
    WaitUntil(noSpace, 300ms);
  }
  ASSERT_TRUE(noSpace());
  WriteFile(Share("photo") + "/2019/late.jpg", "l\n");
  WriteFile(Share("video") + "/movies/trailer.mkv", "t\n");
  ASSERT_TRUE(WaitFound("trailer", "/video/movies/trailer.mkv"));
  EXPECT_FALSE(Found("late", "/photo/2019/late.jpg"));

  setFree(Json::Int64(1) << 40);
  ASSERT_EQ(Run({"share", "revive", "photo"}).status, 0);
  EXPECT_TRUE(WaitFound("late", "/photo/2019/late.jpg"));
  EXPECT_FALSE(noSpace());
}

// Another user can neither command the daemon, read an index, nor search.
TEST_F(ServiceTest, OtherUsersCannotCommandReadOrSearch) {
  if (::geteuid() != 0) GTEST_SKIP() << "needs root to switch to another user";
  ASSERT_TRUE(Add({"/photo/2019"}));
  ASSERT_TRUE(WaitIdle());
  const std::string socket = root_ + "/var/run/fileindexd.sock";
  const std::string db = Database();
  pid_t child = ::fork();
  ASSERT_GE(child, 0);
  if (child == 0) {  // exit code: bit 0 if the socket accepted (or is missing), bit 1 if the index opened
    if (::setgroups(0, nullptr) != 0 || ::setgid(65534) != 0 || ::setuid(65534) != 0) ::_exit(64);
    int code = Connect(socket) >= 0 || errno != EACCES ? 1 : 0;
    if (::open(db.c_str(), O_RDONLY | O_CLOEXEC) >= 0) code |= 2;
    ::_exit(code);
  }
  int status = 0;
  ASSERT_EQ(::waitpid(child, &status, 0), child);
  ASSERT_TRUE(WIFEXITED(status));
  EXPECT_EQ(WEXITSTATUS(status), 0) << "1: connected, 2: read the index, 64: no setuid";

  Result search = Run({"search", "beach"}, true, "setpriv --reuid=nobody --regid=nogroup --clear-groups ");
  EXPECT_NE(search.status, 0);
  EXPECT_NE(search.err.find("only root may search"), std::string::npos) << search.err;
  EXPECT_EQ(search.out.find("beach"), std::string::npos) << search.out;
}

}  // namespace
