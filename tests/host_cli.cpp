// fileindexctl end to end: the real binary, a host platform sandbox and the daemon probe behind its socket.
#include <fcntl.h>
#include <gtest/gtest.h>
#include <json/json.h>
#include <sys/file.h>
#include <sys/mount.h>
#include <sys/prctl.h>
#include <sys/wait.h>
#include <unistd.h>

#include <atomic>
#include <chrono>
#include <csignal>
#include <cstdlib>
#include <ctime>
#include <filesystem>
#include <fstream>
#include <sstream>
#include <string>
#include <thread>
#include <vector>

#include "host_support.h"
namespace fs = std::filesystem;

namespace {
using namespace host_test;

class CliTest : public SandboxTest {
 protected:
  void SetUp() override { InitSandbox("host_cli", {"--probe"}); }
  // The commands the daemon probe logged, waiting briefly for the count expected.
  std::vector<Json::Value> DaemonCommands(size_t expected) {
    std::vector<Json::Value> commands;
    for (int tries = 0; tries < 200 && commands.size() < expected; ++tries, ::usleep(10000)) {
      commands.clear();
      std::istringstream lines(ReadFile(root_ + "/var/log/fileindexd.log"));
      for (std::string line; std::getline(lines, line);)
        EXPECT_TRUE(ParseJson(line, commands.emplace_back())) << line;
    }
    return commands;
  }
};

// Add/list/remove drive the daemon, watch lists and Spotlight; the last folder tears them down.
TEST_F(CliTest, AddListRemoveRoundTrip) {
  const std::string watchList = root_ + "/run/tavotifyd/fileindex/volume1/photo";
  ASSERT_EQ(Run({"folders", "add", "/photo/2019", "/photo/2020"}).status, 0);
  ASSERT_EQ(Run({"folders", "add", "/video/movies", "--video", "--name", "Films"}).status, 0);
  Json::Value list = RunJson({"folders", "list", "--sort-by", "name", "-a", "status"});
  ASSERT_EQ(list["folder"].size(), 3u);
  EXPECT_EQ(list["folder"][2]["additional"]["status"], "processing");  // its settings event is queued
  EXPECT_NE(ReadFile(root_ + "/etc/samba/smb.conf").find("\tspotlight = yes\n"), std::string::npos);
  EXPECT_TRUE(fs::exists(watchList));
  ASSERT_EQ(Run({"folders", "remove", "/photo/2019", "/photo/2020"}).status, 0);
  EXPECT_FALSE(fs::exists(watchList));
  std::vector<Json::Value> commands = DaemonCommands(5);
  ASSERT_EQ(commands.size(), 5u);
  EXPECT_EQ(commands[0]["type"], "upsert_folder_setting");
  EXPECT_EQ(commands[4]["data"]["folder_path"], "/photo/2020");
  ASSERT_EQ(Run({"folders", "remove", "/video/movies"}).status, 0);
  EXPECT_EQ(ReadFile(root_ + "/run/tavo/service/fileindexd"), "stopped\n");
  EXPECT_NE(ReadFile(root_ + "/etc/samba/smb.conf").find("\tspotlight = no\n"), std::string::npos);
}

// Pause, status and path queries answer in JSON; a "no" answer exits 3 and names the rule.
TEST_F(CliTest, JsonOutputIsJson) {
  ASSERT_EQ(Run({"folders", "add", "/photo/2019"}).status, 0);
  EXPECT_TRUE(RunJson({"pause", "2"})["resume_time"].isInt64());
  EXPECT_EQ(RunJson({"status"})["folders"][0]["status"], "paused");
  Result link = Run({"--json", "path", "can-index", "/photo/latest"});
  Json::Value answer;
  EXPECT_EQ(link.status, 3);
  ASSERT_TRUE(ParseJson(link.out, answer)) << link.out;
  EXPECT_EQ(answer["can be indexed"], false);
  EXPECT_EQ(answer["rule"], "a symbolic link to /photo/2020");
  EXPECT_EQ(RunJson({"path", "skip", root_ + "/volume1/photo/#recycle/deleted.jpg"})["skipped"], true);
}

// A held lock is waited for, named, and given up on with exit 75; usage errors exit 2.
TEST_F(CliTest, LockIsWaitedForThenGivenUpOn) {
  int fd = ::open((root_ + "/tmp/fileidx_cfg_folder.lock").c_str(), O_RDWR | O_CREAT | O_CLOEXEC, 0644);
  ASSERT_EQ(::flock(fd, LOCK_EX), 0);
  Result locked = Run({"--wait", "0", "folders", "add", "/photo/2019"});
  EXPECT_EQ(locked.status, 75);
  EXPECT_NE(locked.err.find("gave up waiting for the configuration lock"), std::string::npos) << locked.err;
  EXPECT_NE(locked.err.find("process " + std::to_string(::getpid())), std::string::npos) << locked.err;
  EXPECT_EQ(Run({"-v", "--wait", "0", "folders", "add", "/photo/2019"}).err.find(" Failed to lock folder") ==
                std::string::npos,
            false);
  // Released while the command waits: it says once whom it waits for, then succeeds.
  std::thread release([fd]() {
    ::usleep(1500 * 1000);
    ::close(fd);
  });
  Result waited = Run({"folders", "add", "/photo/2019"});
  release.join();
  EXPECT_EQ(waited.status, 0) << waited.err;
  EXPECT_NE(waited.err.find("waiting for the configuration lock (process " + std::to_string(::getpid())),
            std::string::npos)
      << waited.err;
  EXPECT_EQ(Run({"folders"}).status, 2);
}

// Four writers and two readers at once for a moment: every command succeeds, none is
// refused, and what a writer reports is what folder.conf holds.
TEST_F(CliTest, ConcurrentWritersAreNeverRefused) {
  ASSERT_EQ(Run({"folders", "add", "/video/movies"}).status, 0);  // keeps the daemon running throughout
  std::vector<std::thread> threads;
  std::atomic<int> failures{0}, runs{0};
  const auto end = std::chrono::steady_clock::now() + std::chrono::seconds(3);
  for (int i = 0; i < 6; ++i) {
    fs::create_directories(root_ + "/volume1/photo/w" + std::to_string(i));
    threads.emplace_back([&, i]() {
      const std::string folder = "/photo/w" + std::to_string(i);
      const std::string out = work_ + "/run" + std::to_string(i);
      for (int n = 0; std::chrono::steady_clock::now() < end; ++n) {
        std::vector<std::string> args;
        if (i == 4) {
          args = {"folders", "list"};
        } else if (i == 5) {
          args = {"status"};
        } else if (i == 3) {
          args = n % 2 == 0 ? std::vector<std::string>{"pause", "1"} : std::vector<std::string>{"resume"};
        } else {
          args = {"folders", n % 2 == 0 ? "add" : "remove", folder};
        }
        std::string command = kCtl + " --no-syslog --sysroot '" + root_ + "'";
        for (const std::string& arg : args) command += " '" + arg + "'";
        int status = std::system((command + " >" + out + " 2>&1").c_str());
        ++runs;
        if (!WIFEXITED(status) || WEXITSTATUS(status) != 0) {
          ++failures;
          ADD_FAILURE() << command << ": " << ReadFile(out);
        }
      }
    });
  }
  for (std::thread& thread : threads) thread.join();
  EXPECT_EQ(failures, 0);
  EXPECT_GT(runs, 12);
}

// Input is checked before anything is written: every rule refuses with its reason and
// leaves folder.conf as it was; a trailing slash names the same folder.
TEST_F(CliTest, RefusalRules) {
  fs::create_directory_symlink("/etc", root_ + "/volume1/photo/outside");
  ASSERT_EQ(Run({"folders", "add", "/photo/2019/"}).status, 0);
  const std::string before = ReadFile(root_ + "/usr/tavo/etc/fileindex/folder.conf");
  const std::vector<std::pair<std::vector<std::string>, std::string>> refused = {
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
    EXPECT_NE(result.err.find(reason), std::string::npos) << args[2] << ": " << result.err;
  }
  EXPECT_EQ(ReadFile(root_ + "/usr/tavo/etc/fileindex/folder.conf"), before);
  EXPECT_EQ(Run({"folders", "add", "/docs/manuals", "--force"}).status, 0);
  EXPECT_EQ(Run({"share", "pause", "nosuch", "--force"}).err.find("--force"), std::string::npos);
  ASSERT_EQ(Run({"folders", "remove", "/photo/2019/"}).status, 0);
  EXPECT_EQ(RunJson({"folders", "list"})["folder"].size(), 1u);
  // Options are validated too, and direction takes any case.
  EXPECT_EQ(Run({"folders", "list", "--sort-by", "size"}).status, 2);
  EXPECT_EQ(Run({"folders", "list", "-a", "colour"}).status, 2);
  EXPECT_EQ(Run({"folders", "list", "--direction", "desc"}).status, 0);
}

// Pause lengths: units, a local end time, and no wrap into the past.
TEST_F(CliTest, PauseTakesUnitsAndRefusesOverflow) {
  ASSERT_EQ(Run({"folders", "add", "/photo/2019"}).status, 0);  // starts the daemon the pause is sent to
  const long long now = static_cast<long long>(std::time(nullptr));
  Result tooLong = Run({"pause", "600000"});
  EXPECT_EQ(tooLong.status, 2);
  EXPECT_NE(tooLong.err.find("too long"), std::string::npos) << tooLong.err;
  EXPECT_EQ(Run({"pause", "2x"}).status, 2);
  EXPECT_NEAR(RunJson({"pause", "3d"})["resume_time"].asInt64(), now + 3 * 86400, 5);
  std::time_t later = static_cast<std::time_t>(now + 5400);  // rounded up to two whole hours
  char until[32];
  std::strftime(until, sizeof(until), "%Y-%m-%d %H:%M:%S", std::localtime(&later));
  EXPECT_NEAR(RunJson({"pause", "--until", until})["resume_time"].asInt64(), now + 7200, 5);
  EXPECT_EQ(Run({"pause", "--until", "2001-01-01 00:00"}).status, 2);
  Json::Value status = RunJson({"status"});
  EXPECT_EQ(status["resume_in"], "in 2 h 0 min") << status;
}

// A status.conf member of the wrong type is named, never an abort.
TEST_F(CliTest, MalformedStatusConfIsNamedNotAborted) {
  ASSERT_EQ(Run({"folders", "add", "/photo/2019"}).status, 0);
  std::ofstream(root_ + "/usr/tavo/etc/fileindex/status.conf")
      << "{\"no_space\": \"photo\", \"resume_time\": \"x\"}";
  for (const std::vector<std::string>& args : std::vector<std::vector<std::string>>{
           {"pause", "2"}, {"resume"}, {"share", "flags", "photo", "--no-space", "set"}, {"status"}}) {
    Result result = Run(args);
    EXPECT_TRUE(result.status == 1 || result.status == 0) << args[0] << " exited " << result.status;
    if (result.status != 0) {
      EXPECT_NE(result.err.find("status.conf: member \""), std::string::npos)
          << args[0] << ": " << result.err;
    }
  }
  Result flags = Run({"share", "flags", "photo", "--no-space", "set"});
  EXPECT_NE(flags.err.find("status.conf: member \"no_space\" is a string, expected an object"),
            std::string::npos)
      << flags.err;
}

// Exit statuses and the one JSON schema of success and failure, usage errors included.
TEST_F(CliTest, ExitCodesAndJsonErrors) {
  ASSERT_EQ(Run({"folders", "add", "/photo/2019"}).status, 0);
  EXPECT_EQ(Run({"path", "indexed", "/photo/2019/beach.jpg"}).status, 0);
  EXPECT_EQ(Run({"path", "indexed", "/video/movies"}).status, 3);
  Json::Value error;
  Result usage = Run({"--json", "folders", "list", "--limit", "many"});
  EXPECT_EQ(usage.status, 2);
  ASSERT_TRUE(ParseJson(usage.out, error)) << usage.out;
  EXPECT_EQ(error["ok"], false);
  EXPECT_EQ(error["error"]["name"], "USAGE");
  EXPECT_TRUE(error["error"]["message"].isString() && error["error"]["log"].isArray()) << error;
  Result refused = Run({"--json", "folders", "add", "/photo/2019"});
  EXPECT_EQ(refused.status, 1);
  ASSERT_TRUE(ParseJson(refused.out, error)) << refused.out;
  EXPECT_EQ(error["error"]["name"], "FOLDER_EXISTS");
  EXPECT_EQ(RunJson({"folders", "list"})["ok"], true);
  // Saved, then the service could not be started: exit 4, and the folder is there.
  Run({"sandbox", "stop"});
  std::ofstream(root_ + "/etc/tavo/services/fileindexd") << "#!/bin/sh\nexit 1\n";
  Result partial = Run({"--json", "folders", "add", "/video/movies"});
  EXPECT_EQ(partial.status, 4);
  ASSERT_TRUE(ParseJson(partial.out, error)) << partial.out;
  EXPECT_NE(error["error"]["message"].asString().find("saved; applying it failed at starting fileindexd"),
            std::string::npos)
      << error;
  EXPECT_EQ(RunJson({"folders", "list"})["folder"].size(), 2u);
}

// A save that fails says which file and the system's reason.
TEST_F(CliTest, SaveFailureNamesFileAndCause) {
  ASSERT_EQ(Run({"folders", "add", "/photo/2019"}).status, 0);
  const std::string dir = root_ + "/usr/tavo/etc/fileindex";
  const std::string saved = ReadFile(dir + "/folder.conf");
  if (::mount("tmpfs", dir.c_str(), "tmpfs", 0, "size=64k") != 0) GTEST_SKIP() << "cannot mount a tmpfs";
  std::ofstream(dir + "/folder.conf") << saved;
  std::ofstream(dir + "/fill") << std::string(64 * 1024, 'x');
  Result full = Run({"folders", "add", "/photo/2020"});
  ::umount2(dir.c_str(), MNT_DETACH);
  EXPECT_EQ(full.status, 1);
  EXPECT_NE(full.err.find("add /photo/2020: cannot save " + dir + "/folder.conf: No space left on device"),
            std::string::npos)
      << full.err;
}

// Status puts what needs attention first and shows folders that may not be indexed.
TEST_F(CliTest, StatusShowsWhatNeedsAttention) {
  ASSERT_EQ(Run({"folders", "add", "/docs/manuals", "--force"}).status, 0);
  ASSERT_EQ(Run({"share", "flags", "photo", "--no-space", "set", "--need-reindex", "set"}).status, 0);
  ASSERT_EQ(Run({"pause", "2"}).status, 0);
  Result status = Run({"status"});
  ASSERT_EQ(status.status, 0) << status.err;
  EXPECT_EQ(status.out.rfind("attention: share photo is out of space", 0), 0u) << status.out;
  EXPECT_NE(status.out.find("attention: share photo waits for a full reindex"), std::string::npos)
      << status.out;
  EXPECT_NE(status.out.find("(in 2 h 0 min)"), std::string::npos) << status.out;
  EXPECT_NE(status.out.find("/docs/manuals  paused (may not be indexed: read-only share)"), std::string::npos)
      << status.out;
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
  EXPECT_NE(check.out.find("is missing"), std::string::npos) << check.out;
  EXPECT_NE(check.out.find("stray.json: watch list of a share without indexed folders"), std::string::npos);
  EXPECT_NE(check.out.find("folder.conf.Ab12Cd: temporary file left behind"), std::string::npos) << check.out;
  Result repair = Run({"check", "--repair"});
  EXPECT_EQ(repair.status, 0) << repair.out << repair.err;
  EXPECT_NE(repair.out.find("repaired: rebuilt the watch list of share"), std::string::npos) << repair.out;
  EXPECT_TRUE(fs::exists(lists[0]));
  EXPECT_FALSE(fs::exists(temporary));
  EXPECT_FALSE(fs::exists(watch + "/stray.json"));
  EXPECT_EQ(Run({"check"}).status, 0);
}

// --version, help COMMAND and the global options in a command's help.
TEST_F(CliTest, VersionAndHelp) {
  Result version = Run({"--version"}, false);
  EXPECT_EQ(version.status, 0);
  EXPECT_EQ(version.out.rfind("fileindexctl 6.0", 0), 0u) << version.out;
  Result help = Run({"help", "folders", "add"}, false);
  EXPECT_EQ(help.status, 0);
  EXPECT_NE(help.out.find("--force"), std::string::npos) << help.out;
  EXPECT_NE(help.out.find("--wait SECONDS"), std::string::npos) << help.out;
  EXPECT_EQ(Run({"help", "nosuch"}, false).status, 2);
}

}  // namespace
