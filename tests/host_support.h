// What the host tests share: files, JSON, waiting with a deadline, and a sandbox system
// root driven through the real fileindexctl.
#ifndef FILEINDEX_TESTS_HOST_SUPPORT_H
#define FILEINDEX_TESTS_HOST_SUPPORT_H

#include <gtest/gtest.h>
#include <json/json.h>
#include <signal.h>
#include <sys/prctl.h>
#include <sys/wait.h>
#include <unistd.h>

#include <algorithm>
#include <chrono>
#include <cstdlib>
#include <filesystem>
#include <fstream>
#include <functional>
#include <sstream>
#include <string>
#include <thread>
#include <vector>

namespace host_test {

inline std::string ReadFile(const std::string& path) {
  std::stringstream text;
  text << std::ifstream(path).rdbuf();
  return text.str();
}

// Creates the file's directories as needed.
inline void WriteFile(const std::string& path, const std::string& text) {
  std::filesystem::create_directories(std::filesystem::path(path).parent_path());
  std::ofstream(path, std::ios::trunc) << text;
}

inline bool ParseJson(const std::string& text, Json::Value& out) {
  Json::CharReaderBuilder builder;
  Json::CharReaderBuilder::strictMode(&builder.settings_);
  std::istringstream in(text);
  return Json::parseFromStream(builder, in, &out, nullptr);
}

// The document, or null when the text is not JSON.
inline Json::Value ParseJson(const std::string& text) {
  Json::Value value;
  return ParseJson(text, value) ? value : Json::Value();
}

// Polls every 10 ms until ready() holds or the time is up.
inline bool WaitUntil(const std::function<bool()>& ready, std::chrono::milliseconds limit) {
  for (auto end = std::chrono::steady_clock::now() + limit;;
       std::this_thread::sleep_for(std::chrono::milliseconds(10))) {
    if (ready()) return true;
    if (std::chrono::steady_clock::now() >= end) return false;
  }
}

inline std::string Quote(const std::string& text) {
  std::string quoted = "'";
  for (char c : text) quoted += c == '\'' ? std::string("'\\''") : std::string(1, c);
  return quoted + "'";
}

struct Result {
  int status;
  std::string out, err;
};

// A fresh sandbox per test under /tmp, made by `fileindexctl sandbox init`, its daemons
// stopped (by their pid files) and the directory removed afterwards.
class SandboxTest : public ::testing::Test {
 protected:
  static void SetUpTestSuite() {
    // The daemons outlive the hooks that start them; as a subreaper this process reaps them.
    ::prctl(PR_SET_CHILD_SUBREAPER, 1);
    ::unsetenv("FILEINDEX_SYSROOT");
  }
  void InitSandbox(const std::string& name, const std::vector<std::string>& options) {
    std::string pattern = "/tmp/" + name + ".XXXXXX";
    ASSERT_NE(::mkdtemp(&pattern[0]), nullptr);
    work_ = pattern;
    root_ = work_ + "/root";
    std::vector<std::string> init{"sandbox", "init", root_};
    init.insert(init.end(), options.begin(), options.end());
    // Tests that do not search through Spotlight leave its port to those that do.
    if (std::find(options.begin(), options.end(), "--spotlight-port") == options.end())
      init.insert(init.end(), {"--spotlight-port", "0"});
    ASSERT_EQ(Run(init, false).status, 0);
    root_ = std::filesystem::canonical(root_).string();
  }
  void TearDown() override {
    if (work_.empty()) return;
    std::vector<pid_t> pids{DaemonPid("fileindexd"), DaemonPid("tavotifyd")};
    Run({"sandbox", "stop"});
    for (pid_t pid : pids) {
      // Only a daemon of this sandbox, in case the stop failed.
      if (pid > 0 && ReadFile("/proc/" + std::to_string(pid) + "/cmdline").find(root_) != std::string::npos)
        ::kill(pid, SIGKILL);
    }
    while (::waitpid(-1, nullptr, WNOHANG) > 0) continue;
    CheckLogs();
    std::filesystem::remove_all(work_);
  }
  // Before the sandbox goes: anything to say about the daemons' logs.
  virtual void CheckLogs() {}

  Result Run(const std::vector<std::string>& args, bool sysroot = true, const std::string& prefix = "") {
    std::string command = prefix + kCtl + (sysroot ? " --sysroot " + Quote(root_) : "");
    for (const std::string& arg : args) command += " " + Quote(arg);
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
  pid_t DaemonPid(const std::string& daemon) {
    std::string text = ReadFile(root_ + "/var/run/" + daemon + ".pid");
    return text.empty() ? 0 : static_cast<pid_t>(std::atoi(text.c_str()));
  }

  const std::string kCtl = FILEINDEX_BINARY_DIR "/tools/fileindexctl/fileindexctl";
  std::string work_, root_;
};

}  // namespace host_test

#endif
