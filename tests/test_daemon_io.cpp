// The daemon command channel, seen from the daemon's side of the socket, and the frame
// decoder that the fake daemon and the probe share.
#include <dirent.h>
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
#include <chrono>
#include <cstring>
#include <deque>
#include <mutex>

#include "internal/json_io.h"
#include "support/fake_daemon.h"
#include "support/sysroot_test.h"

using namespace TAVO::FILEINDEX;

// --- a spy on the socket calls the library makes ---
// The test executable's own write() and setsockopt() take precedence over the C
// library's for the library's calls. Socket descriptors only; everything else passes.
namespace spy {
std::mutex mu;
bool active = false;
std::vector<size_t> writeSizes;                   // sizes asked for, socket writes only
std::deque<std::pair<ssize_t, int>> writeScript;  // results (and errno) to give instead of writing
struct SockOpt {
  int level, name;
  struct timeval timeout;
};
std::vector<SockOpt> sockOpts;
int setsockoptResult = 0;  // non-zero: returned instead of setting

bool IsSocket(int fd) {
  struct stat st;
  return ::fstat(fd, &st) == 0 && S_ISSOCK(st.st_mode);
}

void Start() {
  std::lock_guard<std::mutex> lock(mu);
  active = true;
  writeSizes.clear();
  writeScript.clear();
  sockOpts.clear();
  setsockoptResult = 0;
}

void Stop() {
  std::lock_guard<std::mutex> lock(mu);
  active = false;
}
}  // namespace spy

extern "C" ssize_t write(int fd, const void* buf, size_t n) {
  {
    std::lock_guard<std::mutex> lock(spy::mu);
    if (spy::active && spy::IsSocket(fd)) {
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
      spy::SockOpt opt{level, name, {0, 0}};
      if (name == SO_SNDTIMEO && len == sizeof(struct timeval)) std::memcpy(&opt.timeout, value, len);
      spy::sockOpts.push_back(opt);
      if (spy::setsockoptResult != 0) {
        errno = ENOPROTOOPT;
        return spy::setsockoptResult;
      }
    }
  }
  return static_cast<int>(::syscall(SYS_setsockopt, fd, level, name, value, len));
}

namespace {

size_t OpenDescriptors() {
  size_t n = 0;
  DIR* dir = ::opendir("/proc/self/fd");
  if (dir == nullptr) return 0;
  while (struct dirent* entry = ::readdir(dir)) {
    if (entry->d_name[0] != '.') ++n;
  }
  ::closedir(dir);
  return n;
}

std::string Frame(const std::string& text) {
  uint32_t length = static_cast<uint32_t>(text.size() + 1);
  std::string bytes(reinterpret_cast<const char*>(&length), 4);
  bytes += text;
  bytes += '\0';
  return bytes;
}

class DaemonIoTest : public SysrootTest {
 protected:
  void SetUp() override {
    SysrootTest::SetUp();
    spy::Start();
  }
  void TearDown() override {
    spy::Stop();
    daemon_.Stop();
    SysrootTest::TearDown();
  }

  static std::string TextOf(const std::string& type, const Json::Value& data) {
    Json::Value message(Json::objectValue);
    message["type"] = type;
    message["data"] = data;
    return internal::JsonToString(message);
  }

