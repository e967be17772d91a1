// fileindexctl end to end: the real binary, a host platform sandbox and the daemon probe behind its socket.
#include <fcntl.h>
#include <sys/file.h>
#include <sys/mount.h>

#include <atomic>
#include <ctime>

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

// Add/list/remove drive the daemon and the watch lists; the last folder stops the daemon.
TEST_F(CliTest, AddListRemoveRoundTrip) {
  const std::string watchList = root_ + "/run/tavotifyd/fileindex/volume1/photo";
  ASSERT_EQ(Run({"folders", "add", "/photo/2019", "/photo/2020"}).status, 0);
  ASSERT_EQ(Run({"folders", "add", "/video/movies", "--video", "--name", "Films"}).status, 0);
  Json::Value list = RunJson({"folders", "list", "--sort-by", "name", "-a", "status"});
  ASSERT_EQ(list["folder"].size(), 3u);
  EXPECT_EQ(list["folder"][2]["additional"]["status"], "processing");  // its settings event is queued
  EXPECT_TRUE(fs::exists(watchList));
  ASSERT_EQ(Run({"folders", "remove", "/photo/2019", "/photo/2020"}).status, 0);
  EXPECT_FALSE(fs::exists(watchList));
  // The probe logs each command it is sent as one JSON line.
  std::string log;
  auto lines = [&] {
    log = ReadFile(root_ + "/var/log/fileindexd.log");
    return std::count(log.begin(), log.end(), '\n');
  };
  WaitUntil([&] { return lines() >= 5; }, std::chrono::seconds(2));
  ASSERT_EQ(lines(), 5) << log;
  EXPECT_EQ(ParseJson(log.substr(0, log.find('\n')))["type"], "upsert_folder_setting") << log;
  EXPECT_EQ(ParseJson(log.substr(log.rfind('\n', log.size() - 2) + 1))["data"]["folder_path"], "/photo/2020");
  ASSERT_EQ(Run({"folders", "remove", "/video/movies"}).status, 0);
  EXPECT_EQ(ReadFile(root_ + "/run/tavo/service/fileindexd"), "stopped\n");
}

