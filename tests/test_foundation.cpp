// Error codes, log lines, the JSON configuration files and share paths.
#include <fcntl.h>
#include <fileindex/error.h>
#include <fileindex/status.h>
#include <fileindex/utils.h>
#include <sys/file.h>
#include <syslog.h>

#include <filesystem>
#include <regex>

#include "support/sysroot_test.h"

using namespace TAVO::FILEINDEX;
namespace fs = std::filesystem;

using FoundationTest = SysrootTest;

// A failure sets the code and success keeps it; outputs are left alone. Log lines carry "unit:line"
// and go out at LOG_ERR whatever LOG_LEVEL; an unknown share fails with BAD_PATH, unlogged.
TEST_F(FoundationTest, ErrorCodeIsKeptAcrossSuccessAndLogLinesAreErrorsWhateverTheLevel) {
  std::string full = "unchanged";
  AddShare("photo");
  LOG_LEVEL = 0;
  EXPECT_FALSE(GetFullPath(full, ""));
  ASSERT_EQ(logcap::Lines().size(), 1u);
  EXPECT_EQ(logcap::Lines()[0].priority, LOG_ERR);
  EXPECT_TRUE(
      std::regex_match(logcap::Lines()[0].text, std::regex("utils:[0-9]+ GetShareNameByPath failed, path=")));
  EXPECT_TRUE(full == "unchanged" && ErrorHandler::GetError() == FILEINDEX_ERR_NONE);
  EXPECT_FALSE(GetFullPath(full, "/nosuch/a"));
  EXPECT_EQ(ErrorHandler::GetError(), FILEINDEX_ERR_BAD_PATH);
  EXPECT_EQ(logcap::Lines().size(), 1u) << "an unknown share is not logged";
  EXPECT_TRUE(GetFullPath(full, "/photo/a"));
  EXPECT_EQ(ErrorHandler::GetError(), FILEINDEX_ERR_BAD_PATH) << "success must not clear the code";
}

// Share name: the first component after index 0. Full path: the share directory's volume plus the
// share path, and back. Prefixes are byte-exact; file checks do not follow symlinks.
TEST_F(FoundationTest, SharePathsMapBothWaysAndPrefixAndFileChecksAreExact) {
  std::string share, full, dir;
  for (const auto& c : {std::make_pair("/photo/2019", "photo"), {"/", ""}, {"photo/2019", "hoto"}}) {
    EXPECT_TRUE(GetShareNameByPath(share, c.first));
    EXPECT_EQ(share, c.second) << c.first;
  }
  EXPECT_EQ(ReplaceShareName("/a/", "x") + "|" + ReplaceShareName("/old/a/b", "new"), "/x/|/new/a/b");
  AddShare("data2", "/volume2/data");
  EXPECT_TRUE(GetFullPath(full, "/data2/x"));
  EXPECT_EQ(full, Rooted("/volume2/data/data2/x"));
  EXPECT_TRUE(GetShareNamePathByFullPath(share, dir, Rooted("/volume2/data/data2/a")));
  EXPECT_EQ(share + "|" + dir, "data2|" + Rooted("/volume2/data/data2"));
  EXPECT_TRUE(StringStartWith("/a/bc", "/a/b") && StringStartWith("x", ""));
  EXPECT_FALSE(StringStartWith("/a", "/a/") || StringStartWith("/A/b", "/a"));
  const std::string file = Rooted("/f"), link = Rooted("/l");
  WriteFile(file, "x");
  fs::create_symlink(file, link);
  EXPECT_TRUE(IsDirExist(Rooted("/tmp")) && IsFileExist(file));
  EXPECT_FALSE(IsDirExist(file) || IsFileExist(link) || IsFileExist(Rooted("/tmp")));
}

// Saves are compact, UTF-8 as is, mode 0644; non-strict files fail to load (6), held locks to lock (9).
TEST_F(FoundationTest, SavesAreCompactAndLoadOrLockFailuresSetTheirCodes) {
  Status status;
  status.SetUpdated("é");
  ASSERT_TRUE(status.Save());
  EXPECT_EQ(ReadFile(StatusConfPath()), "{\"é\":true}");
  EXPECT_EQ(fs::status(StatusConfPath()).permissions(), fs::perms(0644));
  for (const char* content : {"{\"a\":1} trailing", "{\"a\":1 /* comment */}"}) {
    WriteFile(StatusConfPath(), content);
    ErrorHandler::SetError(FILEINDEX_ERR_NONE);
    EXPECT_FALSE(status.Load()) << content;
    EXPECT_EQ(ErrorHandler::GetError(), FILEINDEX_ERR_LOAD_CONFIG);
  }
  EXPECT_EQ(logcap::Count(" Failed to load json from " + StatusConfPath()), 2);
  const int holder = ::open(status.GetLockPath().c_str(), O_RDWR | O_CREAT | O_CLOEXEC, 0644);
  ASSERT_EQ(::flock(holder, LOCK_EX), 0);
  EXPECT_TRUE(!status.Lock(true) && ErrorHandler::GetError() == FILEINDEX_ERR_LOCK);
  EXPECT_EQ(logcap::Count(" Failed to lock folder"), 1);
  ::close(holder);
}
