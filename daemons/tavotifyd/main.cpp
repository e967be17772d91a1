// tavotifyd: watches the folders of every watch list under /run/tavotifyd with inotify and
// appends one line per file-system event to the list's queue, for fileindexd to consume.
//
// Wiring: one event loop over the signal descriptor, the folders' inotify instance and the
// lists' inotify instance; a periodic tick re-scans the lists (a safety net for missed
// notifications) and retries folders that are missing or partly watched.
#include <limits.h>
#include <signal.h>
#include <sys/epoll.h>
#include <syslog.h>
#include <unistd.h>

#include <cerrno>
#include <cstdio>
#include <cstdlib>
#include <cstring>
#include <string>

#include "daemon_support.h"
#include "queue_writer.h"
#include "tree_watcher.h"
#include "watch_lists.h"

namespace {

using fileindex_daemon::EventLoop;
using fileindex_daemon::Log;
using tavotifyd::TreeWatcher;

const std::size_t kDefaultMaxHeldLines = 100000;
const std::chrono::milliseconds kRescanPeriod(1000);
// Lets a burst of list changes (a writer's temporary file, then its rename) settle into one re-read.
const std::chrono::milliseconds kListSettle(20);
const std::chrono::milliseconds kShutdownFlushBudget(3000);

void Usage(std::FILE* out) {
  std::fprintf(out,
               "usage: tavotifyd [--sysroot DIR] [--foreground] [--max-held-lines N] [--help]\n"
               "Watches the folders of the watch lists in /run/tavotifyd and appends their file events\n"
               "to each list's queue.\n"
               "  --sysroot DIR  prefix DIR to every system path (as FILEINDEX_SYSROOT does)\n"
               "  --foreground   log to stderr too (the service manager runs it this way)\n"
               "  --max-held-lines N\n"
               "                 lines held for a queue that cannot be written before they are replaced\n"
               "                 by reindex lines of its folders (default 100000)\n");
}

class Daemon {
 public:
  explicit Daemon(std::size_t maxHeldLines)
      : m_writer(
            m_loop, [this](const std::string& queue) { return m_tree.FoldersOfQueue(queue); }, maxHeldLines),
        m_tree(m_writer),
        m_lists(fileindex_daemon::Rooted("/run/tavotifyd")) {}

  int Run() {
    m_signals = fileindex_daemon::OpenSignalFd();
    if (m_signals < 0 || !m_tree.Open() || !m_lists.Open()) {
      Log(LOG_ERR, "cannot set up signals or inotify: %s", std::strerror(errno));
      return 1;
    }
    m_loop.Watch(m_signals, EPOLLIN, [this](std::uint32_t) { OnSignal(); });
    m_loop.Watch(m_tree.Fd(), EPOLLIN, [this](std::uint32_t) { OnTreeEvents(); });
    m_loop.Watch(m_lists.Fd(), EPOLLIN, [this](std::uint32_t) {
      if (m_lists.DrainEvents() && m_listTimer == 0)
        m_listTimer = m_loop.After(kListSettle, [this] {
          m_listTimer = 0;
          ReloadLists();
        });
    });
    ReloadLists();
    // Lists that were there before this start may have missed changes while no daemon
    // watched: their folders are reconciled once.
    std::size_t reconciled = 0;
    for (const auto& list : m_lists.Lists()) {
      for (const auto& folder : list.second.folders) {
        m_writer.AddReindex(list.second.queue, folder.path);
        ++reconciled;
      }
    }
    if (reconciled != 0) Log(LOG_INFO, "%zu folders watched before this start are reindexed", reconciled);
    m_writer.Flush();
    ScheduleTick();
    Log(LOG_INFO, "started: %zu folders of %zu watch lists, %zu directories watched", m_tree.FolderCount(),
        m_lists.Lists().size(), m_tree.WatchCount());
    fileindex_daemon::NotifyServiceManager("READY=1");
    while (m_loop.RunOnce(kRescanPeriod)) continue;

    fileindex_daemon::NotifyServiceManager("STOPPING=1");
    // Events that happened before the signal still belong in the queues.
    m_tree.ReadEvents();
    m_tree.ExpireUnpairedMoves(true);
    std::size_t lost = m_writer.FlushBeforeExit(kShutdownFlushBudget);
    if (lost != 0) {
      Log(LOG_ERR, "stopping with %zu lines not written (their queues stayed locked or failing)", lost);
    } else {
      Log(LOG_INFO, "stopped");
    }
    return 0;
  }

