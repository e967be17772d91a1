// fileindex-probe: stands in for fileindexd on its socket and prints one compact JSON
// line per command received, or an {"error": ...} line for a frame that does not decode.
//
//   fileindex-probe [--sysroot DIR] [--socket PATH] [--output FILE] [--count N]
//
// The socket is $FILEINDEX_SYSROOT/var/run/fileindexd.sock unless --sysroot or --socket
// says otherwise. --count N exits after N decoded commands. SIGTERM and SIGINT end it;
// the socket file is removed on the way out.
#include <fcntl.h>
#include <getopt.h>
#include <poll.h>
#include <signal.h>
#include <sys/socket.h>
#include <sys/stat.h>
#include <sys/un.h>
#include <unistd.h>

#include <cerrno>
#include <cstdio>
#include <cstdlib>
#include <cstring>
#include <string>

#include "frame_decoder.h"

namespace {

const char kSocketPath[] = "/var/run/fileindexd.sock";
const std::size_t kMaxFrameBytes = 64u << 20;
const int kIdleReadMs = 5000;

int g_signalPipe[2] = {-1, -1};

void OnSignal(int) {
  int saved = errno;
  char c = 's';
  ssize_t ignored = ::write(g_signalPipe[1], &c, 1);
  (void)ignored;
  errno = saved;
}

void Usage(FILE* out) {
  std::fprintf(out, "usage: fileindex-probe [--sysroot DIR] [--socket PATH] [--output FILE] [--count N]\n");
}

struct Options {
  std::string socketPath;
  std::string outputPath;
  long count = 0;  // 0: no limit
};

bool ParseOptions(int argc, char** argv, Options& options) {
  static const struct option kLong[] = {
      {"sysroot", required_argument, nullptr, 'r'}, {"socket", required_argument, nullptr, 's'},
      {"output", required_argument, nullptr, 'o'},  {"count", required_argument, nullptr, 'c'},
      {"help", no_argument, nullptr, 'h'},          {nullptr, 0, nullptr, 0}};
  const char* env = ::secure_getenv("FILEINDEX_SYSROOT");
  std::string root = env != nullptr ? env : "";
  std::string socketOverride;
  int opt;
  while ((opt = ::getopt_long(argc, argv, "", kLong, nullptr)) != -1) {
    switch (opt) {
      case 'r':
        root = optarg;
        break;
      case 's':
        socketOverride = optarg;
        break;
      case 'o':
        options.outputPath = optarg;
        break;
      case 'c': {
        char* end = nullptr;
        errno = 0;
        long n = std::strtol(optarg, &end, 10);
        if (errno != 0 || end == optarg || *end != '\0' || n < 1) {
          std::fprintf(stderr, "fileindex-probe: --count wants a positive number, not '%s'\n", optarg);
          return false;
        }
        options.count = n;
        break;
      }
      case 'h':
        Usage(stdout);
        std::exit(0);
      default:
        Usage(stderr);
        return false;
    }
  }
  if (optind < argc) {
    std::fprintf(stderr, "fileindex-probe: unexpected argument '%s'\n", argv[optind]);
    Usage(stderr);
    return false;
  }
  options.socketPath = socketOverride.empty() ? root + kSocketPath : socketOverride;
  return true;
}

int Listen(const std::string& path) {
  struct sockaddr_un addr;
  std::memset(&addr, 0, sizeof(addr));
  addr.sun_family = AF_UNIX;
  if (path.size() >= sizeof(addr.sun_path)) {
    std::fprintf(stderr, "fileindex-probe: socket path too long: %s\n", path.c_str());
    return -1;
  }
  std::memcpy(addr.sun_path, path.data(), path.size());
  struct stat st;
  if (::lstat(path.c_str(), &st) == 0) {
    if (!S_ISSOCK(st.st_mode)) {
      std::fprintf(stderr, "fileindex-probe: %s exists and is not a socket\n", path.c_str());
      return -1;
    }
    ::unlink(path.c_str());  // stale socket of an earlier run
  }
  int fd = ::socket(AF_UNIX, SOCK_STREAM | SOCK_CLOEXEC, 0);
  if (fd < 0) {
    std::fprintf(stderr, "fileindex-probe: socket: %s\n", std::strerror(errno));
    return -1;
  }
  if (::bind(fd, reinterpret_cast<struct sockaddr*>(&addr), sizeof(addr)) != 0) {
    std::fprintf(stderr, "fileindex-probe: bind %s: %s\n", path.c_str(), std::strerror(errno));
    ::close(fd);
    return -1;
  }
  if (::listen(fd, 64) != 0) {
    std::fprintf(stderr, "fileindex-probe: listen %s: %s\n", path.c_str(), std::strerror(errno));
    ::close(fd);
    ::unlink(path.c_str());
    return -1;
  }
  return fd;
}

bool PrintLine(FILE* out, const Json::Value& value) {
  std::string line = fileindex_frame::CompactJson(value);
  line += '\n';
  if (std::fwrite(line.data(), 1, line.size(), out) != line.size()) return false;
  return std::fflush(out) == 0;
}

}  // namespace

