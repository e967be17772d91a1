#include "daemon_support.h"

#include <fcntl.h>
#include <signal.h>
#include <sys/epoll.h>
#include <sys/file.h>
#include <sys/signalfd.h>
#include <syslog.h>
#include <unistd.h>

#include <cerrno>
#include <cstdarg>
#include <cstdio>
#include <cstdlib>
#include <cstring>
#include <vector>

#ifdef FILEINDEX_HAVE_SYSTEMD
#include <systemd/sd-daemon.h>
#endif

namespace fileindex_daemon {

namespace {
bool g_logToStderr = false;
const char* g_ident = "fileindex";
}  // namespace

std::string Rooted(const std::string& path) {
  const char* root = ::secure_getenv("FILEINDEX_SYSROOT");
  return root != nullptr ? std::string(root) + path : path;
}

void LogOpen(const char* ident, bool toStderr) {
  g_ident = ident;
  g_logToStderr = toStderr;
  ::openlog(ident, LOG_PID, LOG_DAEMON);
}

void Log(int priority, const char* format, ...) {
  int saved = errno;
  va_list args;
  va_start(args, format);
  if (g_logToStderr) {
    va_list copy;
    va_copy(copy, args);
    std::fprintf(stderr, "%s: ", g_ident);
    errno = saved;
    std::vfprintf(stderr, format, copy);
    std::fputc('\n', stderr);
    va_end(copy);
  }
  errno = saved;
  ::vsyslog(priority, format, args);
  va_end(args);
  errno = saved;
}

int AcquireInstanceLock(const std::string& path, pid_t& holder) {
  holder = 0;
  int fd = ::open(path.c_str(), O_RDWR | O_CREAT | O_CLOEXEC | O_NOFOLLOW, 0644);
  if (fd < 0) return -1;
  if (::flock(fd, LOCK_EX | LOCK_NB) != 0) {
    char text[32] = {0};
    ssize_t n = ::pread(fd, text, sizeof(text) - 1, 0);
    if (n > 0) holder = static_cast<pid_t>(std::atol(text));
    ::close(fd);
    errno = EWOULDBLOCK;
    return -1;
  }
  char text[32];
  int n = std::snprintf(text, sizeof(text), "%ld\n", static_cast<long>(::getpid()));
  if (::ftruncate(fd, 0) != 0 || ::pwrite(fd, text, static_cast<size_t>(n), 0) != n) {
    int saved = errno;
    ::close(fd);
    errno = saved;
    return -1;
  }
  return fd;
}

void NotifyServiceManager(const char* state) {
#ifdef FILEINDEX_HAVE_SYSTEMD
  ::sd_notify(0, state);
#else
  (void)state;
#endif
}

EventLoop::EventLoop() : m_epoll(::epoll_create1(EPOLL_CLOEXEC)) {}

EventLoop::~EventLoop() {
  if (m_epoll >= 0) ::close(m_epoll);
}

bool EventLoop::Watch(int fd, std::uint32_t events, FdHandler handler) {
  epoll_event ev{};
  ev.events = events;
  ev.data.fd = fd;
  int op = m_handlers.count(fd) ? EPOLL_CTL_MOD : EPOLL_CTL_ADD;
  if (::epoll_ctl(m_epoll, op, fd, &ev) != 0) return false;
  m_handlers[fd] = std::move(handler);
  return true;
}

void EventLoop::Unwatch(int fd) {
  if (m_handlers.erase(fd) != 0) ::epoll_ctl(m_epoll, EPOLL_CTL_DEL, fd, nullptr);
}

std::uint64_t EventLoop::After(std::chrono::milliseconds delay, TimerHandler handler) {
  std::uint64_t id = m_nextTimer++;
  Clock::time_point when = Clock::now() + delay;
  m_timers[id] = {when, std::move(handler)};
  m_due.emplace(when, id);
  return id;
}

void EventLoop::Cancel(std::uint64_t timer) { m_timers.erase(timer); }

bool EventLoop::RunOnce(std::chrono::milliseconds maxWait) {
  if (!m_running) return false;
  // Skip cancelled timers at the front so they do not shorten the wait.
  while (!m_due.empty() && !m_timers.count(m_due.begin()->second)) m_due.erase(m_due.begin());
  auto wait = maxWait;
  if (!m_due.empty()) {
    auto untilDue =
        std::chrono::duration_cast<std::chrono::milliseconds>(m_due.begin()->first - Clock::now());
    if (untilDue < wait)
      wait = untilDue < std::chrono::milliseconds(0) ? std::chrono::milliseconds(0) : untilDue;
  }
  epoll_event events[64];
  int n = ::epoll_wait(m_epoll, events, 64, static_cast<int>(wait.count()));
  for (int i = 0; i < n && m_running; ++i) {
    auto it = m_handlers.find(events[i].data.fd);
    if (it == m_handlers.end()) continue;
    FdHandler handler = it->second;  // the handler may unwatch its own descriptor
    handler(events[i].events);
  }
  Clock::time_point now = Clock::now();
  while (m_running && !m_due.empty() && m_due.begin()->first <= now) {
    std::uint64_t id = m_due.begin()->second;
    m_due.erase(m_due.begin());
    auto it = m_timers.find(id);
    if (it == m_timers.end()) continue;
    TimerHandler handler = std::move(it->second.second);
    m_timers.erase(it);
    handler();
  }
  return m_running;
}

int OpenSignalFd() {
  sigset_t set;
  sigemptyset(&set);
  sigaddset(&set, SIGTERM);
  sigaddset(&set, SIGINT);
  sigaddset(&set, SIGHUP);
  if (::sigprocmask(SIG_BLOCK, &set, nullptr) != 0) return -1;
  ::signal(SIGPIPE, SIG_IGN);
  return ::signalfd(-1, &set, SFD_CLOEXEC | SFD_NONBLOCK);
}

int ReadSignal(int fd) {
  signalfd_siginfo info;
  ssize_t n = ::read(fd, &info, sizeof(info));
  return n == static_cast<ssize_t>(sizeof(info)) ? static_cast<int>(info.ssi_signo) : 0;
}

}  // namespace fileindex_daemon
