// The daemon command channel, seen from the daemon's side of the socket. The spy functions
// below take precedence over the C library's; only the test's own thread calls them.
#include <fileindex/utils.h>
#include <sys/socket.h>
#include <sys/stat.h>
#include <sys/syscall.h>
#include <unistd.h>

#include <cerrno>
#include <deque>
#include <filesystem>

#include "support/fake_daemon.h"
#include "support/sysroot_test.h"

using namespace TAVO::FILEINDEX;
using DaemonIoTest = SysrootTest;

static bool spying = false;
static std::vector<size_t> writeSizes;                   // sizes asked for, socket writes only
static std::deque<std::pair<ssize_t, int>> writeScript;  // results (and errno) given instead of writing
static std::vector<struct timeval> sendTimeouts;         // SO_SNDTIMEO values set

extern "C" ssize_t write(int fd, const void* buf, size_t n) {
  struct stat st;
  if (!spying || ::fstat(fd, &st) != 0 || !S_ISSOCK(st.st_mode)) return ::syscall(SYS_write, fd, buf, n);
  writeSizes.push_back(n);
  if (writeScript.empty()) return ::syscall(SYS_write, fd, buf, n);
  const auto [result, error] = writeScript.front();
  writeScript.pop_front();
  errno = error;
  return result;
}

extern "C" int setsockopt(int fd, int level, int name, const void* value, socklen_t len) noexcept {
  if (spying && level == SOL_SOCKET && name == SO_SNDTIMEO && len == sizeof(struct timeval))
    sendTimeouts.push_back(*static_cast<const struct timeval*>(value));
  return static_cast<int>(::syscall(SYS_setsockopt, fd, level, name, value, len));
}

namespace {

long OpenDescriptors() { return std::distance(std::filesystem::directory_iterator("/proc/self/fd"), {}); }

// The socket file of a daemon that died fails the call at once, quietly. Then: one connection per
// command, a 1 s send timeout, pieces of at most 1024 bytes; a write returning 0 is retried on EINTR
// three times at most; a -1 is taken as a count: the piece goes again from a byte earlier.
TEST_F(DaemonIoTest, FramesGoInPiecesAndWriteResultsDecideRetries) {
  writeSizes.clear();
  sendTimeouts.clear();
  spying = true;
  const long before = OpenDescriptors();
  ASSERT_EQ(::mknod(SocketPath().c_str(), S_IFSOCK | 0600, 0), 0);
  EXPECT_FALSE(SendCammandToDaemon("resume", Json::Value()));
  EXPECT_TRUE(writeSizes.empty() && sendTimeouts.empty() && logcap::Texts().empty());
  FakeDaemon daemon;
  ASSERT_TRUE(daemon.Start(SocketPath()));
  const Json::Value data(std::string(1500, 'b'));
  ASSERT_TRUE(SendCammandToDaemon("upsert_folder_setting", data));
  const std::string upsert = daemon.RawFrames().at(0);
  EXPECT_EQ(daemon.Commands().at(0)["data"], data);  // the pieces make one whole frame
  writeScript = {{0, EINTR}, {0, EINTR}, {0, EINTR}, {0, EINTR}, {0, EAGAIN}};
  writeSizes.clear();
  EXPECT_FALSE(SendCammandToDaemon("resume", Json::Value()));  // gives up after three retries
  EXPECT_EQ(writeSizes.size(), 4u);
  EXPECT_FALSE(SendCammandToDaemon("resume", Json::Value()));  // retries on EINTR only
  EXPECT_EQ(writeSizes.size(), 5u);
  writeScript = {{4, 0}, {0, EINTR}, {1024, 0}, {-1, EPIPE}};
  writeSizes.clear();
  ASSERT_TRUE(SendCammandToDaemon("upsert_folder_setting", data));
  EXPECT_EQ(writeSizes, (std::vector<size_t>{4, 1024, 1024, upsert.size() - 1028, upsert.size() - 1027}));
  // Scripted writes put nothing on the wire.
  EXPECT_EQ(daemon.RawFrames(), (std::vector<std::string>{upsert, "", "", upsert.substr(4 + 1023)}));
  ASSERT_EQ(sendTimeouts.size(), 4u);
  for (const struct timeval& tv : sendTimeouts) EXPECT_TRUE(tv.tv_sec == 1 && tv.tv_usec == 0);
  daemon.Stop();
  EXPECT_EQ(OpenDescriptors(), before);
}

}  // namespace
