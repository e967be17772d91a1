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

namespace {
const std::size_t kMaxFrameBytes = 64u << 20;
const int kIdleReadMs = 2000;
const int kSettleMs = 5000;
}  // namespace

FakeDaemon::~FakeDaemon() { Stop(); }

bool FakeDaemon::Start(const std::string& socketPath) {
  if (listenFd_ >= 0) return false;
  struct sockaddr_un addr;
  std::memset(&addr, 0, sizeof(addr));
  addr.sun_family = AF_UNIX;
  if (socketPath.size() >= sizeof(addr.sun_path)) return false;
  std::memcpy(addr.sun_path, socketPath.data(), socketPath.size());

  struct stat st;
  if (::lstat(socketPath.c_str(), &st) == 0 && S_ISSOCK(st.st_mode)) ::unlink(socketPath.c_str());

  int fd = ::socket(AF_UNIX, SOCK_STREAM | SOCK_CLOEXEC, 0);
  if (fd < 0) return false;
  if (::bind(fd, reinterpret_cast<struct sockaddr*>(&addr), sizeof(addr)) != 0 || ::listen(fd, 64) != 0 ||
      ::pipe2(wakePipe_, O_CLOEXEC) != 0) {
    ::close(fd);
    return false;
  }
  listenFd_ = fd;
  path_ = socketPath;
  thread_ = std::thread(&FakeDaemon::Serve, this);
  return true;
}

void FakeDaemon::Stop() {
  if (listenFd_ < 0) return;
  char c = 'x';
  while (::write(wakePipe_[1], &c, 1) < 0 && errno == EINTR) {
  }
  if (thread_.joinable()) thread_.join();
  ::close(listenFd_);
  ::close(wakePipe_[0]);
  ::close(wakePipe_[1]);
  listenFd_ = -1;
  wakePipe_[0] = wakePipe_[1] = -1;
  ::unlink(path_.c_str());
  std::lock_guard<std::mutex> lock(mu_);
  busy_ = false;
  cv_.notify_all();
}

void FakeDaemon::Serve() {
  for (;;) {
    struct pollfd fds[2];
    fds[0] = {listenFd_, POLLIN, 0};
    fds[1] = {wakePipe_[0], POLLIN, 0};
    int ready = ::poll(fds, 2, -1);
    if (ready < 0) {
      if (errno == EINTR) continue;
      return;
    }
    if ((fds[1].revents & POLLIN) != 0) return;
    if ((fds[0].revents & POLLIN) == 0) continue;
    {
      // Marked busy before the connection leaves the queue, so that a reader never sees
      // neither a queued connection nor one being read while a frame is on its way.
      std::lock_guard<std::mutex> lock(mu_);
      busy_ = true;
    }
    int conn = ::accept4(listenFd_, nullptr, nullptr, SOCK_CLOEXEC);
    if (conn >= 0) {
      std::string bytes;
      fileindex_frame::ReadResult result =
          fileindex_frame::ReadUntilEof(conn, kMaxFrameBytes, kIdleReadMs, wakePipe_[0], bytes);
      ::close(conn);
      fileindex_frame::DecodedFrame frame = fileindex_frame::DecodeFrame(bytes);
      std::lock_guard<std::mutex> lock(mu_);
      frames_.push_back(frame);
      busy_ = false;
      cv_.notify_all();
      if (result == fileindex_frame::ReadResult::kWoken) return;
    } else {
      std::lock_guard<std::mutex> lock(mu_);
      busy_ = false;
      cv_.notify_all();
    }
  }
}

bool FakeDaemon::ConnectionQueued() const {
  if (listenFd_ < 0) return false;
  struct pollfd pfd = {listenFd_, POLLIN, 0};
  return ::poll(&pfd, 1, 0) > 0 && (pfd.revents & POLLIN) != 0;
}

void FakeDaemon::SettleLocked(std::unique_lock<std::mutex>& lock) {
  auto deadline = std::chrono::steady_clock::now() + std::chrono::milliseconds(kSettleMs);
  while ((busy_ || ConnectionQueued()) && std::chrono::steady_clock::now() < deadline) {
    cv_.wait_for(lock, std::chrono::milliseconds(2));
  }
}

std::vector<Json::Value> FakeDaemon::Commands() {
  std::unique_lock<std::mutex> lock(mu_);
  SettleLocked(lock);
  std::vector<Json::Value> out;
  for (const auto& frame : frames_) {
    if (frame.ok) out.push_back(frame.command);
  }
  return out;
}

std::vector<std::string> FakeDaemon::RawFrames() {
  std::unique_lock<std::mutex> lock(mu_);
  SettleLocked(lock);
  std::vector<std::string> out;
  for (const auto& frame : frames_) out.push_back(frame.raw);
  return out;
}

void FakeDaemon::Clear() {
  std::unique_lock<std::mutex> lock(mu_);
  SettleLocked(lock);
  frames_.clear();
}
