// Error codes, log lines, the locked JSON configuration file and share paths.
#include <fileindex/config.h>
#include <fileindex/error.h>
#include <fileindex/utils.h>
#include <sys/file.h>
#include <sys/stat.h>
#include <syslog.h>
#include <unistd.h>

#include <chrono>
#include <regex>

#include "internal/json_io.h"
#include "support/sysroot_test.h"

using namespace TAVO::FILEINDEX;

namespace {

struct FileConfig : Config {
  FileConfig(std::string path, std::string lockPath) : path_(std::move(path)), lockPath_(std::move(lockPath)) {}
  bool Load() override { return LoadJson(); }
  bool Save() override { return SaveJson(); }
  std::string GetLockPath() const override { return lockPath_; }
  std::string GetPath() const override { return path_; }
  Json::Value& Document() { return m_jsDocument; }
  int Descriptor() const { return m_fdLock; }
  std::string path_, lockPath_;
};

class FoundationTest : public SysrootTest {
 protected:
  FileConfig MakeConfig() { return FileConfig(Rooted("/usr/tavo/etc/fileindex/test.conf"), Rooted("/tmp/test.lock")); }
};

}  // namespace

// A failure sets the code and success keeps it; the code holds any value in 4 bytes. Log
// lines carry "unit:line", go out at LOG_ERR whatever LOG_LEVEL, and leave outputs alone.
TEST_F(FoundationTest, ErrorCodeIsKeptAcrossSuccessAndLogLinesAreErrorsWhateverTheLevel) {
  std::string full = "unchanged";
  AddShare("photo");
  for (int level : {0, 8}) {
    logcap::Clear();
    LOG_LEVEL = level;
    EXPECT_FALSE(GetFullPath(full, ""));
    ASSERT_EQ(logcap::Lines().size(), 1u) << level;
    EXPECT_EQ(logcap::Lines()[0].priority, LOG_ERR);
    EXPECT_TRUE(std::regex_match(logcap::Lines()[0].text, std::regex("utils:[0-9]+ GetShareNameByPath failed, path=")));
  }
  EXPECT_EQ(full, "unchanged");
  EXPECT_EQ(ErrorHandler::GetError(), FILEINDEX_ERR_NONE);
  EXPECT_FALSE(GetFullPath(full, "/nosuch/a"));
  EXPECT_EQ(ErrorHandler::GetError(), FILEINDEX_ERR_BAD_PATH);
  EXPECT_TRUE(GetFullPath(full, "/photo/a"));
  EXPECT_EQ(ErrorHandler::GetError(), FILEINDEX_ERR_BAD_PATH) << "success must not clear the code";
  ErrorHandler::SetError(static_cast<_tag_fileindex_err_>(1234));
  EXPECT_EQ(static_cast<int>(ErrorHandler::GetError()), 1234);
  EXPECT_EQ(sizeof(ErrorHandler::g_error_code), 4u);
}

// Contention (another open file holding flock) fails fast after its tries, with code 9 and
// one log line; once released the lock is taken, and a repeated Unlock is harmless.
TEST_F(FoundationTest, LockContentionFailsAfterThreeTriesWithCode9) {
  FileConfig config = MakeConfig();
  const int holder = ::open(config.GetLockPath().c_str(), O_RDWR | O_CREAT, 0644);
  ASSERT_EQ(::flock(holder, LOCK_EX), 0);
  auto start = std::chrono::steady_clock::now();
  EXPECT_FALSE(config.Lock(true));
  EXPECT_LT(std::chrono::steady_clock::now() - start, std::chrono::milliseconds(200));
  EXPECT_EQ(ErrorHandler::GetError(), FILEINDEX_ERR_LOCK);
  EXPECT_EQ(logcap::Count("config:"), 1);
  EXPECT_TRUE(logcap::Contains(" Failed to lock folder"));
  EXPECT_GE(config.Descriptor(), 0) << "the last opened descriptor stays in the member";
  EXPECT_FALSE(config.Lock(false)) << "a shared lock is refused as well";
  ::close(holder);
  EXPECT_TRUE(config.Lock(true));
  config.Unlock();
  config.Unlock();
}

// A missing lock directory fails at once; a symlinked lock file is not followed.
TEST_F(FoundationTest, LockFailsAtOnceOnMissingDirectoryAndDoesNotFollowSymlinks) {
  FileConfig config(Rooted("/usr/tavo/etc/fileindex/test.conf"), Rooted("/nodir/test.lock"));
  auto start = std::chrono::steady_clock::now();
  EXPECT_FALSE(config.Lock(true));
  EXPECT_LT(std::chrono::steady_clock::now() - start, std::chrono::milliseconds(5));
  EXPECT_EQ(ErrorHandler::GetError(), FILEINDEX_ERR_LOCK);
  EXPECT_LT(config.Descriptor(), 0);
  ASSERT_EQ(::symlink(Rooted("/tmp/elsewhere").c_str(), Rooted("/tmp/test.lock").c_str()), 0);
  EXPECT_FALSE(MakeConfig().Lock(true));
  EXPECT_FALSE(Exists(Rooted("/tmp/elsewhere")));
}

