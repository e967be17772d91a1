// The daemon command channel, seen from the daemon's side of the socket, and the frame
// decoder that the fake daemon and the probe share.
#include <fileindex/error.h>
#include <fileindex/utils.h>
#include <signal.h>
#include <sys/socket.h>
#include <sys/stat.h>
#include <sys/syscall.h>
#include <sys/time.h>
#include <sys/un.h>
#include <unistd.h>

#include <cerrno>
#include <cstring>
#include <deque>
#include <filesystem>
#include <mutex>

#include "internal/json_io.h"
#include "support/fake_daemon.h"
#include "support/sysroot_test.h"

using namespace TAVO::FILEINDEX;

// A spy on the library's socket calls: the test executable's own write() and setsockopt()
// take precedence over the C library's. Socket descriptors only; everything else passes.
namespace spy {
std::mutex mu;
bool active = false;
std::vector<size_t> writeSizes;                   // sizes asked for, socket writes only
std::deque<std::pair<ssize_t, int>> writeScript;  // results (and errno) to give instead of writing
std::vector<struct timeval> timeouts;             // SO_SNDTIMEO values set
int setsockoptResult = 0;                         // non-zero: returned instead of setting
}  // namespace spy

extern "C" ssize_t write(int fd, const void* buf, size_t n) {
  {
    std::lock_guard<std::mutex> lock(spy::mu);
    struct stat st;
    if (spy::active && ::fstat(fd, &st) == 0 && S_ISSOCK(st.st_mode)) {
      spy::writeSizes.push_back(n);
      if (!spy::writeScript.empty()) {
        std::pair<ssize_t, int> scripted = spy::writeScript.front();
        spy::writeScript.pop_front();
        errno = scripted.second;
        return scripted.first;
      }
    }
  }
  return ::syscall(SYS_write, fd, buf, n);
}

extern "C" int setsockopt(int fd, int level, int name, const void* value, socklen_t len) noexcept {
  {
    std::lock_guard<std::mutex> lock(spy::mu);
    if (spy::active) {
      struct timeval tv = {-1, -1};
      if (level == SOL_SOCKET && name == SO_SNDTIMEO && len == sizeof(tv)) std::memcpy(&tv, value, len);
      spy::timeouts.push_back(tv);
      if (spy::setsockoptResult != 0) return errno = ENOPROTOOPT, spy::setsockoptResult;
    }
  }
  return static_cast<int>(::syscall(SYS_setsockopt, fd, level, name, value, len));
}

