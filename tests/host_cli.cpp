// fileindexctl end to end: the real binary, a host platform sandbox and the daemon probe behind its socket.
#include <fcntl.h>
#include <gtest/gtest.h>
#include <json/json.h>
#include <sys/file.h>
#include <sys/prctl.h>
#include <sys/wait.h>
#include <unistd.h>

#include <csignal>
#include <cstdlib>
#include <filesystem>
#include <fstream>
#include <sstream>
#include <string>
#include <vector>
namespace fs = std::filesystem;

namespace {
const std::string kCtl = FILEINDEX_BINARY_DIR "/tools/fileindexctl/fileindexctl";

struct Result {
  int status;
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
  std::istringstream in(text);
  return Json::parseFromStream(builder, in, &out, nullptr);
}
class CliTest : public ::testing::Test {
 protected:
  static void SetUpTestSuite() {
    // The probe outlives the hook that starts it; as a subreaper this process collects it.
    ::prctl(PR_SET_CHILD_SUBREAPER, 1);
    ::unsetenv("FILEINDEX_SYSROOT");
  }
  void SetUp() override {
    char pattern[] = "/tmp/host_cli.XXXXXX";
    ASSERT_NE(::mkdtemp(pattern), nullptr);
    work_ = pattern;
    root_ = work_ + "/root";
    ASSERT_EQ(Run({"sandbox", "init", root_, "--probe"}, false).status, 0);
    root_ = fs::canonical(root_).string();
  }
  void TearDown() override {
    std::string pid = ReadFile(root_ + "/var/run/fileindexd.pid");
    Run({"sandbox", "stop"});
    if (!pid.empty() && std::stoi(pid) > 0) ::kill(std::stoi(pid), SIGKILL);  // in case stop failed
    while (::waitpid(-1, nullptr, WNOHANG) > 0) continue;
    fs::remove_all(work_);
  }
  Result Run(const std::vector<std::string>& args, bool sysroot = true) {
    std::string command = kCtl + (sysroot ? " --sysroot '" + root_ + "'" : "");
    for (const std::string& arg : args) command += " '" + arg + "'";
    int status = std::system((command + " >" + work_ + "/stdout 2>" + work_ + "/stderr").c_str());
    return {WIFEXITED(status) ? WEXITSTATUS(status) : -1, ReadFile(work_ + "/stdout"),
            ReadFile(work_ + "/stderr")};
  }
  Json::Value RunJson(std::vector<std::string> args) {
    args.insert(args.begin(), "--json");
    Result result = Run(args);
    Json::Value value;
    EXPECT_EQ(result.status, 0) << result.out << result.err;
    EXPECT_TRUE(ParseJson(result.out, value)) << "not JSON: " << result.out;
    return value;
  }
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
  std::string work_, root_;
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

// Failures exit 1 with the library's code and log line; usage errors exit 2.
TEST_F(CliTest, FailuresExitNonZeroWithCodeAndLogLine) {
  int fd = ::open((root_ + "/tmp/fileidx_cfg_folder.lock").c_str(), O_RDWR | O_CREAT | O_CLOEXEC, 0644);
  ASSERT_EQ(::flock(fd, LOCK_EX), 0);
  Result locked = Run({"folders", "add", "/photo/2019"});
  ::close(fd);
  EXPECT_EQ(locked.status, 1);
  EXPECT_NE(locked.err.find("failed: error 9 (FILEINDEX_ERR_LOCK)"), std::string::npos) << locked.err;
  EXPECT_NE(locked.err.find(" Failed to lock folder"), std::string::npos) << locked.err;
  EXPECT_EQ(Run({"folders"}).status, 2);
}

// Pause, status and path queries answer in JSON.
TEST_F(CliTest, JsonOutputIsJson) {
  ASSERT_EQ(Run({"folders", "add", "/photo/2019"}).status, 0);
  EXPECT_TRUE(RunJson({"pause", "2"})["resume_time"].isInt64());
  EXPECT_EQ(RunJson({"status"})["folders"][0]["status"], "paused");
  EXPECT_EQ(RunJson({"path", "can-index", "/photo/latest"})["can be indexed"], false);  // a symbolic link
  EXPECT_EQ(RunJson({"path", "skip", root_ + "/volume1/photo/#recycle/deleted.jpg"})["skipped"], true);
}

}  // namespace
