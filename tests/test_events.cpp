// Custom events appended to the share queues, and the streaming queue reader.
#include <fcntl.h>
#include <fileindex/error.h>
#include <fileindex/status_mgr.h>
#include <fileindex/utils.h>
#include <sys/file.h>
#include <sys/stat.h>
#include <sys/syscall.h>
#include <sys/wait.h>
#include <unistd.h>

#include <cerrno>

#include "internal/queue_scan.h"
#include "support/sysroot_test.h"

using namespace TAVO::FILEINDEX;

// The library's flock resolves to this one first; it passes through unless a test asks
// for a failing lock on the queue file.
namespace {
int g_flockErrno = 0;
std::string g_queuePath;

bool IsQueue(int fd) {
  char link[4096];
  ssize_t n = ::readlink(("/proc/self/fd/" + std::to_string(fd)).c_str(), link, sizeof(link));
  return n > 0 && std::string(link, static_cast<size_t>(n)) == g_queuePath;
}
}  // namespace

extern "C" int flock(int fd, int op) {
  if (g_flockErrno != 0 && IsQueue(fd)) {
    errno = g_flockErrno;
    return -1;
  }
  return static_cast<int>(::syscall(SYS_flock, fd, op));
}

namespace {

class EventsTest : public SysrootTest {
 protected:
  void SetUp() override {
    SysrootTest::SetUp();
    g_flockErrno = 0;
    dir_ = AddShare("photo").dir;
    full_ = dir_ + "/pics";
    queue_ = dir_ + "/@eaDir/TAVO@file_index_queue";
    g_queuePath = queue_;
    ::mkdir((dir_ + "/@eaDir").c_str(), 0755);
  }
  void TearDown() override {
    g_flockErrno = 0;
    SysrootTest::TearDown();
  }
  std::string Line(const std::string& event, const std::string& path) {
    return "{\"event\":" + event + ",\"path\":\"" + path + "\",\"data\":null}";
  }
  Json::Value NeedReindex() { return ReadJson(StatusConfPath())["need_reindex"]; }

