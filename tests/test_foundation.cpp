// Error codes, log lines, the locked JSON configuration file and share paths.
#include <fileindex/config.h>
#include <fileindex/error.h>
#include <fileindex/utils.h>
#include <sys/file.h>
#include <sys/stat.h>
#include <syslog.h>
#include <unistd.h>

#include <regex>

#include "support/sysroot_test.h"

using namespace TAVO::FILEINDEX;

namespace {

struct FileConfig : Config {
  FileConfig(std::string path, std::string lockPath)
      : path_(std::move(path)), lockPath_(std::move(lockPath)) {}
  bool Load() override { return LoadJson(); }
  bool Save() override { return SaveJson(); }
  std::string GetLockPath() const override { return lockPath_; }
  std::string GetPath() const override { return path_; }
  Json::Value& Document() { return m_jsDocument; }
  std::string path_, lockPath_;
};

class FoundationTest : public SysrootTest {
 protected:
  std::string ConfPath() const { return Rooted("/usr/tavo/etc/fileindex/test.conf"); }
};

}  // namespace

// A failure sets the code and success keeps it. Log lines carry "unit:line", go out at LOG_ERR
// whatever LOG_LEVEL, and leave outputs alone.
TEST_F(FoundationTest, ErrorCodeIsKeptAcrossSuccessAndLogLinesAreErrorsWhateverTheLevel) {
  std::string full = "unchanged";
  AddShare("photo");
  for (int level : {0, 8}) {
    logcap::Clear();
    LOG_LEVEL = level;
    EXPECT_FALSE(GetFullPath(full, ""));
    ASSERT_EQ(logcap::Lines().size(), 1u) << level;
    EXPECT_EQ(logcap::Lines()[0].priority, LOG_ERR);
    EXPECT_TRUE(std::regex_match(logcap::Lines()[0].text,
                                 std::regex("utils:[0-9]+ GetShareNameByPath failed, path=")));
  }
  EXPECT_TRUE(full == "unchanged" && ErrorHandler::GetError() == FILEINDEX_ERR_NONE);
  EXPECT_FALSE(GetFullPath(full, "/nosuch/a"));
  EXPECT_EQ(ErrorHandler::GetError(), FILEINDEX_ERR_BAD_PATH);
  EXPECT_TRUE(GetFullPath(full, "/photo/a"));
  EXPECT_EQ(ErrorHandler::GetError(), FILEINDEX_ERR_BAD_PATH) << "success must not clear the code";
}

// Contention (another open file holding flock) fails with code 9 and one log line; once
// released the lock is taken. A missing lock directory fails at once with code 9 as well.
TEST_F(FoundationTest, LockContentionAndMissingDirectoryFailWithCode9) {
  FileConfig config(ConfPath(), Rooted("/tmp/test.lock"));
  const int holder = ::open(config.GetLockPath().c_str(), O_RDWR | O_CREAT, 0644);
  ASSERT_EQ(::flock(holder, LOCK_EX), 0);
  EXPECT_FALSE(config.Lock(true));
  EXPECT_EQ(ErrorHandler::GetError(), FILEINDEX_ERR_LOCK);
  EXPECT_EQ(logcap::Count("config:"), 1);
  EXPECT_TRUE(logcap::Contains(" Failed to lock folder"));
  ::close(holder);
  EXPECT_TRUE(config.Lock(true));
  config.Unlock();
  ErrorHandler::SetError(FILEINDEX_ERR_NONE);
  FileConfig missing(ConfPath(), Rooted("/nodir/test.lock"));
  EXPECT_FALSE(missing.Lock(true));
  EXPECT_EQ(ErrorHandler::GetError(), FILEINDEX_ERR_LOCK);
}