 private:
  void OnSignal() {
    for (int signal; (signal = fileindex_daemon::ReadSignal(m_signals)) != 0;) {
      if (signal == SIGHUP) {
        Log(LOG_INFO, "SIGHUP: re-reading the watch lists");
        ReloadLists();
      } else {
        Log(LOG_INFO, "%s: stopping", strsignal(signal));
        m_loop.Stop();
      }
    }
  }

  void OnTreeEvents() {
    m_tree.ReadEvents();
    // A move's first half waits briefly for its second; the timer re-reads first.
    if (m_tree.HasUnpairedMoves() && m_moveTimer == 0)
      m_moveTimer = m_loop.After(TreeWatcher::kMovePartnerWait, [this] {
        m_moveTimer = 0;
        m_tree.ReadEvents();
        m_tree.ExpireUnpairedMoves(false);
        if (m_tree.HasUnpairedMoves()) OnTreeEvents();
        m_writer.Flush();
      });
    m_writer.Flush();
  }

  void ReloadLists() {
    if (m_lists.Rescan()) m_tree.SetLists(m_lists.Lists());
    m_writer.Flush();
  }

  void ScheduleTick() {
    m_loop.After(kRescanPeriod, [this] {
      ReloadLists();
      m_tree.RetryIncomplete();
      m_writer.Flush();
      ScheduleTick();
    });
  }

  EventLoop m_loop;
  tavotifyd::QueueWriter m_writer;
  tavotifyd::TreeWatcher m_tree;
  tavotifyd::WatchListDirectory m_lists;
  int m_signals = -1;
  std::uint64_t m_listTimer = 0;
  std::uint64_t m_moveTimer = 0;
};

}  // namespace

int main(int argc, char** argv) {
  bool foreground = false;
  std::size_t maxHeldLines = kDefaultMaxHeldLines;
  for (int i = 1; i < argc; ++i) {
    std::string arg = argv[i];
    if (arg == "--help" || arg == "-h") {
      Usage(stdout);
      return 0;
    } else if (arg == "--foreground") {
      foreground = true;
    } else if (arg == "--max-held-lines" && i + 1 < argc) {
      char* end = nullptr;
      unsigned long long value = std::strtoull(argv[++i], &end, 10);
      if (*end != '\0' || value == 0) {
        std::fprintf(stderr, "tavotifyd: --max-held-lines %s: not a positive number\n", argv[i]);
        return 2;
      }
      maxHeldLines = static_cast<std::size_t>(value);
    } else if (arg == "--sysroot" && i + 1 < argc) {
      char resolved[PATH_MAX];
      if (::realpath(argv[++i], resolved) == nullptr) {
        std::fprintf(stderr, "tavotifyd: --sysroot %s: %s\n", argv[i], std::strerror(errno));
        return 2;
      }
      ::setenv("FILEINDEX_SYSROOT", resolved, 1);
    } else {
      std::fprintf(stderr, "tavotifyd: unknown argument %s\n", arg.c_str());
      Usage(stderr);
      return 2;
    }
  }
  fileindex_daemon::LogOpen("tavotifyd", foreground);
  const std::string pidFile = fileindex_daemon::Rooted("/var/run/tavotifyd.pid");
  pid_t holder = 0;
  int instance = fileindex_daemon::AcquireInstanceLock(pidFile, holder);
  if (instance < 0) {
    if (errno == EWOULDBLOCK) {
      Log(LOG_ERR, "already running (pid %ld, %s)", static_cast<long>(holder), pidFile.c_str());
      std::fprintf(stderr, "tavotifyd: already running (pid %ld)\n", static_cast<long>(holder));
    } else {
      Log(LOG_ERR, "cannot take the instance lock %s: %s", pidFile.c_str(), std::strerror(errno));
    }
    return 1;
  }
  Daemon daemon(maxHeldLines);
  return daemon.Run();
}