  std::string dir_, full_, queue_;
};

TEST_F(EventsTest, AppendsOneLinePerEvent) {
  Json::Value settings;
  settings["document"] = true;
  ASSERT_TRUE(AddCustomEvent(131072, full_, settings));
  ASSERT_TRUE(AddCustomEvent(65536, full_ + "/sub", Json::Value()));
  const std::string text = ReadFile(queue_);
  std::vector<std::string> lines = ReadLines(queue_);
  ASSERT_EQ(lines.size(), 2u);
  EXPECT_EQ(text, lines[0] + "\n" + lines[1] + "\n");
  EXPECT_EQ(ParseJson(lines[0]),
            ParseJson("{\"event\":131072,\"path\":\"" + full_ + "\",\"data\":{\"document\":true}}"));
  EXPECT_EQ(ParseJson(lines[1]), ParseJson(Line("65536", full_ + "/sub")));
  struct stat st;
  ASSERT_EQ(::stat(queue_.c_str(), &st), 0);
  mode_t mask = ::umask(0);
  ::umask(mask);
  EXPECT_EQ(st.st_mode & 0777, 0644u & ~mask);
  EXPECT_FALSE(Exists(StatusConfPath()));
}

TEST_F(EventsTest, PendingReindexOfTheSamePathAbsorbsAnyEvent) {
  // None of these is a pending reindex of full_; the event is appended after them.
  const std::string others = Line("\"65536\"", full_) + "\n" + Line("65537", full_) + "\n" +
                             Line("65536", full_ + "/x") + "\n" + Line("65536", dir_) + "\n" +
                             Line("null", full_) + "\n" + Line("65536", full_) + " x\n" +
                             "{\"event\":65536,\"path\":[\"" + full_ + "\"]}\n";
  WriteFile(queue_, others);
  ASSERT_TRUE(AddCustomEvent(131072, full_, Json::Value()));
  EXPECT_EQ(ReadLines(queue_).size(), 8u);

  // Each of these absorbs it: in the ".tmp" companion, as a real that reads as 65536, with
  // an escaped path, with a trailing "\r", or as a last line without newline.
  for (const std::string& pending :
       {Line("65536", full_) + "\n", Line("65536.5", full_) + "\n", Line("6.5536e4", full_) + "\n",
        Line("65536", dir_ + "\\/\\u0070ics") + "\n", Line("65536", full_) + "\r\n",
        others + Line("65536", full_)}) {
    WriteFile(queue_, "");
    WriteFile(queue_ + ".tmp", pending);
    EXPECT_TRUE(AddCustomEvent(65536, full_, Json::Value())) << pending;
    EXPECT_EQ(ReadFile(queue_), "") << pending;
    ::unlink((queue_ + ".tmp").c_str());
    WriteFile(queue_, pending);
    EXPECT_TRUE(AddCustomEvent(131072, full_, Json::Value())) << pending;
    EXPECT_EQ(ReadFile(queue_), pending);
  }
}

TEST_F(EventsTest, QueueLockedElsewhereDropsTheEvent) {
  WriteFile(queue_, "");
  int ready[2], release[2];
  ASSERT_EQ(::pipe(ready), 0);
  ASSERT_EQ(::pipe(release), 0);
  pid_t child = ::fork();
  if (child == 0) {
    ::close(ready[0]);
    ::close(release[1]);
    int fd = ::open(queue_.c_str(), O_RDWR);
    char c = ::flock(fd, LOCK_EX) == 0 ? 'x' : 'e';
    if (::write(ready[1], &c, 1) != 1) ::_exit(1);
    if (::read(release[0], &c, 1) < 0) ::_exit(1);
    ::_exit(0);
  }
  ::close(ready[1]);
  ::close(release[0]);
  char c = 0;
  ASSERT_EQ(::read(ready[0], &c, 1), 1);
  ASSERT_EQ(c, 'x');

  EXPECT_TRUE(AddCustomEvent(131072, full_, Json::Value()));
  EXPECT_TRUE(logcap::Texts().empty());
  LOG_LEVEL = 7;
  EXPECT_TRUE(AddCustomEvent(131072, full_, Json::Value()));
  EXPECT_EQ(logcap::Texts().size(), 1u);
  EXPECT_TRUE(logcap::Contains(" try lock too many times, path=" + queue_ +
                               ", reason=Resource temporarily unavailable"));

  ::close(release[1]);
  ::close(ready[0]);
  int status = 0;
  ASSERT_EQ(::waitpid(child, &status, 0), child);
  EXPECT_EQ(ReadFile(queue_), "");
  EXPECT_FALSE(Exists(StatusConfPath()));
}

TEST_F(EventsTest, UnwritableQueueMarksTheShare) {
  // Outside every share: the empty share name is marked.
  EXPECT_FALSE(AddCustomEvent(65536, "/elsewhere/x", Json::Value()));
  EXPECT_TRUE(logcap::Contains("utils:"));
  EXPECT_TRUE(logcap::Contains(" TAVOShareNamePathGet failed, path=/elsewhere/x"));
  EXPECT_EQ(NeedReindex(), ParseJson(R"({"":true})"));

  // A link at the queue path is never followed.
  ASSERT_EQ(::symlink("/nonexistent", queue_.c_str()), 0);
  EXPECT_FALSE(AddCustomEvent(65536, full_, Json::Value()));
  EXPECT_EQ(NeedReindex(), ParseJson(R"({"":true,"photo":true})"));
  ::unlink(queue_.c_str());

  // flock errors other than a busy lock: the debug line only at LOG_LEVEL 7.
  g_flockErrno = ENOLCK;
  for (int level : {3, 8, 7}) {
    logcap::Clear();
    LOG_LEVEL = level;
    EXPECT_FALSE(AddCustomEvent(65536, full_, Json::Value()));
    EXPECT_EQ(logcap::Count(" flock fail, path=" + queue_ + ", reason=No locks available"),
              level == 7 ? 1 : 0);
  }
  g_flockErrno = 0;
  EXPECT_EQ(ReadFile(queue_), "");

  // A share whose marking fails as well.
  int lockFd = ::open(Rooted("/tmp/fileidx_cfg_status.lock").c_str(), O_RDWR | O_CREAT | O_CLOEXEC, 0644);
  ASSERT_EQ(::flock(lockFd, LOCK_EX), 0);
  fake::Get().forced["TAVOShareGet"] = -1;
  logcap::Clear();
  EXPECT_FALSE(AddCustomEvent(65536, full_, Json::Value()));
  EXPECT_TRUE(logcap::Contains(" FILEIDXQueuePathGet failed, share=photo"));
  EXPECT_TRUE(logcap::Contains(" ShareSetNeedReindex failed, share=photo"));
  ::close(lockFd);
}

TEST(QueueScan, SplitsLinesAcrossBlocksAtNewlinesOnly) {
  char tmpl[] = "/tmp/fileindex-scan-XXXXXX";
  int fd = ::mkstemp(tmpl);
  ASSERT_GE(fd, 0);
  // The second line straddles the first 1 MiB block.
  const std::vector<std::string> lines{std::string((1 << 20) - 3, 'a'), "bcdefg", "", "h\r", "last"};
  std::string text;
  for (const std::string& line : lines) text += line + "\n";
  text.pop_back();
  ASSERT_EQ(::write(fd, text.data(), text.size()), static_cast<ssize_t>(text.size()));
  ::close(fd);

  std::vector<std::string> seen;
  ASSERT_TRUE(internal::ForEachQueueLine(tmpl, [&](const char* data, size_t size) {
    seen.emplace_back(data, size);
    return true;
  }));
  EXPECT_EQ(seen, lines);
  seen.clear();
  ASSERT_TRUE(internal::ForEachQueueLine(tmpl, [&](const char* data, size_t size) {
    seen.emplace_back(data, size);
    return seen.size() < 2;
  }));
  EXPECT_EQ(seen.size(), 2u);
  ::unlink(tmpl);

  errno = 0;
  EXPECT_FALSE(internal::ForEachQueueLine(tmpl, [](const char*, size_t) { return true; }));
  EXPECT_EQ(errno, ENOENT);
}

TEST(QueueScan, ValidLinesFollowTheUnsignedConversionRule) {
  internal::QueueEvent event;
  auto parse = [&event](const std::string& text) {
    return internal::ParseQueueLine(text.data(), text.size(), event);
  };
  const std::vector<std::pair<std::string, unsigned>> valid{
      {"null", 0}, {"true", 1}, {"false", 0}, {"4294967295", 4294967295u}, {"4294967295.0", 4294967295u},
      {"1.5", 1},  {"-0.0", 0}, {"256", 256}, {"6.5536e4", 65536}};
  for (const auto& v : valid) {
    ASSERT_TRUE(parse("{\"event\":" + v.first + ",\"path\":\"/p\"}")) << v.first;
    EXPECT_EQ(event.event, v.second) << v.first;
    EXPECT_EQ(event.path, "/p");
  }
  for (const char* bad : {"4294967296", "-1", "-0.5", "\"5\"", "[]", "{}"}) {
    EXPECT_FALSE(parse(std::string("{\"event\":") + bad + ",\"path\":\"/p\"}")) << bad;
  }
  for (const char* bad : {"{\"event\":1}", "{\"path\":\"/p\"}", "{\"event\":1,\"path\":null}", "[1]",
                          "{\"event\":1,\"path\":\"/p\"} x", "{\"event\":1,/*c*/\"path\":\"/p\"}", ""}) {
    EXPECT_FALSE(parse(bad)) << bad;
  }
  EXPECT_FALSE(parse("{\"event\":1,\"path\":\"/p\",\"x\":" + std::string(5000, '[') + "}"));
  ASSERT_TRUE(parse("{\"event\":256,\"path\":\"/a\",\"path_old\":\"/b\"}\r"));
  EXPECT_TRUE(event.hasPathOld);
  EXPECT_EQ(event.pathOld, "/b");
  ASSERT_TRUE(parse("{\"event\":256,\"path\":\"/a\",\"path_old\":7}"));
  EXPECT_FALSE(event.hasPathOld);
  EXPECT_EQ(event.pathOld, "");
}

}  // namespace
