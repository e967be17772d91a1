#include "support/fake_daemon.h"

#include <fcntl.h>
#include <poll.h>
#include <sys/socket.h>
#include <sys/stat.h>
#include <sys/un.h>
#include <unistd.h>

#include <cerrno>
#include <chrono>
#include <cstring>

bool FakeDaemon::Start(const std::string& socketPath) {
  struct sockaddr_un addr = {};
  addr.sun_family = AF_UNIX;
  if (listenFd_ >= 0 || socketPath.size() >= sizeof(addr.sun_path)) return false;
  std::memcpy(addr.sun_path, socketPath.data(), socketPath.size());
  struct stat st;
  if (::lstat(socketPath.c_str(), &st) == 0 && S_ISSOCK(st.st_mode)) ::unlink(socketPath.c_str());
  int fd = ::socket(AF_UNIX, SOCK_STREAM | SOCK_CLOEXEC, 0);
  if (fd < 0) return false;
  if (::bind(fd, reinterpret_cast<struct sockaddr*>(&addr), sizeof(addr)) != 0 || ::listen(fd, 64) != 0 ||
      ::pipe2(wakePipe_, O_CLOEXEC) != 0)
    return ::close(fd), false;
  listenFd_ = fd;
  path_ = socketPath;
  thread_ = std::thread(&FakeDaemon::Serve, this);
  return true;
}

void FakeDaemon::Stop() {
  if (listenFd_ < 0) return;
  while (::write(wakePipe_[1], "x", 1) < 0 && errno == EINTR) continue;
  if (thread_.joinable()) thread_.join();
  for (int* fd : {&listenFd_, &wakePipe_[0], &wakePipe_[1]}) ::close(*fd), *fd = -1;
  ::unlink(path_.c_str());
  std::lock_guard<std::mutex> lock(mu_);
  busy_ = false;
  cv_.notify_all();
}

void FakeDaemon::Serve() {
  for (;;) {
    struct pollfd fds[2] = {{listenFd_, POLLIN, 0}, {wakePipe_[0], POLLIN, 0}};
    if (::poll(fds, 2, -1) < 0) {
      if (errno == EINTR) continue;
      return;
    }
    if ((fds[1].revents & POLLIN) != 0) return;
    if ((fds[0].revents & POLLIN) == 0) continue;
    {
      // Busy before the connection leaves the queue: a frame on its way is always seen.
      std::lock_guard<std::mutex> lock(mu_);
      busy_ = true;
    }
    int conn = ::accept4(listenFd_, nullptr, nullptr, SOCK_CLOEXEC);
    std::string bytes;
    auto result = fileindex_frame::ReadResult::kError;
    if (conn >= 0)
      result = fileindex_frame::ReadUntilEof(conn, 64u << 20, 2000, wakePipe_[0], bytes), ::close(conn);
    std::lock_guard<std::mutex> lock(mu_);
    if (conn >= 0) frames_.push_back(fileindex_frame::DecodeFrame(bytes));
    busy_ = false;
    cv_.notify_all();
    if (result == fileindex_frame::ReadResult::kWoken) return;
  }
}

std::vector<fileindex_frame::DecodedFrame> FakeDaemon::Settled(bool clear) {
  auto queued = [this] {
    struct pollfd pfd = {listenFd_, POLLIN, 0};
    return listenFd_ >= 0 && ::poll(&pfd, 1, 0) > 0 && (pfd.revents & POLLIN) != 0;
  };
  std::unique_lock<std::mutex> lock(mu_);
  auto deadline = std::chrono::steady_clock::now() + std::chrono::seconds(5);
  while ((busy_ || queued()) && std::chrono::steady_clock::now() < deadline)
    cv_.wait_for(lock, std::chrono::milliseconds(2));
  auto frames = frames_;
  if (clear) frames_.clear();
  return frames;
}

std::vector<Json::Value> FakeDaemon::Commands() {
  std::vector<Json::Value> out;
  for (const auto& frame : Settled(false))
    if (frame.ok) out.push_back(frame.command);
  return out;
}

std::vector<std::string> FakeDaemon::RawFrames() {
  std::vector<std::string> out;
  for (const auto& frame : Settled(false)) out.push_back(frame.raw);
  return out;
}

void FakeDaemon::Clear() { Settled(true); }
