// Error codes, log lines, the locked JSON configuration file and share paths.
#include <fileindex/config.h>
#include <fileindex/error.h>
#include <fileindex/utils.h>
#include <sys/file.h>
#include <sys/stat.h>
#include <sys/wait.h>
#include <syslog.h>
#include <unistd.h>

#include <chrono>
#include <regex>

#include "internal/json_io.h"
#include "support/sysroot_test.h"

using namespace TAVO::FILEINDEX;

namespace {

class FileConfig : public Config {
 public:
  FileConfig(std::string path, std::string lockPath) : path_(std::move(path)), lockPath_(std::move(lockPath)) {}
  bool Load() override { return LoadJson(); }
  bool Save() override { return SaveJson(); }
  std::string GetLockPath() const override { return lockPath_; }
  std::string GetPath() const override { return path_; }
  Json::Value& Document() { return m_jsDocument; }
  int Descriptor() const { return m_fdLock; }

 private:
  std::string path_, lockPath_;
};

class FoundationTest : public SysrootTest {
 protected:
  FileConfig MakeConfig() { return FileConfig(Rooted("/usr/tavo/etc/fileindex/test.conf"), Rooted("/tmp/test.lock")); }
};

// Holds an exclusive flock on path in a child process until the returned pipe is closed.
pid_t HoldLockInChild(const std::string& path, int& releaseFd) {
  int ready[2], release[2];
  EXPECT_EQ(::pipe(ready), 0);
  EXPECT_EQ(::pipe(release), 0);
  pid_t pid = ::fork();
  if (pid == 0) {
    ::close(ready[0]);
    ::close(release[1]);
    int fd = ::open(path.c_str(), O_RDWR | O_CREAT, 0644);
    ::flock(fd, LOCK_EX);
    char c = 'x';
    if (::write(ready[1], &c, 1) != 1) ::_exit(1);
    if (::read(release[0], &c, 1) < 0) ::_exit(1);
    ::_exit(0);
  }
  char c;
  EXPECT_EQ(::read(ready[0], &c, 1), 1);
  ::close(ready[0]);
  ::close(ready[1]);
  ::close(release[0]);
  releaseFd = release[1];
  return pid;
}

}  // namespace

TEST_F(FoundationTest, ErrorCodeIsKeptAcrossSuccessAndStoresAnyValue) {
  EXPECT_EQ(ErrorHandler::GetError(), FILEINDEX_ERR_NONE);
  std::string full;
  AddShare("photo");
  EXPECT_FALSE(GetFullPath(full, "/nosuch/a"));
  EXPECT_EQ(ErrorHandler::GetError(), FILEINDEX_ERR_BAD_PATH);
  EXPECT_TRUE(GetFullPath(full, "/photo/a"));
  EXPECT_EQ(ErrorHandler::GetError(), FILEINDEX_ERR_BAD_PATH) << "success must not clear the code";
  ErrorHandler::SetError(static_cast<_tag_fileindex_err_>(1234));
  EXPECT_EQ(static_cast<int>(ErrorHandler::GetError()), 1234);
  EXPECT_EQ(sizeof(ErrorHandler::g_error_code), 4u);
}

TEST_F(FoundationTest, LogLinesHaveUnitAndLinePrefixAtErrorPriorityWhateverTheLevel) {
  std::string full = "unchanged";
  std::vector<std::string> perLevel;
  for (int level : {0, 3, 8}) {
    logcap::Clear();
    LOG_LEVEL = level;
    EXPECT_FALSE(GetFullPath(full, ""));
    ASSERT_EQ(logcap::Lines().size(), 1u) << "level " << level;
    EXPECT_EQ(logcap::Lines()[0].priority, LOG_ERR);
    perLevel.push_back(logcap::Lines()[0].text);
  }
  EXPECT_EQ(full, "unchanged");
  EXPECT_TRUE(std::regex_match(perLevel[0], std::regex("utils:[0-9]+ GetShareNameByPath failed, path=")))
      << perLevel[0];
  EXPECT_EQ(perLevel[0], perLevel[1]);
  EXPECT_EQ(perLevel[1], perLevel[2]);
}