// A missing file loads as empty; saves are compact, mode 0644 and load back. Empty or non-strict
// files fail to load with code 6; saving into a missing directory, code 7.
TEST_F(FoundationTest, LoadAndSaveRoundTripAndFailuresSetTheirCodes) {
  FileConfig config(ConfPath(), Rooted("/tmp/test.lock"));
  EXPECT_TRUE(config.Load());
  EXPECT_EQ(config.Document(), Json::Value(Json::objectValue));
  config.Document()["a"]["nested"] = "é";
  ASSERT_TRUE(config.Save());
  EXPECT_EQ(ReadFile(config.GetPath()), "{\"a\":{\"nested\":\"é\"}}");
  struct stat st;
  ASSERT_EQ(::stat(config.GetPath().c_str(), &st), 0);
  EXPECT_EQ(st.st_mode & 07777, 0644u);
  for (const char* content : {"", "{\"a\":1} trailing", "{\"a\":1 /* comment */}"}) {
    WriteFile(config.GetPath(), content);
    ErrorHandler::g_error_code = FILEINDEX_ERR_NONE;
    EXPECT_FALSE(config.Load()) << "[" << content << "]";
    EXPECT_EQ(ErrorHandler::GetError(), FILEINDEX_ERR_LOAD_CONFIG);
  }
  EXPECT_EQ(logcap::Count(" Failed to load json from " + config.GetPath()), 3);
  FileConfig unsaved(Rooted("/nodir/test.conf"), Rooted("/tmp/test.lock"));
  EXPECT_FALSE(unsaved.Save());
  EXPECT_EQ(ErrorHandler::GetError(), FILEINDEX_ERR_SAVE_CONFIG);
  EXPECT_TRUE(logcap::Contains(" Failed to save json to " + unsaved.GetPath()));
}

// Share name: the first component after index 0. Full path: the share directory's volume
// plus the share path; an unknown share fails silently with BAD_PATH. The reverse lookup logs.
TEST_F(FoundationTest, SharePathsMapBothWaysAndPrefixAndFileChecksAreExact) {
  std::string share = "unchanged", full = "unchanged", dir;
  for (const auto& c : {std::make_pair("/photo/2019", "photo"), {"/", ""}, {"photo/2019", "hoto"}}) {
    EXPECT_TRUE(GetShareNameByPath(share, c.first));
    EXPECT_EQ(share, c.second) << c.first;
  }
  EXPECT_EQ(ReplaceShareName("/a/", "x") + "|" + ReplaceShareName("/old/a/b", "new"), "/x/|/new/a/b");
  AddShare("data2", "/volume2/data");
  EXPECT_TRUE(GetFullPath(full, "/data2/x"));
  EXPECT_EQ(full, Rooted("/volume2/data/data2/x"));
  EXPECT_FALSE(GetFullPath(full, "/"));
  EXPECT_TRUE(logcap::Lines().empty()) << "an unknown share is not logged";
  EXPECT_EQ(ErrorHandler::GetError(), FILEINDEX_ERR_BAD_PATH);
  EXPECT_TRUE(GetShareNamePathByFullPath(share, dir, Rooted("/volume2/data/data2/a")));
  EXPECT_EQ(share + "|" + dir, "data2|" + Rooted("/volume2/data/data2"));
  EXPECT_FALSE(GetShareNamePathByFullPath(share, dir, "/elsewhere/x"));
  EXPECT_TRUE(logcap::Contains(" TAVOShareNamePathGet failed, path=/elsewhere/x"));
  // Prefixes are byte-exact; file checks do not follow symlinks.
  EXPECT_TRUE(StringStartWith("/a/bc", "/a/b") && StringStartWith("x", ""));
  EXPECT_FALSE(StringStartWith("/a", "/a/") || StringStartWith("/A/b", "/a"));
  std::string file = Rooted("/f"), link = Rooted("/l");
  WriteFile(file, "x");
  ASSERT_EQ(::symlink(file.c_str(), link.c_str()), 0);
  EXPECT_TRUE(IsDirExist(Rooted("/tmp")) && IsFileExist(file));
  EXPECT_FALSE(IsDirExist(file) || IsFileExist(link) || IsFileExist(Rooted("/tmp")));
}
