// fileindexctl end to end: the real binary, a host platform sandbox and the daemon probe behind its socket.
#include <fcntl.h>
#include <sys/file.h>
#include <sys/mount.h>

#include <atomic>

#include "host_support.h"
namespace fs = std::filesystem;

namespace {
using namespace host_test;
using Args = std::vector<std::string>;

class CliTest : public SandboxTest {
 protected:
  void SetUp() override { InitSandbox("host_cli", {"--probe"}); }
  std::string Conf() { return ReadFile(root_ + "/usr/tavo/etc/fileindex/folder.conf"); }
};
bool Has(const std::string& text, const std::string& part) { return text.find(part) != std::string::npos; }
#define EXPECT_HAS(text, part) EXPECT_TRUE(Has(text, part)) << (text)

// A held lock is waited for, named, and given up on with exit 75.
TEST_F(CliTest, LockIsWaitedForThenGivenUpOn) {
  int fd = ::open((root_ + "/tmp/fileidx_cfg_folder.lock").c_str(), O_RDWR | O_CREAT | O_CLOEXEC, 0644);
  ASSERT_EQ(::flock(fd, LOCK_EX), 0);
  const std::string holder = "process " + std::to_string(::getpid());
  Result locked = Run({"--wait", "0", "folders", "add", "/photo/2019"});
  EXPECT_EQ(locked.status, 75);
  EXPECT_HAS(locked.err, "gave up waiting for the configuration lock after 0.0 s (" + holder);
  // Released while the command waits: it says whom it waits for, then succeeds.
  std::thread release([fd] {
    ::usleep(1500 * 1000);
    ::close(fd);
  });
  Result waited = Run({"folders", "add", "/photo/2019"});
  release.join();
  EXPECT_EQ(waited.status, 0) << waited.err;
  EXPECT_HAS(waited.err, "waiting for the configuration lock (" + holder);
}

// Four writers and a reader at once for a moment: every command succeeds, none is refused.
TEST_F(CliTest, ConcurrentWritersAreNeverRefused) {
  ASSERT_EQ(Run({"folders", "add", "/video/movies"}).status, 0);  // keeps the daemon running throughout
  std::vector<std::thread> threads;
  std::atomic<int> runs{0};
  const auto end = std::chrono::steady_clock::now() + std::chrono::seconds(3);
  for (int i = 0; i < 5; ++i) {
    const std::string folder = "/photo/w" + std::to_string(i);
    const std::string out = work_ + "/run" + std::to_string(i);
    fs::create_directories(root_ + "/volume1" + folder);
    threads.emplace_back([&, i, folder, out] {
      for (int n = 0; std::chrono::steady_clock::now() < end; ++n, ++runs) {
        const Args args = i == 4   ? (n % 2 ? Args{"status"} : Args{"folders", "list"})
                          : i == 3 ? (n % 2 ? Args{"resume"} : Args{"pause", "1"})
                                   : Args{"folders", n % 2 ? "remove" : "add", folder};
        std::string command = kCtl + " --no-syslog --sysroot " + Quote(root_);
        for (const std::string& arg : args) command += " " + Quote(arg);
        int status = std::system((command + " >" + out + " 2>&1").c_str());
        EXPECT_TRUE(WIFEXITED(status) && WEXITSTATUS(status) == 0) << command << ": " << ReadFile(out);
      }
    });
  }
  for (std::thread& thread : threads) thread.join();
  EXPECT_GT(runs, 12);
}

// Input is checked before anything is written: every rule refuses with its reason and leaves
// folder.conf as it was; a trailing slash names the same folder.
TEST_F(CliTest, RefusalRules) {
  fs::create_directory_symlink("/etc", root_ + "/volume1/photo/outside");
  ASSERT_EQ(Run({"folders", "add", "/photo/2019/"}).status, 0);
  const std::string before = Conf();
  const std::vector<std::pair<Args, std::string>> refused = {
      {{"folders", "add", "/photo/#recycle"}, "recycle bin"},
      {{"folders", "add", "/docs/manuals"}, "read-only share"},
      {{"folders", "add", "/vault"}, "encrypted share"},
      {{"folders", "add", "/photo/outside"}, "a symbolic link leaving the share"},
      {{"folders", "add", "/photo/../video/movies"}, "\"..\" component"},
      {{"folders", "add", "/photo/a\x01"}, "/photo/a\\x01: holds a control character"},
      {{"folders", "add", "/photo/\xff"}, "not valid UTF-8"},
      {{"folders", "add", "/nowhere/x"}, "no such share"},
      {{"folders", "add", "//photo//2019"}, "already configured (use 'fileindexctl folders set'"},
      {{"folders", "remove", "/photo/2020/"}, "/photo/2020: not a configured folder"},
      {{"folders", "add", "--records", R"([{"path": "/photo/2020", "photo": "yes"}])"},
       "must be true or false"},
  };
  for (const auto& [args, reason] : refused) {
    Result result = Run(args);
    EXPECT_TRUE(result.status == 1 && Has(result.err, reason))
        << args[2] << ": " << result.status << result.err;
  }
  EXPECT_EQ(Conf(), before);
}

// A pause takes units and refuses a length that would overflow; status puts what needs attention
// first. A status.conf member of the wrong type is named or passed over, never an abort.
TEST_F(CliTest, PauseAndStatusShowWhatNeedsAttention) {
  ASSERT_EQ(Run({"folders", "add", "/docs/manuals", "--force"}).status, 0);  // starts the daemon
  ASSERT_EQ(Run({"share", "flags", "photo", "--no-space", "set"}).status, 0);
  Result tooLong = Run({"pause", "600000"});
  EXPECT_TRUE(tooLong.status == 2 && Has(tooLong.err, "too long")) << tooLong.err;
  ASSERT_EQ(Run({"pause", "3d"}).status, 0);
  Result status = Run({"status"});
  EXPECT_EQ(status.out.rfind("attention: share photo is out of space", 0), 0u) << status.out << status.err;
  EXPECT_HAS(status.out, "/docs/manuals  paused (may not be indexed: read-only share)");
  EXPECT_HAS(status.out, "(in 3 d 0 h)");  // 3d: three days

  std::ofstream(root_ + "/usr/tavo/etc/fileindex/status.conf")
      << R"({"no_space": "photo", "resume_time": "x"})";
  for (const Args& args : {Args{"pause", "2"}, Args{"resume"}, Args{"status"}})
    EXPECT_EQ(Run(args).status, 0);
  Result flags = Run({"share", "flags", "photo", "--no-space", "set"});
  EXPECT_HAS(flags.err, "status.conf: member \"no_space\" is a string, expected an object");
}

// Exit statuses (3 for a "no" answer, 4 for saved-but-not-applied) and errors as JSON.
TEST_F(CliTest, ExitCodesAndJsonErrors) {
  ASSERT_EQ(Run({"folders", "add", "/photo/2019"}).status, 0);
  Result link = Run({"--json", "path", "can-index", "/photo/latest"});
  EXPECT_EQ(link.status, 3);
  EXPECT_EQ(ParseJson(link.out)["rule"], "a symbolic link to /photo/2020") << link.out;
  Result usage = Run({"--json", "folders", "list", "--limit", "many"});
  EXPECT_EQ(usage.status, 2);
  EXPECT_EQ(ParseJson(usage.out)["error"]["name"], "USAGE") << usage.out;
  // Saved, then the service could not be started: exit 4, and the folder is there.
  Run({"sandbox", "stop"});
  std::ofstream(root_ + "/etc/tavo/services/fileindexd") << "#!/bin/sh\nexit 1\n";
  Result partial = Run({"--json", "folders", "add", "/video/movies"});
  EXPECT_EQ(partial.status, 4);
  EXPECT_HAS(ParseJson(partial.out)["error"]["message"].asString(),
             "saved; applying it failed at starting fileindexd");
  EXPECT_EQ(RunJson({"folders", "list"})["folder"].size(), 2u);
}

// A save that fails says which file and the system's reason.
TEST_F(CliTest, SaveFailureNamesFileAndCause) {
  ASSERT_EQ(Run({"folders", "add", "/photo/2019"}).status, 0);
  const std::string dir = root_ + "/usr/tavo/etc/fileindex";
  const std::string saved = Conf();
  if (::mount("tmpfs", dir.c_str(), "tmpfs", 0, "size=64k") != 0) GTEST_SKIP() << "cannot mount a tmpfs";
  std::ofstream(dir + "/folder.conf") << saved;
  std::ofstream(dir + "/fill") << std::string(64 * 1024, 'x');
  Result full = Run({"folders", "add", "/photo/2020"});
  ::umount2(dir.c_str(), MNT_DETACH);
  EXPECT_EQ(full.status, 1);
  EXPECT_HAS(full.err, "add /photo/2020: cannot save " + dir + "/folder.conf: No space left on device");
}

// check finds a missing watch list, a stray one and a left-over temporary file; --repair fixes them.
TEST_F(CliTest, CheckAndRepair) {
  ASSERT_EQ(Run({"folders", "add", "/photo/2019", "/video/movies"}).status, 0);
  const std::string watch = root_ + "/run/tavotifyd/fileindex";
  const std::string photoList = watch + "/volume1/photo/@eaDir/TAVO@file_index_queue.json";
  ASSERT_TRUE(fs::remove(photoList));
  std::ofstream(watch + "/stray.json") << "{}";
  const std::string temporary = root_ + "/usr/tavo/etc/fileindex/folder.conf.Ab12Cd";
  std::ofstream(temporary) << "{";
  fs::last_write_time(temporary, fs::file_time_type::clock::now() - std::chrono::minutes(5));
  Result check = Run({"check"});
  EXPECT_EQ(check.status, 1);
  EXPECT_HAS(check.out, "is missing");
  EXPECT_HAS(check.out, "stray.json: watch list of a share without indexed folders");
  EXPECT_HAS(check.out, "folder.conf.Ab12Cd: temporary file left behind");
  Result repair = Run({"check", "--repair"});
  EXPECT_HAS(repair.out, "repaired: rebuilt the watch list of share");
  EXPECT_EQ(Run({"check"}).status, 0);
}

}  // namespace
