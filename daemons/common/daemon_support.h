// What both daemons need besides the queue: the system root, logging, a single-instance
// lock, and a small event loop (descriptors and timers on one epoll set, Redis-ae style).
#ifndef FILEINDEX_DAEMONS_DAEMON_SUPPORT_H
#define FILEINDEX_DAEMONS_DAEMON_SUPPORT_H

#include <sys/types.h>

#include <chrono>
#include <cstdint>
#include <functional>
#include <map>
#include <string>
#include <unordered_map>

namespace fileindex_daemon {

// FILEINDEX_SYSROOT (read with secure_getenv) prefixed to an absolute path, as the library
// and the host platform build theirs.
std::string Rooted(const std::string& path);

// Log lines go to syslog (ident, LOG_PID, LOG_DAEMON) and, when toStderr, to stderr too.
void LogOpen(const char* ident, bool toStderr);
void Log(int priority, const char* format, ...) __attribute__((format(printf, 2, 3)));

// Takes an exclusive lock on path (created 0644) and writes this process's id into it.
// Returns the descriptor, kept open for the life of the process; -1 with holder set to the
// running instance's process id (0 when unknown) when another instance has it.
int AcquireInstanceLock(const std::string& path, pid_t& holder);

// Tells the service manager that start-up is done or that shutdown began (no-op when not
// run by systemd).
void NotifyServiceManager(const char* state);

using Clock = std::chrono::steady_clock;

class EventLoop {
 public:
  using FdHandler = std::function<void(std::uint32_t events)>;
  using TimerHandler = std::function<void()>;

  EventLoop();
  ~EventLoop();
  EventLoop(const EventLoop&) = delete;
  EventLoop& operator=(const EventLoop&) = delete;

  bool Watch(int fd, std::uint32_t events, FdHandler handler);
  void Unwatch(int fd);
  // One-shot timer; returns its id.
  std::uint64_t After(std::chrono::milliseconds delay, TimerHandler handler);
  void Cancel(std::uint64_t timer);

  // Waits for events at most maxWait (less when a timer is due) and runs their handlers
  // and every due timer once. Returns false when the loop was stopped.
  bool RunOnce(std::chrono::milliseconds maxWait);
  void Stop() { m_running = false; }
  bool Running() const { return m_running; }

 private:
  int m_epoll = -1;
  bool m_running = true;
  std::uint64_t m_nextTimer = 1;
  std::unordered_map<int, FdHandler> m_handlers;
  std::multimap<Clock::time_point, std::uint64_t> m_due;
  std::unordered_map<std::uint64_t, std::pair<Clock::time_point, TimerHandler>> m_timers;
};

// A descriptor that becomes readable on SIGTERM, SIGINT and SIGHUP (blocked otherwise);
// ReadSignal returns the signal number, 0 when none is pending.
int OpenSignalFd();
int ReadSignal(int fd);

}  // namespace fileindex_daemon

#endif
