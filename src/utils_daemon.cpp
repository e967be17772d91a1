// The one-way command channel to the indexing daemon: one length-prefixed JSON frame per
// connection, no reply.
#include <fileindex/utils.h>
#include <signal.h>
#include <sys/socket.h>
#include <sys/time.h>
#include <sys/un.h>
#include <unistd.h>

#include <cerrno>
#include <cstdint>
#include <cstring>
#include <string>

#include "internal/json_io.h"
#include "internal/sysroot.h"

namespace TAVO {
namespace FILEINDEX {

namespace {
const char kDaemonSocket[] = "/var/run/fileindexd.sock";
const std::size_t kMaxWrite = 1024;
static_assert(sizeof(struct sockaddr_un) == 110, "the daemon address is 110 bytes");

class SocketCloser {
 public:
  explicit SocketCloser(int fd) : fd_(fd) {}
  ~SocketCloser() { ::close(fd_); }
  SocketCloser(const SocketCloser&) = delete;
  SocketCloser& operator=(const SocketCloser&) = delete;

 private:
  int fd_;
};

// Writes count bytes in pieces of at most 1024. Only a zero return from write() ends it
// with failure (after three retries when errno says EINTR). A -1 is taken as a count,
// as the channel has always done: the remainder grows by one and the position moves back
// by one. The positions before the buffer are not ours to read, so they are sent as zero
// bytes; the arithmetic is unsigned, so it stays defined however often that happens.
bool WriteAll(int fd, std::size_t count, const void* buffer) {
  if (count == 0) return true;
  const unsigned char* bytes = static_cast<const unsigned char*>(buffer);
  int retries = 3;
  std::uint64_t done = 0;  // modulo 2^64: "negative" once it wraps below zero
  std::uint64_t remaining = count;
  for (;;) {
    std::size_t chunk = remaining < kMaxWrite ? static_cast<std::size_t>(remaining) : kMaxWrite;
    ssize_t n;
    if (done <= count) {
      n = ::write(fd, bytes + done, chunk);
    } else {
      unsigned char staged[kMaxWrite];
      std::uint64_t before = 0 - done;  // how far the position lies before the buffer
      std::size_t zeros = before < chunk ? static_cast<std::size_t>(before) : chunk;
      std::memset(staged, 0, zeros);
      std::memcpy(staged + zeros, bytes, chunk - zeros);
      n = ::write(fd, staged, chunk);
    }
    if (n != 0) {
      remaining -= static_cast<std::uint64_t>(n);
      done += static_cast<std::uint64_t>(n);
      if (remaining == 0) return true;
      continue;
    }
    if (errno == EINTR && retries > 0) {
      --retries;
      continue;
    }
    return false;
  }
}
}  // namespace

bool SendCammandToDaemon(const std::string& command, const Json::Value& data) {
  Json::Value message(Json::objectValue);
  message["type"] = command;
  message["data"] = data;

  // A daemon that goes away must give write errors, not kill the caller.
  ::signal(SIGPIPE, SIG_IGN);

  int fd = ::socket(AF_UNIX, SOCK_STREAM | SOCK_CLOEXEC, 0);
  if (fd < 0) return false;
  SocketCloser closer(fd);

  struct sockaddr_un addr;
  std::memset(&addr, 0, sizeof(addr));
  addr.sun_family = AF_UNIX;
  std::string path = internal::SystemPath(kDaemonSocket);
  std::strncpy(addr.sun_path, path.c_str(), sizeof(addr.sun_path) - 1);
  if (::connect(fd, reinterpret_cast<struct sockaddr*>(&addr), sizeof(addr)) != 0) return false;

  struct timeval timeout;
  timeout.tv_sec = 1;
  timeout.tv_usec = 0;
  if (::setsockopt(fd, SOL_SOCKET, SO_SNDTIMEO, &timeout, sizeof(timeout)) < 0) return false;

  std::string text = internal::JsonToString(message);
  std::uint32_t length = static_cast<std::uint32_t>(text.size() + 1);
  if (!WriteAll(fd, sizeof(length), &length)) return false;
  // c_str() ends in the zero byte that terminates the frame.
  if (!WriteAll(fd, length, text.c_str())) return false;
  return true;
}

}  // namespace FILEINDEX
}  // namespace TAVO