TEST_F(FoundationTest, LoadAndSaveRoundTripWithMode0644) {
  FileConfig config = MakeConfig();
  EXPECT_TRUE(config.Load()) << "a missing file is an empty configuration";
  EXPECT_EQ(config.Document(), Json::Value(Json::objectValue));
  config.Document()["b"] = 2;
  config.Document()["a"]["nested"] = "é";
  ASSERT_TRUE(config.Save());
  std::string text = ReadFile(config.GetPath());
  EXPECT_EQ(text.find('\n'), std::string::npos) << text;
  EXPECT_NE(text.find("é"), std::string::npos) << "UTF-8 is written as is";
  struct stat st;
  ASSERT_EQ(::stat(config.GetPath().c_str(), &st), 0);
  EXPECT_EQ(st.st_mode & 07777, 0644u);
  FileConfig again = MakeConfig();
  EXPECT_TRUE(again.Load() && again.Document() == config.Document());
}

// Empty or non-strict files fail to load with code 6; saving into a missing directory, code 7.
TEST_F(FoundationTest, LoadAndSaveFailuresLogAndSetTheirCodes) {
  FileConfig config = MakeConfig();
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

TEST_F(FoundationTest, JsonTextHelpersAreStrictAndCompact) {
  Json::Value value;
  EXPECT_TRUE(internal::JsonFromString(value, " {\"event\": 65536, \"path\": \"/v/a\"}\r\n"));
  EXPECT_EQ(internal::JsonToString(value), "{\"event\":65536,\"path\":\"/v/a\"}");
  EXPECT_FALSE(internal::JsonFromString(value, "{\"a\":1}x") || internal::JsonFromString(value, "// c\n{}"));
  EXPECT_TRUE(internal::JsonFromString(value, "5"));
  // Deeper than the parser's stack limit: refused, never thrown.
  EXPECT_FALSE(internal::JsonFromString(value, std::string(5000, '[') + std::string(5000, ']')));
}

// Share name: the first component after index 0. Full path: the share directory's volume
// plus the share path; an unknown share fails silently with BAD_PATH. The reverse lookup logs.
TEST_F(FoundationTest, SharePathsMapBothWays) {
  std::string share = "unchanged", full = "unchanged", dir;
  EXPECT_FALSE(GetShareNameByPath(share, ""));
  for (const auto& c : {std::make_pair("/photo/2019", "photo"), {"/", ""}, {"photo/2019", "hoto"}, {"//a", ""}}) {
    EXPECT_TRUE(GetShareNameByPath(share, c.first));
    EXPECT_EQ(share, c.second) << c.first;
  }
  EXPECT_EQ(ReplaceShareName("", "x") + "|" + ReplaceShareName("/a/", "x") + "|" + ReplaceShareName("/old/a/b", "new"),
            "|/x/|/new/a/b");
  AddShare("data2", "/volume2/data");
  fake::Get().shares["photo2"] = fake::Share{"photo2", "photo2"};  // a directory without a slash
  EXPECT_TRUE(GetFullPath(full, "/data2/x"));
  EXPECT_EQ(full, Rooted("/volume2/data/data2/x"));
  EXPECT_TRUE(GetFullPath(full, "/photo2/y"));
  EXPECT_EQ(full, "photo2/photo2/y");
  EXPECT_EQ(fake::CallsStartingWith("TAVOShareGet").size(), fake::CallsStartingWith("TAVOShareFree").size());
  full = "unchanged";
  EXPECT_FALSE(GetFullPath(full, "/"));
  EXPECT_EQ(full, "unchanged");
  EXPECT_TRUE(logcap::Lines().empty()) << "an unknown share is not logged";
  EXPECT_EQ(ErrorHandler::GetError(), FILEINDEX_ERR_BAD_PATH);
  EXPECT_TRUE(GetShareNamePathByFullPath(share, dir, Rooted("/volume2/data/data2/a")));
  EXPECT_EQ(share + "|" + dir, "data2|" + Rooted("/volume2/data/data2"));
  EXPECT_FALSE(GetShareNamePathByFullPath(share, dir, "/elsewhere/x"));
  EXPECT_EQ(share, "data2");
  EXPECT_TRUE(logcap::Contains(" TAVOShareNamePathGet failed, path=/elsewhere/x"));
}

// Prefixes are byte-exact; file checks do not follow symlinks; JSON getters check the type.
TEST_F(FoundationTest, PrefixFileAndJsonHelpers) {
  EXPECT_TRUE(StringStartWith("/a/bc", "/a/b") && StringStartWith("x", ""));
  EXPECT_FALSE(StringStartWith("/a", "/a/") || StringStartWith("/A/b", "/a"));
  std::string dir = Rooted("/d"), file = Rooted("/f"), link = Rooted("/l"), dirLink = Rooted("/dl");
  ASSERT_EQ(::mkdir(dir.c_str(), 0755), 0);
  WriteFile(file, "x");
  ASSERT_EQ(::symlink(file.c_str(), link.c_str()) + ::symlink(dir.c_str(), dirLink.c_str()), 0);
  EXPECT_TRUE(IsDirExist(dir) && IsFileExist(file));
  EXPECT_FALSE(IsDirExist(file) || IsDirExist(dirLink) || IsFileExist(link) || IsFileExist(dir));
  const Json::Value obj = ParseJson(R"({"s":"text","b":true,"n":1})");
  std::string s = "keep";
  bool b = false;
  EXPECT_FALSE(RetrieveStringFromJsonObj(s, "b", obj) || RetrieveStringFromJsonObj(s, "missing", obj));
  EXPECT_EQ(s, "keep");
  EXPECT_TRUE(RetrieveStringFromJsonObj(s, "s", obj));
  EXPECT_EQ(s, "text");
  EXPECT_FALSE(RetrieveBoolFromJsonObj(b, "n", obj) || RetrieveBoolFromJsonObj(b, "s", obj));
  EXPECT_TRUE(RetrieveBoolFromJsonObj(b, "b", obj) && b);
}
