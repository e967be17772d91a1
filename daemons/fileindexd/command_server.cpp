#include "command_server.h"

#include <frame_decoder.h>
#include <sys/epoll.h>
#include <sys/socket.h>
#include <sys/stat.h>
#include <sys/un.h>
#include <syslog.h>
#include <unistd.h>

#include <cerrno>
#include <cstring>

namespace fileindexd {

using fileindex_daemon::Log;

namespace {
// The library's commands are a few hundred bytes; this leaves room for any folder record.
const std::uint32_t kMaxFrameBytes = 1u << 20;
const auto kIdleLimit = std::chrono::milliseconds(2000);
const std::size_t kMaxConnections = 64;
}  // namespace

CommandServer::~CommandServer() {
  for (auto& connection : m_connections) {
    m_loop.Unwatch(connection.first);
    m_loop.Cancel(connection.second.timer);
    ::close(connection.first);
  }
  if (m_listener >= 0) {
    m_loop.Unwatch(m_listener);
    ::close(m_listener);
    ::unlink(m_path.c_str());
  }
}

bool CommandServer::Listen(const std::string& path, gid_t group, std::string& error) {
  sockaddr_un address{};
  if (path.size() >= sizeof(address.sun_path)) {
    error = path + ": path too long for a socket";
    return false;
  }
  m_listener = ::socket(AF_UNIX, SOCK_STREAM | SOCK_NONBLOCK | SOCK_CLOEXEC, 0);
  if (m_listener < 0) {
    error = std::string("socket: ") + std::strerror(errno);
    return false;
  }
  address.sun_family = AF_UNIX;
  std::memcpy(address.sun_path, path.data(), path.size());
  // Only one instance runs (it holds the instance lock), so a socket file left here is
  // stale. Anything else at the path is not ours to remove.
  struct stat st;
  if (::lstat(path.c_str(), &st) == 0) {
    if (!S_ISSOCK(st.st_mode)) {
      error = path + ": exists and is not a socket";
      return false;
    }
    ::unlink(path.c_str());
  }
  // Created private, then opened to the group: nobody else can connect in between.
  mode_t previous = ::umask(0177);
  int rc = ::bind(m_listener, reinterpret_cast<sockaddr*>(&address), sizeof(address));
  ::umask(previous);
  if (rc != 0) {
    error = path + ": " + std::strerror(errno);
    return false;
  }
  m_path = path;
  if (group != static_cast<gid_t>(-1) &&
      (::chown(path.c_str(), 0, group) != 0 || ::chmod(path.c_str(), 0660) != 0)) {
    error = path + ": cannot give the socket to the administrators' group: " + std::strerror(errno);
    return false;
  }
  if (::listen(m_listener, 64) != 0) {
    error = path + ": " + std::strerror(errno);
    return false;
  }
  return m_loop.Watch(m_listener, EPOLLIN, [this](std::uint32_t) { Accept(); });
}

void CommandServer::Accept() {
  for (;;) {
    if (m_connections.size() >= kMaxConnections) {
      // Closing new clients would lose the commands of real senders among them: they wait
      // in the listen backlog instead, until a client is served or dropped.
      if (!m_acceptPaused) Log(LOG_ERR, "too many clients at once; new ones wait");
      m_acceptPaused = true;
      m_loop.Unwatch(m_listener);
      return;
    }
    int fd = ::accept4(m_listener, nullptr, nullptr, SOCK_NONBLOCK | SOCK_CLOEXEC);
    if (fd < 0) {
      if (errno != EAGAIN && errno != EWOULDBLOCK && errno != EINTR)
        Log(LOG_ERR, "accept on %s: %s", m_path.c_str(), std::strerror(errno));
      return;
    }
    Connection& connection = m_connections[fd];
    connection.timer = m_loop.After(kIdleLimit, [this, fd]() {
      auto it = m_connections.find(fd);
      if (it == m_connections.end()) return;
      it->second.timer = 0;
      Drop(fd, "client sent no whole command in time");
    });
    m_loop.Watch(fd, EPOLLIN | EPOLLRDHUP, [this, fd](std::uint32_t) { Read(fd); });
  }
}

void CommandServer::Read(int fd) {
  auto it = m_connections.find(fd);
  if (it == m_connections.end()) return;
  Connection& connection = it->second;
  char buffer[16384];
  for (;;) {
    ssize_t n = ::read(fd, buffer, sizeof(buffer));
    if (n < 0 && errno == EINTR) continue;
    if (n < 0 && (errno == EAGAIN || errno == EWOULDBLOCK)) return;  // more later
    if (n <= 0) {
      Drop(fd, n == 0 ? (connection.received.empty() ? nullptr : "connection closed before a whole command")
                      : "read failed");
      return;
    }
    connection.received.append(buffer, static_cast<std::size_t>(n));
    if (connection.received.size() < 4) continue;
    std::uint32_t length;
    std::memcpy(&length, connection.received.data(), sizeof(length));
    if (length == 0 || length > kMaxFrameBytes) {
      Drop(fd, "frame length out of range");
      return;
    }
    if (connection.received.size() - 4 < length) continue;
    // One command per connection: anything after the frame is ignored.
    fileindex_frame::DecodedFrame frame =
        fileindex_frame::DecodeFrame(connection.received.substr(0, 4 + length));
    if (!frame.ok) {
      Log(LOG_ERR, "malformed command dropped: %s%s%s", frame.error.c_str(), frame.detail.empty() ? "" : ": ",
          frame.detail.substr(0, 200).c_str());
      Drop(fd, nullptr);
      return;
    }
    Drop(fd, nullptr);
    m_handler(frame.command);
    return;
  }
}

void CommandServer::Drop(int fd, const char* reason) {
  auto it = m_connections.find(fd);
  if (it == m_connections.end()) return;
  if (reason != nullptr)
    Log(LOG_ERR, "command connection dropped: %s (%zu bytes)", reason, it->second.received.size());
  if (it->second.timer != 0) m_loop.Cancel(it->second.timer);
  m_loop.Unwatch(fd);
  ::close(fd);
  m_connections.erase(it);
  if (m_acceptPaused) {
    m_acceptPaused = false;
    m_loop.Watch(m_listener, EPOLLIN, [this](std::uint32_t) { Accept(); });
  }
}

}  // namespace fileindexd