TEST_F(FoundationTest, LockContentionFailsAfterThreeTriesWithCode9) {
  FileConfig config = MakeConfig();
  int release;
  pid_t child = HoldLockInChild(config.GetLockPath(), release);
  auto start = std::chrono::steady_clock::now();
  EXPECT_FALSE(config.Lock(true));
  auto elapsed = std::chrono::steady_clock::now() - start;
  EXPECT_EQ(ErrorHandler::GetError(), FILEINDEX_ERR_LOCK);
  EXPECT_EQ(logcap::Count("config:"), 1);
  EXPECT_TRUE(logcap::Contains(" Failed to lock folder"));
  EXPECT_LT(elapsed, std::chrono::milliseconds(200));
  EXPECT_GE(config.Descriptor(), 0) << "the last opened descriptor stays in the member";
  // A shared lock is refused as well while an exclusive one is held elsewhere.
  EXPECT_FALSE(config.Lock(false));
  ::close(release);
  int status;
  ::waitpid(child, &status, 0);
  // Once released, the lock is taken and given back.
  EXPECT_TRUE(config.Lock(true));
  config.Unlock();
  config.Unlock();  // a second Unlock repeats flock/close on the stale number, harmlessly
}

TEST_F(FoundationTest, MissingLockDirectoryFailsAtOnce) {
  FileConfig config(Rooted("/usr/tavo/etc/fileindex/test.conf"), Rooted("/nodir/test.lock"));
  auto start = std::chrono::steady_clock::now();
  EXPECT_FALSE(config.Lock(true));
  EXPECT_LT(std::chrono::steady_clock::now() - start, std::chrono::milliseconds(5));
  EXPECT_EQ(ErrorHandler::GetError(), FILEINDEX_ERR_LOCK);
  EXPECT_LT(config.Descriptor(), 0);
  config.Unlock();  // never locked: nothing happens
}

TEST_F(FoundationTest, LockFileIsNotFollowedThroughASymbolicLink) {
  std::string target = Rooted("/tmp/elsewhere");
  ASSERT_EQ(::symlink(target.c_str(), Rooted("/tmp/test.lock").c_str()), 0);
  FileConfig config = MakeConfig();
  EXPECT_FALSE(config.Lock(true));
  EXPECT_FALSE(Exists(target));
}

TEST_F(FoundationTest, LoadAndSaveRoundTripWithMode0644) {
  FileConfig config = MakeConfig();
  EXPECT_TRUE(config.Load()) << "a missing file is an empty configuration";
  EXPECT_TRUE(config.Document().isObject());
  EXPECT_EQ(config.Document().size(), 0u);
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
  ASSERT_TRUE(again.Load());
  EXPECT_EQ(again.Document(), config.Document());
}

TEST_F(FoundationTest, ZeroByteOrInvalidFileFailsToLoadWithCode6) {
  FileConfig config = MakeConfig();
  for (const char* content : {"", "{\"a\":1} trailing", "{\"a\":1 /* comment */}", "{"}) {
    WriteFile(config.GetPath(), content);
    logcap::Clear();
    ErrorHandler::g_error_code = FILEINDEX_ERR_NONE;
    EXPECT_FALSE(config.Load()) << "[" << content << "]";
    EXPECT_EQ(ErrorHandler::GetError(), FILEINDEX_ERR_LOAD_CONFIG);
    EXPECT_TRUE(logcap::Contains(" Failed to load json from " + config.GetPath()));
  }
}

TEST_F(FoundationTest, SaveIntoMissingDirectoryFailsWithCode7) {
  FileConfig config(Rooted("/nodir/test.conf"), Rooted("/tmp/test.lock"));
  EXPECT_FALSE(config.Save());
  EXPECT_EQ(ErrorHandler::GetError(), FILEINDEX_ERR_SAVE_CONFIG);
  EXPECT_TRUE(logcap::Contains(" Failed to save json to " + config.GetPath()));
}

TEST_F(FoundationTest, JsonTextHelpersAreStrictAndCompact) {
  Json::Value value;
  EXPECT_TRUE(internal::JsonFromString(value, " {\"event\": 65536, \"path\": \"/v/a\"}\r\n"));
  EXPECT_EQ(internal::JsonToString(value), "{\"event\":65536,\"path\":\"/v/a\"}");
  EXPECT_FALSE(internal::JsonFromString(value, "{\"a\":1}x"));
  EXPECT_FALSE(internal::JsonFromString(value, "// c\n{}"));
  EXPECT_FALSE(internal::JsonFromString(value, ""));
  EXPECT_TRUE(internal::JsonFromString(value, "5"));
  // Deeper than the parser's stack limit: refused, never thrown.
  EXPECT_FALSE(internal::JsonFromString(value, std::string(5000, '[') + std::string(5000, ']')));
}

TEST_F(FoundationTest, ShareNameComesFromTheFirstComponentAfterIndexZero) {
  std::string share = "unchanged";
  EXPECT_FALSE(GetShareNameByPath(share, ""));
  EXPECT_EQ(share, "unchanged");
  const std::pair<const char*, const char*> cases[] = {
      {"/photo/2019", "photo"}, {"/photo", "photo"}, {"/", ""}, {"photo/2019", "hoto"}, {"//a", ""}};
  for (const auto& c : cases) {
    EXPECT_TRUE(GetShareNameByPath(share, c.first));
    EXPECT_EQ(share, c.second) << c.first;
  }
  EXPECT_EQ(ReplaceShareName("", "x"), "");
  EXPECT_EQ(ReplaceShareName("/a", "x"), "/x");
  EXPECT_EQ(ReplaceShareName("/a/", "x"), "/x/");
  EXPECT_EQ(ReplaceShareName("/old/a/b", "new"), "/new/a/b");
}

