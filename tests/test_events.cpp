// Custom events appended to the share queues.
#include <fileindex/error.h>
#include <fileindex/utils.h>
#include <sched.h>
#include <sys/mount.h>
#include <sys/stat.h>
#include <sys/syscall.h>
#include <unistd.h>

#include <cerrno>

#include "support/sysroot_test.h"

using namespace TAVO::FILEINDEX;

// The library's flock resolves to this one first; it fails with g_flockErrno on the queue.
static int g_flockErrno = 0;
static std::string g_queuePath;

extern "C" int flock(int fd, int op) {
  char link[4096];
  ssize_t n = ::readlink(("/proc/self/fd/" + std::to_string(fd)).c_str(), link, sizeof(link));
  if (g_flockErrno != 0 && n > 0 && std::string(link, static_cast<size_t>(n)) == g_queuePath) {
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
    g_queuePath = queue_ = Queue("photo");
    ::mkdir(EaDir("photo").c_str(), 0755);
  }
  std::string Line(const std::string& event, const std::string& path) {
    return "{\"event\":" + event + ",\"path\":\"" + path + "\",\"data\":null}";
  }
  std::string dir_, full_, queue_;
};

// Only a reindex (65536) of exactly this path, in the queue or its ".tmp" companion, absorbs a new
// event; anything else gets one line of its own.
TEST_F(EventsTest, PendingReindexOfTheSamePathAbsorbsAnyEvent) {
  const std::string others = Line("\"65536\"", full_) + "\n" + Line("65537", full_) + "\n" +
                             Line("65536", full_ + "/x") + "\n" + Line("65536", full_) + " x\n";
  WriteFile(queue_, others);
  ASSERT_TRUE(AddCustomEvent(131072, full_, ParseJson("{\"document\":true}")));
  EXPECT_EQ(ReadFile(queue_),
            others + R"({"data":{"document":true},"event":131072,"path":")" + full_ + "\"}\n");
  for (const std::string& pending :
       {Line("6.5536e4", full_) + "\n", Line("65536", dir_ + "\\/pics") + "\r\n"})
    for (const std::string& file : {queue_ + ".tmp", queue_}) {
      ::unlink((queue_ + ".tmp").c_str());
      WriteFile(queue_, "");
      WriteFile(file, pending);
      EXPECT_TRUE(AddCustomEvent(131072, full_, Json::Value())) << pending;
      EXPECT_EQ(ReadFile(queue_), file == queue_ ? pending : "") << pending;
    }
}

// A busy queue drops the event quietly (debug line only at LOG_LEVEL 7); other lock errors fail it
// and mark the share, as does a path outside every share.
TEST_F(EventsTest, LockFailuresAndUnknownShares) {
  WriteFile(queue_, "");
  g_flockErrno = EWOULDBLOCK;
  const std::string busy =
      " try lock too many times, path=" + queue_ + ", reason=Resource temporarily unavailable";
  for (int level : {3, 7}) {
    LOG_LEVEL = level;
    EXPECT_TRUE(AddCustomEvent(131072, full_, Json::Value()));
    EXPECT_EQ(logcap::Count(busy), level == 7 ? 1 : 0);
  }
  EXPECT_FALSE(Exists(StatusConfPath()));
  g_flockErrno = ENOLCK;
  EXPECT_FALSE(AddCustomEvent(131072, full_, Json::Value()));
  EXPECT_TRUE(logcap::Contains(" flock fail, path=" + queue_ + ", reason=No locks available"));
  EXPECT_EQ(ReadFile(queue_), "");
  EXPECT_FALSE(AddCustomEvent(65536, "/elsewhere/x", Json::Value()));
  EXPECT_TRUE(logcap::Contains(" TAVOShareNamePathGet failed, path=/elsewhere/x"));
  EXPECT_EQ(ReadJson(StatusConfPath())["need_reindex"], ParseJson(R"({"":true,"photo":true})"));
}

// A short write on a full volume is cut back: every line of the queue stays whole, the call still
// succeeds and the short write is reported at debug level. Event sizes do not divide a page, so the
// volume fills up in the middle of a line.
TEST_F(EventsTest, FullVolumeNeverLeavesAPartialLine) {
  // In a private mount namespace, so the small tmpfs never shows on the host.
  if (::unshare(CLONE_NEWNS) != 0 || ::mount("none", "/", "none", MS_REC | MS_PRIVATE, nullptr) != 0 ||
      ::mount("tmpfs", (dir_ + "/@eaDir").c_str(), "tmpfs", 0, "size=64k") != 0)
    GTEST_SKIP() << "cannot mount a small tmpfs in a private mount namespace here";
  LOG_LEVEL = 7;
  Json::Value data(Json::objectValue);
  for (int i = 0; i < 40; ++i) {
    data["pad"] = std::string(2500 + 97 * i, static_cast<char>('a' + i % 26));
    ASSERT_TRUE(AddCustomEvent(131072, full_ + "/" + std::to_string(i), data));
    const std::string text = ReadFile(queue_);
    ASSERT_TRUE(text.empty() || text.back() == '\n') << "torn after event " << i;
  }
  const std::vector<std::string> lines = ReadLines(queue_);
  EXPECT_TRUE(lines.size() > 5 && lines.size() < 40) << lines.size();
  for (size_t i = 0; i < lines.size(); ++i)  // whole events, in order (ParseJson fails on a cut one)
    EXPECT_EQ(ParseJson(lines[i])["path"].asString(), full_ + "/" + std::to_string(i));
  EXPECT_GE(logcap::Count(" write fail, ("), 1);
  ::umount((dir_ + "/@eaDir").c_str());
}

}  // namespace
