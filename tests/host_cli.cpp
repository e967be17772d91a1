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
  std::string out;
  std::string err;
};

std::string ReadFile(const std::string& path) {
  std::ifstream in(path);
  std::stringstream text;
  text << in.rdbuf();
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
    while (::waitpid(-1, nullptr, WNOHANG) > 0) {
    }
    fs::remove_all(work_);
  }

  // Runs fileindexctl (with --sysroot unless told not to) and waits for it.
  Result Run(std::vector<std::string> args, bool sysroot = true) {
    if (sysroot) args.insert(args.begin(), {"--sysroot", root_});
    args.insert(args.begin(), kCtl);
    const std::string outPath = work_ + "/stdout", errPath = work_ + "/stderr";
    pid_t pid = ::fork();
    if (pid == 0) {
      int out = ::open(outPath.c_str(), O_WRONLY | O_CREAT | O_TRUNC, 0644);
      int err = ::open(errPath.c_str(), O_WRONLY | O_CREAT | O_TRUNC, 0644);
      ::dup2(out, 1);
      ::dup2(err, 2);
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
    result.out = ReadFile(outPath);
    result.err = ReadFile(errPath);
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

  std::string work_;
  std::string root_;
};

TEST_F(CliTest, AddListRemoveRoundTrip) {
  Result add = Run({"folders", "add", "/photo/2019", "/photo/2020"});
  ASSERT_EQ(add.status, 0) << add.err;
  ASSERT_EQ(Run({"folders", "add", "/video/movies", "--video", "--name", "Films"}).status, 0);

  Json::Value list = RunJson({"folders", "list", "--sort-by", "name", "-a", "status,is_valid"});
  EXPECT_EQ(list["total"], 3);
  ASSERT_EQ(list["folder"].size(), 3u);
  EXPECT_EQ(list["folder"][0]["path"], "/photo/2019");
  EXPECT_EQ(list["folder"][2]["name"], "Films");
  EXPECT_EQ(list["folder"][2]["video"], true);
  EXPECT_EQ(list["folder"][2]["photo"], false);
  EXPECT_EQ(list["folder"][2]["additional"]["status"], "processing");  // its settings event is queued
  EXPECT_EQ(list["folder"][2]["additional"]["is_valid"], true);

  Result table = Run({"folders", "list"});
  EXPECT_NE(table.out.find("/video/movies  Films"), std::string::npos) << table.out;

  std::vector<Json::Value> commands = DaemonCommands(3);
  ASSERT_EQ(commands.size(), 3u);
  EXPECT_EQ(commands[0]["type"], "upsert_folder_setting");
  EXPECT_EQ(commands[2]["data"]["folder_path"], "/video/movies");
  EXPECT_TRUE(fs::exists(WatchList("photo")));
  EXPECT_NE(ReadFile(root_ + "/etc/samba/smb.conf").find("\tspotlight = yes\n"), std::string::npos);

  // The last folder of a share takes its queue and watch list with it.
  ASSERT_EQ(Run({"folders", "remove", "/photo/2019", "/photo/2020"}).status, 0);
  EXPECT_FALSE(fs::exists(WatchList("photo")));
  EXPECT_FALSE(fs::exists(root_ + "/volume1/photo/@eaDir/TAVO@file_index_queue"));
  commands = DaemonCommands(5);
  ASSERT_EQ(commands.size(), 5u);
  EXPECT_EQ(commands[3]["type"], "delete_folder_setting");
  EXPECT_EQ(commands[4]["data"]["folder_path"], "/photo/2020");
  EXPECT_EQ(RunJson({"folders", "list"})["total"], 1);

  // The last folder of all stops the daemon and switches Spotlight off.
  ASSERT_EQ(Run({"folders", "remove", "/video/movies"}).status, 0);
  EXPECT_EQ(ReadFile(root_ + "/run/tavo/service/fileindexd"), "stopped\n");
  EXPECT_FALSE(fs::exists(root_ + "/var/run/fileindexd.sock"));
  EXPECT_NE(ReadFile(root_ + "/etc/samba/smb.conf").find("\tspotlight = no\n"), std::string::npos);
  EXPECT_EQ(RunJson({"folders", "list"})["total"], 0);
}

TEST_F(CliTest, SetChangesOnlyTheFieldsGivenAndRecordsAreTakenAsGiven) {
  ASSERT_EQ(Run({"folders", "add", "/photo/2019", "--photo", "--name", "Pictures"}).status, 0);
  ASSERT_EQ(Run({"folders", "set", "/photo/2019", "--video", "--no-photo"}).status, 0);
  Json::Value folder = RunJson({"folders", "get", "/photo/2019"});
  EXPECT_EQ(folder["name"], "Pictures");
  EXPECT_EQ(folder["video"], true);
  EXPECT_EQ(folder["photo"], false);
  EXPECT_EQ(folder["document"], false);

  Result records =
      Run({"folders", "add", "--records", R"([{"path": "/video/movies", "name": "M", "audio": true}])"});
  ASSERT_EQ(records.status, 0) << records.err;
  folder = RunJson({"folders", "get", "/video/movies"});
  EXPECT_EQ(folder["name"], "M");
  EXPECT_EQ(folder["audio"], true);
  EXPECT_EQ(folder["video"], false);  // a record is not completed with defaults

  // A record that is not in an array reaches the library, which refuses it.
  Result object = Run({"folders", "add", "--records", R"({"path": "/video/series"})"});
  EXPECT_EQ(object.status, 1);
  EXPECT_NE(object.err.find("error 1 (FILEINDEX_ERR_BAD_PARAM)"), std::string::npos) << object.err;
  EXPECT_EQ(Run({"folders", "add", "--records", "[", "/video/series"}).status, 1);
}

TEST_F(CliTest, FailuresExitNonZeroWithCodeAndLogLine) {
  {
    int fd = ::open((root_ + "/tmp/fileidx_cfg_folder.lock").c_str(), O_RDWR | O_CREAT | O_CLOEXEC, 0644);
    ASSERT_EQ(::flock(fd, LOCK_EX), 0);
    Result locked = Run({"folders", "add", "/photo/2019"});
    ::close(fd);
    EXPECT_EQ(locked.status, 1);
    EXPECT_NE(locked.err.find("IndexMgr::Add failed: error 9 (FILEINDEX_ERR_LOCK)"), std::string::npos)
        << locked.err;
    EXPECT_NE(locked.err.find("log: config:"), std::string::npos) << locked.err;
    EXPECT_NE(locked.err.find(" Failed to lock folder"), std::string::npos) << locked.err;
  }

  Result missing = Run({"folders", "get", "/photo/none"});
  EXPECT_EQ(missing.status, 1);
  EXPECT_NE(missing.err.find("error 4 (FILEINDEX_ERR_NO_SUCH_FOLDER)"), std::string::npos) << missing.err;
  EXPECT_NE(missing.err.find("No such folder: /photo/none"), std::string::npos) << missing.err;

  // A share the platform does not know: the library's code, the platform's error and both log lines.
  Json::Value failure = RunJson({"folders", "add", "/nowhere/x"}, 1);
  EXPECT_EQ(failure["ok"], false);
  const Json::Value& first = failure["failures"][0];
  EXPECT_EQ(first["operation"], "IndexMgr::Add");
  EXPECT_EQ(first["error"]["code"], 1);
  EXPECT_EQ(first["error"]["name"], "FILEINDEX_ERR_BAD_PARAM");
  EXPECT_EQ(first["platform_error"]["code"], 0x1400);
  ASSERT_EQ(first["log"].size(), 2u);
  EXPECT_NE(first["log"][1].asString().find("Upsert failed, folder="), std::string::npos);

  EXPECT_EQ(Run({"pause", "--", "-1"}).status, 1);
  EXPECT_EQ(Run({"folders"}).status, 2);  // usage error: no subcommand
  EXPECT_EQ(Run({"folders", "list", "--help"}).status, 0);
}

TEST_F(CliTest, JsonOutputIsJson) {
  ASSERT_EQ(Run({"folders", "add", "/photo/2019"}).status, 0);

  const long long before = std::time(nullptr);
  Json::Value pause = RunJson({"pause", "2"});
  EXPECT_GE(pause["resume_time"].asInt64(), before + 7200);
  EXPECT_LE(pause["resume_time"].asInt64(), std::time(nullptr) + 7200);
  std::vector<Json::Value> commands = DaemonCommands(2);
  ASSERT_EQ(commands.size(), 2u);
  EXPECT_EQ(commands[1]["type"], "pause");
  EXPECT_EQ(commands[1]["data"]["resume_time"], pause["resume_time"]);

  Json::Value status = RunJson({"status"});
  EXPECT_EQ(status["status"], "paused");
  EXPECT_EQ(status["paused"], true);
  EXPECT_EQ(status["folders"][0]["path"], "/photo/2019");
  EXPECT_EQ(status["folders"][0]["status"], "paused");
  Result human = Run({"status"});
  EXPECT_NE(human.out.find("pause:    paused until "), std::string::npos) << human.out;

  EXPECT_EQ(RunJson({"resume"})["resumed"], true);
  EXPECT_EQ(RunJson({"path", "can-index", "/photo/latest"})["can be indexed"], false);  // a symbolic link
  EXPECT_EQ(RunJson({"path", "indexed", "/photo/2019/beach.jpg"})["indexed"], true);
  EXPECT_EQ(RunJson({"path", "skip", root_ + "/volume1/photo/#recycle/deleted.jpg"})["skipped"], true);
  EXPECT_EQ(RunJson({"path", "queue", "photo"})["queue"],
            root_ + "/volume1/photo/@eaDir/TAVO@file_index_queue");
  EXPECT_EQ(RunJson({"share", "flags", "photo"})["no_space"], false);
}

}  // namespace