TEST_F(FoundationTest, FullPathIsTheVolumeOfTheShareDirectoryPlusTheSharePath) {
  AddShare("photo", "/volume1");
  AddShare("data2", "/volume2/data");
  fake::Get().shares["photo2"] = fake::Share{"photo2", "photo2"};  // a directory without a slash
  std::string full;
  EXPECT_TRUE(GetFullPath(full, "/photo/2019"));
  EXPECT_EQ(full, Rooted("/volume1/photo/2019"));
  EXPECT_TRUE(GetFullPath(full, "/data2/x"));
  EXPECT_EQ(full, Rooted("/volume2/data/data2/x"));
  EXPECT_TRUE(GetFullPath(full, "/photo2/y"));
  EXPECT_EQ(full, "photo2/photo2/y");
  EXPECT_EQ(fake::CallsStartingWith("TAVOShareGet").size(), fake::CallsStartingWith("TAVOShareFree").size());

  full = "unchanged";
  logcap::Clear();
  EXPECT_FALSE(GetFullPath(full, "/"));
  EXPECT_EQ(ErrorHandler::GetError(), FILEINDEX_ERR_BAD_PATH);
  EXPECT_EQ(full, "unchanged");
  EXPECT_TRUE(logcap::Lines().empty()) << "an unknown share is not logged";
}

TEST_F(FoundationTest, FullPathToShareUsesThePlatformLookup) {
  AddShare("photo");
  std::string share = "s", dir = "d";
  EXPECT_TRUE(GetShareNamePathByFullPath(share, dir, Rooted("/volume1/photo/2019")));
  EXPECT_EQ(share, "photo");
  EXPECT_EQ(dir, Rooted("/volume1/photo"));
  share = "s";
  EXPECT_FALSE(GetShareNamePathByFullPath(share, dir, "/elsewhere/x"));
  EXPECT_EQ(share, "s");
  EXPECT_EQ(ErrorHandler::GetError(), FILEINDEX_ERR_BAD_PATH);
  EXPECT_TRUE(logcap::Contains(" TAVOShareNamePathGet failed, path=/elsewhere/x"));
}

TEST_F(FoundationTest, PrefixFileAndJsonHelpers) {
  EXPECT_TRUE(StringStartWith("/a/bc", "/a/b"));
  EXPECT_TRUE(StringStartWith("x", ""));
  EXPECT_FALSE(StringStartWith("/a", "/a/"));
  EXPECT_FALSE(StringStartWith("/A/b", "/a"));

  std::string dir = Rooted("/d"), file = Rooted("/f"), link = Rooted("/l"), dirLink = Rooted("/dl");
  ASSERT_EQ(::mkdir(dir.c_str(), 0755), 0);
  WriteFile(file, "x");
  ASSERT_EQ(::symlink(file.c_str(), link.c_str()), 0);
  ASSERT_EQ(::symlink(dir.c_str(), dirLink.c_str()), 0);
  EXPECT_TRUE(IsDirExist(dir));
  EXPECT_FALSE(IsDirExist(file));
  EXPECT_FALSE(IsDirExist(dirLink));
  EXPECT_TRUE(IsFileExist(file));
  EXPECT_FALSE(IsFileExist(link));
  EXPECT_FALSE(IsFileExist(dir));
  EXPECT_FALSE(IsFileExist(Rooted("/missing")));

  Json::Value obj;
  obj["s"] = "text";
  obj["b"] = true;
  obj["n"] = 1;
  std::string s = "keep";
  bool b = false;
  EXPECT_TRUE(RetrieveStringFromJsonObj(s, "s", obj));
  EXPECT_EQ(s, "text");
  EXPECT_FALSE(RetrieveStringFromJsonObj(s, "b", obj));
  EXPECT_FALSE(RetrieveStringFromJsonObj(s, "missing", obj));
  EXPECT_FALSE(RetrieveStringFromJsonObj(s, "s", Json::Value(Json::arrayValue)));
  EXPECT_EQ(s, "text");
  EXPECT_TRUE(RetrieveBoolFromJsonObj(b, "b", obj));
  EXPECT_TRUE(b);
  EXPECT_FALSE(RetrieveBoolFromJsonObj(b, "n", obj));
  EXPECT_FALSE(RetrieveBoolFromJsonObj(b, "s", obj));
}