namespace {

long OpenDescriptors() { return std::distance(std::filesystem::directory_iterator("/proc/self/fd"), {}); }

std::string Frame(const std::string& text) {
  uint32_t length = static_cast<uint32_t>(text.size() + 1);
  return std::string(reinterpret_cast<const char*>(&length), 4) + text + '\0';
}

std::string TextOf(const std::string& type, const Json::Value& data) {
  Json::Value message(Json::objectValue);
  message["type"] = type;
  message["data"] = data;
  return internal::JsonToString(message);
}

class DaemonIoTest : public SysrootTest {
 protected:
  void SetUp() override {
    SysrootTest::SetUp();
    std::lock_guard<std::mutex> lock(spy::mu);
    spy::active = true;
    spy::writeSizes.clear();
    spy::timeouts.clear();
  }
  void TearDown() override {
    spy::active = false;
    daemon_.Stop();
    SysrootTest::TearDown();
  }
  FakeDaemon daemon_;
};

// One connection per command: a 4-byte length, then the JSON text and its terminating zero,
// written in pieces of at most 1024 bytes after a 1 s send timeout is set.
TEST_F(DaemonIoTest, OneFramePerCommandInPiecesOfAtMost1024Bytes) {
  ASSERT_TRUE(daemon_.Start(SocketPath()));
  Json::Value data(Json::objectValue);
  data["path"] = "/volume1/photo/é";
  data["blob"] = std::string(2800, 'a');  // three pieces
  ASSERT_TRUE(SendCammandToDaemon("upsert_folder_setting", data));
  ASSERT_TRUE(SendCammandToDaemon("pause", Json::Value()));  // null data goes as JSON null

  const std::string text = TextOf("upsert_folder_setting", data), pause = TextOf("pause", Json::Value());
  EXPECT_EQ(daemon_.RawFrames(), (std::vector<std::string>{Frame(text), Frame(pause)}));
  const size_t total = text.size() + 1;
  EXPECT_EQ(spy::writeSizes, (std::vector<size_t>{4, 1024, 1024, total - 2048, 4, pause.size() + 1}));
  ASSERT_EQ(spy::timeouts.size(), 2u);
  EXPECT_EQ(spy::timeouts[0].tv_sec, 1);
  EXPECT_EQ(spy::timeouts[0].tv_usec, 0);
  EXPECT_TRUE(logcap::Texts().empty());
}

// No daemon (no socket file, or nobody listening): fails at once, quietly, without writing
// or leaking a descriptor; SIGPIPE is ignored from then on anyway.
TEST_F(DaemonIoTest, NoListeningDaemonFailsAtOnceAndLeavesNoDescriptor) {
  ::signal(SIGPIPE, SIG_DFL);
  const long before = OpenDescriptors();
  EXPECT_FALSE(SendCammandToDaemon("pause", Json::Value()));
  int stale = ::socket(AF_UNIX, SOCK_STREAM, 0);
  struct sockaddr_un addr = {};
  addr.sun_family = AF_UNIX;
  std::strncpy(addr.sun_path, SocketPath().c_str(), sizeof(addr.sun_path) - 1);
  ASSERT_EQ(::bind(stale, reinterpret_cast<struct sockaddr*>(&addr), sizeof(addr)), 0);
  EXPECT_FALSE(SendCammandToDaemon("resume", Json::Value()));
  ::close(stale);
  EXPECT_EQ(OpenDescriptors(), before);
  EXPECT_TRUE(spy::writeSizes.empty() && spy::timeouts.empty());
  struct sigaction current;
  ASSERT_EQ(::sigaction(SIGPIPE, nullptr, &current), 0);
  EXPECT_EQ(current.sa_handler, SIG_IGN);
  EXPECT_TRUE(logcap::Texts().empty());
  EXPECT_EQ(ErrorHandler::GetError(), FILEINDEX_ERR_NONE);
}

// A failed timeout ends the command before any write. A write returning 0 is retried while
// errno is EINTR, three times at most; any other errno ends it at once. The socket is closed.
TEST_F(DaemonIoTest, FailedTimeoutOrWriteEndsTheCommandAndClosesTheSocket) {
  ASSERT_TRUE(daemon_.Start(SocketPath()));
  const long before = OpenDescriptors();
  spy::setsockoptResult = -1;
  EXPECT_FALSE(SendCammandToDaemon("pause", Json::Value()));
  spy::setsockoptResult = 0;
  EXPECT_TRUE(spy::writeSizes.empty());

  struct Case {
    std::deque<std::pair<ssize_t, int>> script;
    bool ok;
    size_t writes;
  };
  const Case cases[] = {
      {{{0, EINTR}, {0, EINTR}, {0, EINTR}}, true, 5},
      {{{0, EINTR}, {0, EINTR}, {0, EINTR}, {0, EINTR}}, false, 4},
      {{{0, EAGAIN}}, false, 1},
      {{{4, 0}, {0, 0}}, false, 2},
  };
  for (const Case& c : cases) {
    spy::writeScript = c.script;
    spy::writeSizes.clear();
    EXPECT_EQ(SendCammandToDaemon("resume", Json::Value()), c.ok) << c.writes;
    EXPECT_EQ(spy::writeSizes.size(), c.writes);
  }
  std::vector<fileindex_frame::DecodedFrame> frames = daemon_.Frames();
  ASSERT_EQ(frames.size(), 5u) << "every attempt connected once";
  EXPECT_EQ(frames[1].raw, Frame(TextOf("resume", Json::Value())));
  for (size_t i : {0u, 2u, 3u, 4u}) EXPECT_TRUE(frames[i].raw.empty()) << i;
  EXPECT_EQ(OpenDescriptors(), before);
}

// A write "returning -1" is taken as a count: the piece is re-sent from one byte earlier.
TEST_F(DaemonIoTest, MinusOneFromWriteIsTakenAsACount) {
  ASSERT_TRUE(daemon_.Start(SocketPath()));
  Json::Value data(Json::objectValue);
  data["blob"] = std::string(1500, 'b');
  const std::string text = TextOf("upsert_folder_setting", data);
  spy::writeScript = {{4, 0}, {1024, 0}, {-1, EPIPE}};
  ASSERT_TRUE(SendCammandToDaemon("upsert_folder_setting", data));
  const size_t total = text.size() + 1;
  EXPECT_EQ(spy::writeSizes, (std::vector<size_t>{4, 1024, total - 1024, total - 1023}));
  // Scripted writes put nothing on the wire; the real one sends from position 1023.
  std::vector<fileindex_frame::DecodedFrame> frames = daemon_.Frames();
  ASSERT_EQ(frames.size(), 1u);
  EXPECT_EQ(frames[0].raw, Frame(text).substr(4 + 1023));
}

// The decoder accepts a well-formed frame and names what is wrong with a malformed one.
TEST(FrameDecoder, RefusesMalformedFramesWithAReason) {
  const std::string good = Frame("{\"data\":{\"a\":1},\"type\":\"pause\"}");
  fileindex_frame::DecodedFrame frame = fileindex_frame::DecodeFrame(good);
  ASSERT_TRUE(frame.ok) << frame.error;
  EXPECT_EQ(fileindex_frame::CompactJson(frame.Report()), "{\"data\":{\"a\":1},\"type\":\"pause\"}");
  const std::pair<std::string, const char*> cases[] = {
      {"", "empty connection"},
      {std::string(4, '\0'), "zero length"},
      {good.substr(0, good.size() - 1), "truncated frame"},
      {good + "x", "trailing bytes"},
      {Frame("{\"type\":\"pause\",\"data\":1} x"), "invalid json"},
      {Frame("{\"type\":\"pause\"}"), "not a command object"},
  };
  for (const auto& c : cases) {
    frame = fileindex_frame::DecodeFrame(c.first);
    EXPECT_FALSE(frame.ok) << c.second;
    EXPECT_EQ(frame.error, c.second);
    EXPECT_EQ(frame.Report()["received"].asUInt64(), c.first.size()) << c.second;
  }
}

}  // namespace
