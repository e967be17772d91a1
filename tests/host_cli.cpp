// fileindexctl end to end: the real binary, a sandbox on the host platform, and the
// daemon probe behind the real socket.
#include <fcntl.h>
#include <gtest/gtest.h>
#include <json/json.h>
#include <sys/file.h>
#include <sys/prctl.h>
#include <sys/wait.h>
#include <unistd.h>
#include <chrono>
#include <climits>
#include <csignal>
#include <ctime>
#include <filesystem>
#include <fstream>
#include <memory>
#include <sstream>
#include <string>
#include <thread>
#include <vector>
namespace fs = std::filesystem;

namespace {
const std::string kCtl = FILEINDEX_BINARY_DIR "/tools/fileindexctl/fileindexctl";

struct Result {
  int status = -1;
  std::string out, err;
};
std::string ReadFile(const std::string& path) {
  std::stringstream text;
  text << std::ifstream(path).rdbuf();
  return text.str();
}
bool ParseJson(const std::string& text, Json::Value& out) {
  Json::CharReaderBuilder builder;
  Json::CharReaderBuilder::strictMode(&builder.settings_);
  std::unique_ptr<Json::CharReader> reader(builder.newCharReader());
  std::string errors;
  return reader->parse(text.data(), text.data() + text.size(), &out, &errors);
}
class CliTest : public ::testing::Test {
 protected:
  static void SetUpTestSuite() {
    // The probe outlives the hook that starts it; as a subreaper this process collects it.
    ::prctl(PR_SET_CHILD_SUBREAPER, 1);
    ::unsetenv("FILEINDEX_SYSROOT");
  }
  void SetUp() override {
    ASSERT_TRUE(fs::exists(kCtl)) << kCtl << " is not built";
    char pattern[] = "/tmp/host_cli.XXXXXX";
    ASSERT_NE(::mkdtemp(pattern), nullptr);
    work_ = pattern;
    root_ = work_ + "/root";
    Result init = Run({"sandbox", "init", root_}, false);
    ASSERT_EQ(init.status, 0) << init.err;
    char resolved[PATH_MAX];
    ASSERT_NE(::realpath(root_.c_str(), resolved), nullptr);
    root_ = resolved;
  }
  void TearDown() override {
    std::string pid = ReadFile(root_ + "/var/run/fileindexd.pid");
    Run({"sandbox", "stop"});
    if (!pid.empty() && std::stoi(pid) > 0) ::kill(std::stoi(pid), SIGKILL);  // in case stop failed
    while (::waitpid(-1, nullptr, WNOHANG) > 0) continue;
    fs::remove_all(work_);
  }
  // Runs fileindexctl (with --sysroot unless told not to) and waits for it.
  Result Run(std::vector<std::string> args, bool sysroot = true) {
    if (sysroot) args.insert(args.begin(), {"--sysroot", root_});
    args.insert(args.begin(), kCtl);
    const std::string outPath = work_ + "/stdout", errPath = work_ + "/stderr";
    pid_t pid = ::fork();
    if (pid == 0) {
      ::dup2(::open(outPath.c_str(), O_WRONLY | O_CREAT | O_TRUNC, 0644), 1);
      ::dup2(::open(errPath.c_str(), O_WRONLY | O_CREAT | O_TRUNC, 0644), 2);
      std::vector<char*> argv;
      for (std::string& arg : args) argv.push_back(&arg[0]);
      argv.push_back(nullptr);
      ::execv(argv[0], argv.data());
      ::_exit(127);
    }
    Result result;
    int status = 0;
    if (pid > 0 && ::waitpid(pid, &status, 0) == pid && WIFEXITED(status))
      result.status = WEXITSTATUS(status);
    result.out = ReadFile(outPath), result.err = ReadFile(errPath);
    return result;
  }
  Json::Value RunJson(std::vector<std::string> args, int expectedStatus = 0) {
    args.insert(args.begin(), "--json");
    Result result = Run(args);
    EXPECT_EQ(result.status, expectedStatus) << result.out << result.err;
    Json::Value value;
    EXPECT_TRUE(ParseJson(result.out, value)) << "not JSON: " << result.out;
    return value;
  }
  // The commands the daemon probe logged, waiting briefly for the count expected.
  std::vector<Json::Value> DaemonCommands(size_t expected) {
    std::vector<Json::Value> commands;
    for (int tries = 0; tries < 200; ++tries) {
      commands.clear();
      std::istringstream lines(ReadFile(root_ + "/var/log/fileindexd.log"));
      std::string line;
      while (std::getline(lines, line)) {
        Json::Value command;
        EXPECT_TRUE(ParseJson(line, command)) << line;
        commands.push_back(command);
      }
      if (commands.size() >= expected) break;
      std::this_thread::sleep_for(std::chrono::milliseconds(10));
    }
    return commands;
  }
  std::string WatchList(const std::string& share) {
    return root_ + "/run/tavotifyd/fileindex/volume1/" + share + "/@eaDir/TAVO@file_index_queue.json";
  }
  std::string work_, root_;
};

// Add/list/remove drive the daemon, watch lists and Spotlight; the last folder of a share or of
// all tears down what the first one set up.
TEST_F(CliTest, AddListRemoveRoundTrip) {
  Result add = Run({"folders", "add", "/photo/2019", "/photo/2020"});
  ASSERT_EQ(add.status, 0) << add.err;
  ASSERT_EQ(Run({"folders", "add", "/video/movies", "--video", "--name", "Films"}).status, 0);
  Json::Value list = RunJson({"folders", "list", "--sort-by", "name", "-a", "status,is_valid"});
  ASSERT_EQ(list["folder"].size(), 3u);
  EXPECT_EQ(list["folder"][2]["name"], "Films");
  EXPECT_EQ(list["folder"][2]["additional"]["status"], "processing");  // its settings event is queued
  EXPECT_EQ(list["folder"][2]["additional"]["is_valid"], true);
  EXPECT_NE(ReadFile(root_ + "/etc/samba/smb.conf").find("\tspotlight = yes\n"), std::string::npos);
  EXPECT_TRUE(fs::exists(WatchList("photo")));
  ASSERT_EQ(Run({"folders", "remove", "/photo/2019", "/photo/2020"}).status, 0);
  EXPECT_FALSE(fs::exists(WatchList("photo")));
  EXPECT_FALSE(fs::exists(root_ + "/volume1/photo/@eaDir/TAVO@file_index_queue"));
  std::vector<Json::Value> commands = DaemonCommands(5);
  ASSERT_EQ(commands.size(), 5u);
  EXPECT_EQ(commands[0]["type"], "upsert_folder_setting");
  EXPECT_EQ(commands[3]["type"], "delete_folder_setting");
  EXPECT_EQ(commands[4]["data"]["folder_path"], "/photo/2020");
  ASSERT_EQ(Run({"folders", "remove", "/video/movies"}).status, 0);
  EXPECT_EQ(ReadFile(root_ + "/run/tavo/service/fileindexd"), "stopped\n");
  EXPECT_NE(ReadFile(root_ + "/etc/samba/smb.conf").find("\tspotlight = no\n"), std::string::npos);
}

// "set" changes only the given flags; records are stored as given; a bare object is refused.
TEST_F(CliTest, SetChangesOnlyTheFieldsGivenAndRecordsAreTakenAsGiven) {
  ASSERT_EQ(Run({"folders", "add", "/photo/2019", "--photo", "--name", "Pictures"}).status, 0);
  ASSERT_EQ(Run({"folders", "set", "/photo/2019", "--video", "--no-photo"}).status, 0);
  Json::Value folder = RunJson({"folders", "get", "/photo/2019"});
  EXPECT_EQ(folder["name"], "Pictures");
  EXPECT_EQ(folder["video"], true);
  EXPECT_EQ(folder["photo"], false);
  ASSERT_EQ(Run({"folders", "add", "--records", R"([{"path": "/video/movies", "audio": true}])"}).status, 0);
  EXPECT_EQ(RunJson({"folders", "get", "/video/movies"})["video"], false);  // not completed with defaults
  Result object = Run({"folders", "add", "--records", R"({"path": "/video/series"})"});
  EXPECT_EQ(object.status, 1);
  EXPECT_NE(object.err.find("error 1 (FILEINDEX_ERR_BAD_PARAM)"), std::string::npos) << object.err;
}

// Failures exit 1 with the library's code and log lines; usage errors exit 2.
TEST_F(CliTest, FailuresExitNonZeroWithCodeAndLogLine) {
  int fd = ::open((root_ + "/tmp/fileidx_cfg_folder.lock").c_str(), O_RDWR | O_CREAT | O_CLOEXEC, 0644);
  ASSERT_EQ(::flock(fd, LOCK_EX), 0);
  Result locked = Run({"folders", "add", "/photo/2019"});
  ::close(fd);
  EXPECT_EQ(locked.status, 1);
  EXPECT_NE(locked.err.find("IndexMgr::Add failed: error 9 (FILEINDEX_ERR_LOCK)"), std::string::npos) << locked.err;
  EXPECT_NE(locked.err.find(" Failed to lock folder"), std::string::npos) << locked.err;
  const Json::Value first = RunJson({"folders", "add", "/nowhere/x"}, 1)["failures"][0];
  EXPECT_EQ(first["error"]["name"], "FILEINDEX_ERR_BAD_PARAM");
  EXPECT_EQ(first["platform_error"]["code"], 0x1400);
  ASSERT_EQ(first["log"].size(), 2u);
  EXPECT_NE(first["log"][1].asString().find("Upsert failed, folder="), std::string::npos);
  EXPECT_EQ(Run({"pause", "--", "-1"}).status, 1);
  EXPECT_EQ(Run({"folders"}).status, 2);
}

// Pause reaches the daemon with the same resume time it reports; path queries answer in JSON.
TEST_F(CliTest, JsonOutputIsJson) {
  ASSERT_EQ(Run({"folders", "add", "/photo/2019"}).status, 0);
  const long long before = std::time(nullptr);
  Json::Value pause = RunJson({"pause", "2"});
  EXPECT_GE(pause["resume_time"].asInt64(), before + 7200);
  EXPECT_LE(pause["resume_time"].asInt64(), std::time(nullptr) + 7200);
  std::vector<Json::Value> commands = DaemonCommands(2);
  ASSERT_EQ(commands.size(), 2u);
  EXPECT_EQ(commands[1]["data"]["resume_time"], pause["resume_time"]);
  EXPECT_EQ(RunJson({"status"})["folders"][0]["status"], "paused");
  EXPECT_EQ(RunJson({"path", "can-index", "/photo/latest"})["can be indexed"], false);  // a symbolic link
  EXPECT_EQ(RunJson({"path", "skip", root_ + "/volume1/photo/#recycle/deleted.jpg"})["skipped"], true);
}

}  // namespace
