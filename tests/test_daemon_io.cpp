// The daemon command channel, seen from the daemon's side of the socket. The spy functions
// below take precedence over the C library's.
#include <fileindex/error.h>
#include <fileindex/utils.h>
#include <sys/socket.h>
#include <sys/stat.h>
#include <sys/syscall.h>
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

namespace spy {
std::mutex mu;
bool active = false;
std::vector<size_t> writeSizes;                   // sizes asked for, socket writes only
std::deque<std::pair<ssize_t, int>> writeScript;  // results (and errno) given instead of writing
std::vector<struct timeval> timeouts;             // SO_SNDTIMEO values set
}  // namespace spy

extern "C" ssize_t write(int fd, const void* buf, size_t n) {
  std::unique_lock<std::mutex> lock(spy::mu);
  struct stat st;
  if (spy::active && ::fstat(fd, &st) == 0 && S_ISSOCK(st.st_mode)) {
    spy::writeSizes.push_back(n);
    if (!spy::writeScript.empty()) {
      const std::pair<ssize_t, int> scripted = spy::writeScript.front();
      spy::writeScript.pop_front();
      return errno = scripted.second, scripted.first;
    }
  }
  lock.unlock();
  return ::syscall(SYS_write, fd, buf, n);
}

extern "C" int setsockopt(int fd, int level, int name, const void* value, socklen_t len) noexcept {
  struct timeval tv = {-1, -1};
  if (level == SOL_SOCKET && name == SO_SNDTIMEO && len == sizeof(tv)) std::memcpy(&tv, value, len);
  if (std::lock_guard<std::mutex> lock(spy::mu); spy::active) spy::timeouts.push_back(tv);
  return static_cast<int>(::syscall(SYS_setsockopt, fd, level, name, value, len));
}

namespace {

long OpenDescriptors() { return std::distance(std::filesystem::directory_iterator("/proc/self/fd"), {}); }

// The bytes of a command: a 4-byte length, then the JSON text and its terminating zero.
std::string Frame(const std::string& type, const Json::Value& data) {
  Json::Value message;
  message["type"] = type, message["data"] = data;
  const std::string text = internal::JsonToString(message);
  const uint32_t length = static_cast<uint32_t>(text.size() + 1);
  return std::string(reinterpret_cast<const char*>(&length), 4) + text + '\0';
}

class DaemonIoTest : public SysrootTest {
 protected:
  void SetUp() override {
    SysrootTest::SetUp(), spy::active = true, spy::writeSizes.clear(), spy::timeouts.clear();
  }
  void TearDown() override { spy::active = false, SysrootTest::TearDown(); }
};

// No daemon (no socket file, or nobody listening): fails at once, quietly, without writing
// or leaking a descriptor.
TEST_F(DaemonIoTest, NoListeningDaemonFailsAtOnceAndLeavesNoDescriptor) {
  const long before = OpenDescriptors();
  EXPECT_FALSE(SendCammandToDaemon("pause", Json::Value()));
  int stale = ::socket(AF_UNIX, SOCK_STREAM, 0);
  struct sockaddr_un addr = {AF_UNIX, {}};
  std::strncpy(addr.sun_path, SocketPath().c_str(), sizeof(addr.sun_path) - 1);
  ASSERT_EQ(::bind(stale, reinterpret_cast<struct sockaddr*>(&addr), sizeof(addr)), 0);
  EXPECT_FALSE(SendCammandToDaemon("resume", Json::Value()));
  ::close(stale);
  EXPECT_EQ(OpenDescriptors(), before);
  EXPECT_TRUE(spy::writeSizes.empty() && spy::timeouts.empty());
  EXPECT_TRUE(logcap::Texts().empty() && ErrorHandler::GetError() == FILEINDEX_ERR_NONE);
}

// One connection per command, a 1 s send timeout, pieces of at most 1024 bytes. A write returning 0 is
// retried on EINTR three times at most; a -1 is taken as a count: the piece goes again from a byte earlier.
TEST_F(DaemonIoTest, FramesGoInPiecesAndWriteResultsDecideRetries) {
  FakeDaemon daemon;
  ASSERT_TRUE(daemon.Start(SocketPath()));
  const long before = OpenDescriptors();
  Json::Value big;
  big["path"] = "/volume1/photo/é", big["blob"] = std::string(2800, 'a');  // three pieces
  ASSERT_TRUE(SendCammandToDaemon("upsert_folder_setting", big));
  const std::string first = Frame("upsert_folder_setting", big);
  EXPECT_EQ(spy::writeSizes, (std::vector<size_t>{4, 1024, 1024, first.size() - 2052}));
  const std::pair<std::deque<std::pair<ssize_t, int>>, size_t> cases[] = {
      {{{0, EINTR}, {0, EINTR}, {0, EINTR}}, 5},  // succeeds; null data goes as JSON null
      {{{0, EINTR}, {0, EINTR}, {0, EINTR}, {0, EINTR}}, 4},
      {{{0, EAGAIN}}, 1},
  };
  for (const auto& c : cases) {
    spy::writeScript = c.first, spy::writeSizes.clear();
    EXPECT_EQ(SendCammandToDaemon("resume", Json::Value()), c.second == 5) << c.second;
    EXPECT_EQ(spy::writeSizes.size(), c.second);
  }
  const Json::Value data(std::string(1500, 'b'));
  const std::string upsert = Frame("upsert_folder_setting", data);
  spy::writeScript = {{4, 0}, {1024, 0}, {-1, EPIPE}}, spy::writeSizes.clear();
  ASSERT_TRUE(SendCammandToDaemon("upsert_folder_setting", data));
  EXPECT_EQ(spy::writeSizes, (std::vector<size_t>{4, 1024, upsert.size() - 1028, upsert.size() - 1027}));
  // Every attempt connected once; scripted writes put nothing on the wire.
  EXPECT_EQ(daemon.RawFrames(), (std::vector<std::string>{first, Frame("resume", Json::Value()), "", "",
                                                          upsert.substr(4 + 1023)}));
  ASSERT_EQ(spy::timeouts.size(), 5u);
  for (const struct timeval& tv : spy::timeouts) EXPECT_TRUE(tv.tv_sec == 1 && tv.tv_usec == 0);
  EXPECT_EQ(OpenDescriptors(), before);
}

}  // namespace