int main(int argc, char** argv) {
  Options options;
  if (!ParseOptions(argc, argv, options)) return 2;

  FILE* out = stdout;
  if (!options.outputPath.empty()) {
    out = std::fopen(options.outputPath.c_str(), "ae");
    if (out == nullptr) {
      std::fprintf(stderr, "fileindex-probe: cannot open %s: %s\n", options.outputPath.c_str(),
                   std::strerror(errno));
      return 1;
    }
  }

  if (::pipe2(g_signalPipe, O_CLOEXEC | O_NONBLOCK) != 0) {
    std::fprintf(stderr, "fileindex-probe: pipe: %s\n", std::strerror(errno));
    return 1;
  }
  struct sigaction sa;
  std::memset(&sa, 0, sizeof(sa));
  sa.sa_handler = OnSignal;
  sigemptyset(&sa.sa_mask);
  ::sigaction(SIGTERM, &sa, nullptr);
  ::sigaction(SIGINT, &sa, nullptr);
  // A reader of our output that goes away must not kill us mid-line.
  ::signal(SIGPIPE, SIG_IGN);

  int listenFd = Listen(options.socketPath);
  if (listenFd < 0) return 1;

  int status = 0;
  long commands = 0;
  bool running = true;
  while (running && (options.count == 0 || commands < options.count)) {
    struct pollfd fds[2];
    fds[0] = {listenFd, POLLIN, 0};
    fds[1] = {g_signalPipe[0], POLLIN, 0};
    int ready = ::poll(fds, 2, -1);
    if (ready < 0) {
      if (errno == EINTR) continue;
      std::fprintf(stderr, "fileindex-probe: poll: %s\n", std::strerror(errno));
      status = 1;
      break;
    }
    if ((fds[1].revents & POLLIN) != 0) break;
    if ((fds[0].revents & POLLIN) == 0) continue;
    int conn = ::accept4(listenFd, nullptr, nullptr, SOCK_CLOEXEC);
    if (conn < 0) continue;  // the client went away before we took it
    std::string bytes;
    fileindex_frame::ReadResult result =
        fileindex_frame::ReadUntilEof(conn, kMaxFrameBytes, kIdleReadMs, g_signalPipe[0], bytes);
    ::close(conn);
    if (result == fileindex_frame::ReadResult::kWoken) running = false;
    fileindex_frame::DecodedFrame frame = fileindex_frame::DecodeFrame(bytes);
    Json::Value report = frame.Report();
    if (!frame.ok && result != fileindex_frame::ReadResult::kEof) {
      const char* why = result == fileindex_frame::ReadResult::kLimit     ? "size limit"
                        : result == fileindex_frame::ReadResult::kTimeout ? "idle timeout"
                        : result == fileindex_frame::ReadResult::kWoken   ? "interrupted"
                                                                          : "read error";
      report["read"] = why;
    }
    if (!PrintLine(out, report)) {
      std::fprintf(stderr, "fileindex-probe: cannot write output: %s\n", std::strerror(errno));
    }
    if (frame.ok) ++commands;
  }

  ::close(listenFd);
  ::unlink(options.socketPath.c_str());
  if (out != stdout) std::fclose(out);
  return status;
}