// A held lock is waited for, named, and given up on with exit 75.
TEST_F(CliTest, LockIsWaitedForThenGivenUpOn) {
  int fd = ::open((root_ + "/tmp/fileidx_cfg_folder.lock").c_str(), O_RDWR | O_CREAT | O_CLOEXEC, 0644);
  ASSERT_EQ(::flock(fd, LOCK_EX), 0);
  const std::string holder = "process " + std::to_string(::getpid());
  Result locked = Run({"--wait", "0", "folders", "add", "/photo/2019"});
  EXPECT_EQ(locked.status, 75);
  EXPECT_HAS(locked.err, "gave up waiting for the configuration lock");
  EXPECT_HAS(locked.err, holder);
  EXPECT_TRUE(Has(Run({"-v", "--wait", "0", "folders", "add", "/photo/2019"}).err, " Failed to lock folder"));
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

// Four writers and two readers at once for a moment: every command succeeds, none is refused.
TEST_F(CliTest, ConcurrentWritersAreNeverRefused) {
  ASSERT_EQ(Run({"folders", "add", "/video/movies"}).status, 0);  // keeps the daemon running throughout
  std::vector<std::thread> threads;
  std::atomic<int> runs{0};
  const auto end = std::chrono::steady_clock::now() + std::chrono::seconds(3);
  for (int i = 0; i < 6; ++i) {
    const std::string folder = "/photo/w" + std::to_string(i), out = work_ + "/run" + std::to_string(i);
    fs::create_directories(root_ + "/volume1" + folder);
    threads.emplace_back([&, i, folder, out] {
      for (int n = 0; std::chrono::steady_clock::now() < end; ++n, ++runs) {
        const Args args = i == 5   ? Args{"status"}
                          : i == 4 ? Args{"folders", "list"}
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

// Input is checked before anything is written: every rule refuses with its reason and
// leaves folder.conf as it was; a trailing slash names the same folder.
TEST_F(CliTest, RefusalRules) {
  fs::create_directory_symlink("/etc", root_ + "/volume1/photo/outside");
  ASSERT_EQ(Run({"folders", "add", "/photo/2019/"}).status, 0);
  const std::string before = Conf();
  const std::vector<std::pair<Args, std::string>> refused = {
      {{"folders", "add", "/photo/#recycle"}, "recycle bin"},
      {{"folders", "add", "/docs/manuals"}, "read-only share"},
      {{"folders", "add", "/vault"}, "encrypted share"},
      {{"folders", "add", "/photo/outside"}, "a symbolic link leaving the share"},
      {{"folders", "add", "/photo/2019/beach.jpg"}, "not a directory"},
      {{"folders", "add", "/photo/../video/movies"}, "\"..\" component"},
      {{"folders", "add", "/photo/./2020"}, "\".\" component"},
      {{"folders", "add", "/photo/a\x01"}, "/photo/a\\x01: holds a control character"},
      {{"folders", "add", "/photo/\xff"}, "not valid UTF-8"},
      {{"folders", "add", "/nowhere/x"}, "no such share"},
      {{"folders", "add", "//photo//2019"}, "already configured (use 'fileindexctl folders set'"},
      {{"folders", "set", "/photo/2020", "--video"}, "/photo/2020: not a configured folder"},
      {{"folders", "remove", "/photo/2020/"}, "/photo/2020: not a configured folder"},
      {{"folders", "add", "--records", "[{\"path\": \"/photo/2020\", \"photo\": \"yes\"}]"},
       "must be true or false"},
      {{"share", "pause", "nosuch"}, "share nosuch: no such share"},
      {{"share", "flags", "nosuch", "--no-space", "set"}, "no such share"},
  };
  for (const auto& [args, reason] : refused) {
    Result result = Run(args);
    EXPECT_EQ(result.status, 1) << args[2] << ": " << result.err;
    EXPECT_TRUE(Has(result.err, reason)) << args[2] << ": " << result.err;
  }
  EXPECT_EQ(Conf(), before);
  EXPECT_EQ(Run({"folders", "add", "/docs/manuals", "--force"}).status, 0);
  EXPECT_FALSE(Has(Run({"share", "pause", "nosuch", "--force"}).err, "--force"));
  ASSERT_EQ(Run({"folders", "remove", "/photo/2019/"}).status, 0);
  EXPECT_EQ(RunJson({"folders", "list"})["folder"].size(), 1u);
  // Options are validated too (exit 2), and direction takes any case.
  for (const Args& usage : {Args{"folders"}, Args{"folders", "list", "--sort-by", "size"},
                            Args{"folders", "list", "-a", "colour"}, Args{"help", "nosuch"}})
    EXPECT_EQ(Run(usage).status, 2) << usage.back();
  EXPECT_EQ(Run({"folders", "list", "--direction", "desc"}).status, 0);
}

// Pause lengths: units, a local end time, and no wrap into the past.
TEST_F(CliTest, PauseTakesUnitsAndRefusesOverflow) {
  ASSERT_EQ(Run({"folders", "add", "/photo/2019"}).status, 0);  // starts the daemon the pause is sent to
  const long long now = static_cast<long long>(std::time(nullptr));
  Result tooLong = Run({"pause", "600000"});
  EXPECT_EQ(tooLong.status, 2);
  EXPECT_HAS(tooLong.err, "too long");
  EXPECT_EQ(Run({"pause", "2x"}).status, 2);
  EXPECT_NEAR(RunJson({"pause", "3d"})["resume_time"].asInt64(), now + 3 * 86400, 5);
  std::time_t later = static_cast<std::time_t>(now + 5400);  // rounded up to two whole hours
  char until[32];
  std::strftime(until, sizeof(until), "%Y-%m-%d %H:%M:%S", std::localtime(&later));
  EXPECT_NEAR(RunJson({"pause", "--until", until})["resume_time"].asInt64(), now + 7200, 5);
  EXPECT_EQ(Run({"pause", "--until", "2001-01-01 00:00"}).status, 2);
  Json::Value status = RunJson({"status"});
  EXPECT_EQ(status["resume_in"], "in 2 h 0 min") << status;
  EXPECT_EQ(status["folders"][0]["status"], "paused");
}

// Exit statuses (3 for a "no" answer, 4 for saved-but-not-applied) and the one JSON schema
// of success and failure, usage errors included.
TEST_F(CliTest, ExitCodesAndJsonErrors) {
  ASSERT_EQ(Run({"folders", "add", "/photo/2019"}).status, 0);
  EXPECT_EQ(Run({"path", "indexed", "/photo/2019/beach.jpg"}).status, 0);
  EXPECT_EQ(Run({"path", "indexed", "/video/movies"}).status, 3);
  Result link = Run({"--json", "path", "can-index", "/photo/latest"});
  Json::Value answer = ParseJson(link.out);
  EXPECT_EQ(link.status, 3);
  EXPECT_EQ(answer["can be indexed"], false) << link.out;
  EXPECT_EQ(answer["rule"], "a symbolic link to /photo/2020");
  EXPECT_EQ(RunJson({"path", "skip", root_ + "/volume1/photo/#recycle/deleted.jpg"})["skipped"], true);
  Result usage = Run({"--json", "folders", "list", "--limit", "many"});
  Json::Value error = ParseJson(usage.out);
  EXPECT_EQ(usage.status, 2);
  EXPECT_EQ(error["ok"], false) << usage.out;
  EXPECT_EQ(error["error"]["name"], "USAGE");
  EXPECT_TRUE(error["error"]["message"].isString() && error["error"]["log"].isArray()) << error;
  Result refused = Run({"--json", "folders", "add", "/photo/2019"});
  EXPECT_EQ(refused.status, 1);
  EXPECT_EQ(ParseJson(refused.out)["error"]["name"], "FOLDER_EXISTS") << refused.out;
  EXPECT_EQ(RunJson({"folders", "list"})["ok"], true);
  // Saved, then the service could not be started: exit 4, and the folder is there.
  Run({"sandbox", "stop"});
  std::ofstream(root_ + "/etc/tavo/services/fileindexd") << "#!/bin/sh\nexit 1\n";
  Result partial = Run({"--json", "folders", "add", "/video/movies"});
  EXPECT_EQ(partial.status, 4);
  EXPECT_HAS(ParseJson(partial.out)["error"]["message"].asString(),
             "saved; applying it failed at starting fileindexd");
  EXPECT_EQ(RunJson({"folders", "list"})["folder"].size(), 2u);
  // A command's help lists the global options too.
  Result help = Run({"help", "folders", "add"}, false);
  EXPECT_EQ(help.status, 0);
  EXPECT_HAS(help.out, "--force");
  EXPECT_HAS(help.out, "--wait SECONDS");
}

// A save that fails says which file and the system's reason.
TEST_F(CliTest, SaveFailureNamesFileAndCause) {
  ASSERT_EQ(Run({"folders", "add", "/photo/2019"}).status, 0);
  const std::string dir = root_ + "/usr/tavo/etc/fileindex", saved = Conf();
  if (::mount("tmpfs", dir.c_str(), "tmpfs", 0, "size=64k") != 0) GTEST_SKIP() << "cannot mount a tmpfs";
  std::ofstream(dir + "/folder.conf") << saved;
  std::ofstream(dir + "/fill") << std::string(64 * 1024, 'x');
  Result full = Run({"folders", "add", "/photo/2020"});
  ::umount2(dir.c_str(), MNT_DETACH);
  EXPECT_EQ(full.status, 1);
  EXPECT_HAS(full.err, "add /photo/2020: cannot save " + dir + "/folder.conf: No space left on device");
}

// Status puts what needs attention first and shows folders that may not be indexed; a
// status.conf member of the wrong type is then named, never an abort.
TEST_F(CliTest, StatusShowsWhatNeedsAttention) {
  ASSERT_EQ(Run({"folders", "add", "/docs/manuals", "--force"}).status, 0);
  ASSERT_EQ(Run({"share", "flags", "photo", "--no-space", "set", "--need-reindex", "set"}).status, 0);
  ASSERT_EQ(Run({"pause", "2"}).status, 0);
  Result status = Run({"status"});
  ASSERT_EQ(status.status, 0) << status.err;
  EXPECT_EQ(status.out.rfind("attention: share photo is out of space", 0), 0u) << status.out;
  EXPECT_HAS(status.out, "attention: share photo waits for a full reindex");
  EXPECT_HAS(status.out, "(in 2 h 0 min)");
  EXPECT_HAS(status.out, "/docs/manuals  paused (may not be indexed: read-only share)");

  std::ofstream(root_ + "/usr/tavo/etc/fileindex/status.conf")
      << "{\"no_space\": \"photo\", \"resume_time\": \"x\"}";
  for (const Args& args : {Args{"pause", "2"}, Args{"resume"}, Args{"status"}}) {
    Result result = Run(args);
    EXPECT_TRUE(result.status == 0 || (result.status == 1 && Has(result.err, "status.conf: member \"")))
        << args[0] << " exited " << result.status << ": " << result.err;
  }
  Result flags = Run({"share", "flags", "photo", "--no-space", "set"});
  EXPECT_HAS(flags.err, "status.conf: member \"no_space\" is a string, expected an object");
}

// check finds a missing watch list, a stray one and a left-over temporary file; --repair
// fixes them and says so.
TEST_F(CliTest, CheckAndRepair) {
  ASSERT_EQ(Run({"folders", "add", "/photo/2019", "/video/movies"}).status, 0);
  EXPECT_EQ(Run({"check"}).status, 0);
  const std::string watch = root_ + "/run/tavotifyd/fileindex";
  std::vector<std::string> lists;
  for (const auto& entry : fs::recursive_directory_iterator(watch))
    if (entry.is_regular_file()) lists.push_back(entry.path());
  ASSERT_EQ(lists.size(), 2u);
  fs::remove(lists[0]);
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
  EXPECT_EQ(repair.status, 0) << repair.out << repair.err;
  EXPECT_HAS(repair.out, "repaired: rebuilt the watch list of share");
  EXPECT_TRUE(fs::exists(lists[0]));
  EXPECT_FALSE(fs::exists(temporary) || fs::exists(watch + "/stray.json"));
  EXPECT_EQ(Run({"check"}).status, 0);
}

}  // namespace