  FakeDaemon daemon_;
};

TEST_F(DaemonIoTest, OneFramePerCommandWithLengthTextAndTerminator) {
  ASSERT_TRUE(daemon_.Start(SocketPath()));
  Json::Value data(Json::objectValue);
  data["path"] = "/volume1/photo/é";
  data["share"] = "photo";
  ASSERT_TRUE(SendCammandToDaemon("upsert_folder_setting", data));
  ASSERT_TRUE(SendCammandToDaemon("pause", Json::Value()));

  std::vector<std::string> raw = daemon_.RawFrames();
  ASSERT_EQ(raw.size(), 2u) << "one connection per command";
  const std::string text = TextOf("upsert_folder_setting", data);
  EXPECT_EQ(raw[0], Frame(text));
  uint32_t length;
  std::memcpy(&length, raw[0].data(), 4);
  EXPECT_EQ(length, text.size() + 1);
  EXPECT_EQ(raw[0].size(), text.size() + 5);
  EXPECT_EQ(raw[0].back(), '\0');

  std::vector<Json::Value> commands = daemon_.Commands();
  ASSERT_EQ(commands.size(), 2u);
  EXPECT_EQ(commands[0]["type"].asString(), "upsert_folder_setting");
  EXPECT_EQ(commands[0]["data"], data);
  EXPECT_EQ(commands[0].size(), 2u);
  EXPECT_EQ(commands[1]["type"].asString(), "pause");
  EXPECT_TRUE(commands[1].isMember("data"));
  EXPECT_TRUE(commands[1]["data"].isNull()) << "a null value goes as JSON null";
  EXPECT_EQ(raw[1], Frame(TextOf("pause", Json::Value())));

  // Length first, then the text with its terminator, each in one write here.
  EXPECT_EQ(spy::writeSizes, (std::vector<size_t>{4, text.size() + 1, 4, raw[1].size() - 4}));
  ASSERT_EQ(spy::sockOpts.size(), 2u);
  EXPECT_EQ(spy::sockOpts[0].level, SOL_SOCKET);
  EXPECT_EQ(spy::sockOpts[0].name, SO_SNDTIMEO);
  EXPECT_EQ(spy::sockOpts[0].timeout.tv_sec, 1);
  EXPECT_EQ(spy::sockOpts[0].timeout.tv_usec, 0);
  EXPECT_TRUE(logcap::Texts().empty());
}

TEST_F(DaemonIoTest, LongTextsGoOutInWritesOfAtMost1024Bytes) {
  ASSERT_TRUE(daemon_.Start(SocketPath()));
  Json::Value data(Json::objectValue);
  data["blob"] = std::string(3000, 'a');
  ASSERT_TRUE(SendCammandToDaemon("upsert_folder_setting", data));
  const std::string text = TextOf("upsert_folder_setting", data);
  ASSERT_GT(text.size(), 2048u);

  const size_t total = text.size() + 1;
  EXPECT_EQ(spy::writeSizes, (std::vector<size_t>{4, 1024, 1024, total - 2048}));
  std::vector<std::string> raw = daemon_.RawFrames();
  ASSERT_EQ(raw.size(), 1u);
  EXPECT_EQ(raw[0], Frame(text));
}

TEST_F(DaemonIoTest, NoListeningDaemonFailsAtOnceAndLeavesNoDescriptor) {
  ::signal(SIGPIPE, SIG_DFL);
  const size_t before = OpenDescriptors();
  auto start = std::chrono::steady_clock::now();
  EXPECT_FALSE(SendCammandToDaemon("pause", Json::Value()));

  // A socket file nobody listens on: connection refused.
  int stale = ::socket(AF_UNIX, SOCK_STREAM, 0);
  ASSERT_GE(stale, 0);
  struct sockaddr_un addr;
  std::memset(&addr, 0, sizeof(addr));
  addr.sun_family = AF_UNIX;
  std::strncpy(addr.sun_path, SocketPath().c_str(), sizeof(addr.sun_path) - 1);
  ASSERT_EQ(::bind(stale, reinterpret_cast<struct sockaddr*>(&addr), sizeof(addr)), 0);
  EXPECT_FALSE(SendCammandToDaemon("resume", Json::Value()));
  ::close(stale);

  EXPECT_LT(std::chrono::steady_clock::now() - start, std::chrono::milliseconds(500));
  EXPECT_EQ(OpenDescriptors(), before);
  EXPECT_TRUE(spy::writeSizes.empty());
  EXPECT_TRUE(spy::sockOpts.empty()) << "the timeout is set only on a connected socket";
  struct sigaction current;
  ASSERT_EQ(::sigaction(SIGPIPE, nullptr, &current), 0);
  EXPECT_EQ(current.sa_handler, SIG_IGN) << "set even when the daemon is not there";
  EXPECT_TRUE(logcap::Texts().empty());
  EXPECT_EQ(ErrorHandler::GetError(), FILEINDEX_ERR_NONE);
}

TEST_F(DaemonIoTest, FailedTimeoutOrWriteEndsTheCommandAndClosesTheSocket) {
  ASSERT_TRUE(daemon_.Start(SocketPath()));
  const size_t before = OpenDescriptors();

  spy::setsockoptResult = -1;
  EXPECT_FALSE(SendCammandToDaemon("pause", Json::Value()));
  EXPECT_TRUE(spy::writeSizes.empty());
  spy::setsockoptResult = 0;

  // A zero return: retried while errno says EINTR, three times at most.
  spy::writeScript = {{0, EINTR}, {0, EINTR}, {0, EINTR}};
  spy::writeSizes.clear();
  EXPECT_TRUE(SendCammandToDaemon("resume", Json::Value()));
  EXPECT_EQ(spy::writeSizes.size(), 5u);

  spy::writeScript = {{0, EINTR}, {0, EINTR}, {0, EINTR}, {0, EINTR}};
  spy::writeSizes.clear();
  EXPECT_FALSE(SendCammandToDaemon("resume", Json::Value()));
  EXPECT_EQ(spy::writeSizes.size(), 4u);

  // Any other errno ends it at once, in the length or in the text.
  spy::writeScript = {{0, EAGAIN}};
  spy::writeSizes.clear();
  EXPECT_FALSE(SendCammandToDaemon("resume", Json::Value()));
  EXPECT_EQ(spy::writeSizes.size(), 1u);
  spy::writeScript = {{4, 0}, {0, 0}};
  spy::writeSizes.clear();
  EXPECT_FALSE(SendCammandToDaemon("resume", Json::Value()));
  EXPECT_EQ(spy::writeSizes.size(), 2u);

  std::vector<fileindex_frame::DecodedFrame> frames = daemon_.Frames();
  ASSERT_EQ(frames.size(), 5u) << "every attempt connected once";
  EXPECT_TRUE(frames[1].ok);
  EXPECT_EQ(frames[1].raw, Frame(TextOf("resume", Json::Value())));
  for (size_t i : {0u, 2u, 3u, 4u}) EXPECT_TRUE(frames[i].raw.empty()) << i;
  EXPECT_EQ(OpenDescriptors(), before);
}

TEST_F(DaemonIoTest, MinusOneFromWriteIsTakenAsACount) {
  ASSERT_TRUE(daemon_.Start(SocketPath()));
  // The first write of the length "returns -1": one more byte is due, starting one
  // position before the length, which goes out as a zero byte.
  spy::writeScript = {{-1, EAGAIN}};
  ASSERT_TRUE(SendCammandToDaemon("pause", Json::Value()));
  const std::string text = TextOf("pause", Json::Value());
  EXPECT_EQ(spy::writeSizes, (std::vector<size_t>{4, 5, text.size() + 1}));

  std::vector<fileindex_frame::DecodedFrame> frames = daemon_.Frames();
  ASSERT_EQ(frames.size(), 1u);
  EXPECT_EQ(frames[0].raw, std::string(1, '\0') + Frame(text));
  EXPECT_FALSE(frames[0].ok) << "the stray byte shifts the length field";

  // In the text, with several pieces: the piece is re-sent from one byte earlier.
  spy::writeScript.clear();
  Json::Value data(Json::objectValue);
  data["blob"] = std::string(1500, 'b');
  const std::string longText = TextOf("upsert_folder_setting", data);
  spy::writeScript = {{4, 0}, {1024, 0}, {-1, EPIPE}};
  spy::writeSizes.clear();
  daemon_.Clear();
  ASSERT_TRUE(SendCammandToDaemon("upsert_folder_setting", data));
  const size_t total = longText.size() + 1;
  EXPECT_EQ(spy::writeSizes, (std::vector<size_t>{4, 1024, total - 1024, total - 1023}));
  frames = daemon_.Frames();
  ASSERT_EQ(frames.size(), 1u);
  // Scripted writes put nothing on the wire; the real one sends from position 1023.
  std::string full = Frame(longText);
  EXPECT_EQ(frames[0].raw, full.substr(4 + 1023));
}

TEST(FrameDecoder, RefusesMalformedFramesWithAReason) {
  using fileindex_frame::DecodeFrame;
  const std::string good = Frame("{\"data\":{\"a\":1},\"type\":\"pause\"}");
  fileindex_frame::DecodedFrame frame = DecodeFrame(good);
  ASSERT_TRUE(frame.ok) << frame.error;
  EXPECT_EQ(fileindex_frame::CompactJson(frame.Report()), "{\"data\":{\"a\":1},\"type\":\"pause\"}");

  struct Case {
    std::string bytes;
    const char* error;
  };
  std::string noTerminator = good;
  noTerminator.back() = '}';
  const Case cases[] = {
      {"", "empty connection"},
      {std::string("\x05\x00", 2), "short frame"},
      {std::string(4, '\0'), "zero length"},
      {good.substr(0, good.size() - 1), "truncated frame"},
      {good + "x", "trailing bytes"},
      {noTerminator, "missing terminator"},
      {Frame(std::string("{\"type\":\"a\",\0\"data\":1}", 21)), "embedded zero byte"},
      {Frame("{\"type\":\"pause\",\"data\":1} x"), "invalid json"},
      {Frame("[1,2]"), "not a command object"},
      {Frame("{\"type\":1,\"data\":null}"), "not a command object"},
      {Frame("{\"type\":\"pause\"}"), "not a command object"},
      {Frame("{\"type\":\"pause\",\"data\":1,\"x\":2}"), "not a command object"},
  };
  for (const Case& c : cases) {
    frame = DecodeFrame(c.bytes);
    EXPECT_FALSE(frame.ok) << c.error;
    EXPECT_EQ(frame.error, c.error);
    Json::Value report = frame.Report();
    EXPECT_EQ(report["error"].asString(), c.error);
    EXPECT_EQ(report["received"].asUInt64(), c.bytes.size());
    EXPECT_EQ(report.isMember("length"), c.bytes.size() >= 4) << c.error;
  }
}

}  // namespace
