// fileindexd: the indexing daemon. It serves the folders that folder.conf lists: crawls
// them into a per-share index, keeps the index current from each share's event queue,
// and takes the library's commands on its socket.
//
// It also answers Samba's Spotlight searches (macOS Finder on the shares) over HTTP on the
// loopback interface.
//
//   fileindexd [--sysroot DIR] [--admin-group GROUP] [--spotlight-port PORT] [--log-stderr]
#include <getopt.h>
#include <grp.h>
#include <signal.h>
#include <sys/epoll.h>
#include <sys/resource.h>
#include <sys/stat.h>
#include <syslog.h>
#include <unistd.h>

#include <cerrno>
#include <cstdio>
#include <cstdlib>
#include <cstring>
#include <string>

#include "command_server.h"
#include "indexing_service.h"
#include "spotlight_endpoint.h"

namespace {

const char kSocketPath[] = "/var/run/fileindexd.sock";
const char kInstanceLock[] = "/var/run/fileindexd.pid";
// Long enough that a crawl's commits (each writes out the name index's pending terms) stay
// few, short enough that commands and signals wait little.
const std::chrono::milliseconds kSliceBudget(200);
// Where Samba's Elasticsearch backend looks by default.
const char kSpotlightAddress[] = "127.0.0.1";
const int kSpotlightPort = 9200;

void Usage(FILE* out) {
  std::fprintf(
      out,
      "usage: fileindexd [--sysroot DIR] [--admin-group GROUP] [--spotlight-port PORT] [--log-stderr]\n"
      "  --sysroot DIR          prefix every fixed path with DIR (sandboxes and tests)\n"
      "  --admin-group GROUP    members of GROUP may send commands too (default: root only)\n"
      "  --spotlight-port PORT  answer Samba's Spotlight searches on 127.0.0.1:PORT\n"
      "                         (default 9200; 0: not at all)\n"
      "  --log-stderr           log to standard error as well as to syslog\n");
}

}  // namespace

int main(int argc, char** argv) {
  static const struct option kOptions[] = {{"sysroot", required_argument, nullptr, 'r'},
                                           {"admin-group", required_argument, nullptr, 'g'},
                                           {"spotlight-port", required_argument, nullptr, 'p'},
                                           {"log-stderr", no_argument, nullptr, 'e'},
                                           {"help", no_argument, nullptr, 'h'},
                                           {nullptr, 0, nullptr, 0}};
  std::string adminGroup;
  bool logStderr = false;
  int spotlightPort = kSpotlightPort;
  int opt;
  while ((opt = ::getopt_long(argc, argv, "", kOptions, nullptr)) != -1) {
    switch (opt) {
      case 'r':
        ::setenv("FILEINDEX_SYSROOT", optarg, 1);
        break;
      case 'g':
        adminGroup = optarg;
        break;
      case 'e':
        logStderr = true;
        break;
      case 'p': {
        char* end = nullptr;
        long port = std::strtol(optarg, &end, 10);
        if (*optarg == '\0' || *end != '\0' || port < 0 || port > 65535) {
          std::fprintf(stderr, "fileindexd: not a port: %s\n", optarg);
          return 2;
        }
        spotlightPort = static_cast<int>(port);
        break;
      }
      case 'h':
        Usage(stdout);
        return 0;
      default:
        Usage(stderr);
        return 2;
    }
  }
  if (optind != argc) {
    Usage(stderr);
    return 2;
  }
  fileindex_daemon::LogOpen("fileindexd", logStderr);
  using fileindex_daemon::Log;

  gid_t group = static_cast<gid_t>(-1);
  if (!adminGroup.empty()) {
    struct group* entry = ::getgrnam(adminGroup.c_str());
    if (entry == nullptr) {
      Log(LOG_ERR, "no group named %s", adminGroup.c_str());
      return 1;
    }
    group = entry->gr_gid;
  }
  // Index files are private to root; nothing the daemon creates is for others to read.
  ::umask(077);
  // The indexer is background work: it yields the CPU and the disk to everything else.
  ::setpriority(PRIO_PROCESS, 0, 10);

  const std::string lockPath = fileindex_daemon::Rooted(kInstanceLock);
  ::mkdir(lockPath.substr(0, lockPath.rfind('/')).c_str(), 0755);
  pid_t holder = 0;
  if (fileindex_daemon::AcquireInstanceLock(lockPath, holder) < 0) {
    if (errno == EWOULDBLOCK) {
      Log(LOG_ERR, "already running (process %ld holds %s)", static_cast<long>(holder), lockPath.c_str());
    } else {
      Log(LOG_ERR, "%s: %s", lockPath.c_str(), std::strerror(errno));
    }
    return 1;
  }

  fileindex_daemon::EventLoop loop;
  int signals = fileindex_daemon::OpenSignalFd();
  if (signals < 0) {
    Log(LOG_ERR, "signals: %s", std::strerror(errno));
    return 1;
  }
  loop.Watch(signals, EPOLLIN, [&loop, signals](std::uint32_t) {
    int signal = fileindex_daemon::ReadSignal(signals);
    if (signal == SIGHUP) return;  // everything is followed as it changes; nothing to reload
    if (signal != 0) {
      fileindex_daemon::Log(LOG_INFO, "stopping on %s", strsignal(signal));
      loop.Stop();
    }
  });

  fileindexd::IndexingService service(loop);
  fileindexd::SpotlightSearch spotlight;
  service.ObserveConfig([&spotlight](const std::map<std::string, fileindexd::ShareConfig>& shares) {
    std::vector<fileindexd::SearchableShare> searchable;
    for (const auto& entry : shares) {
      fileindexd::SearchableShare share{entry.first, entry.second.directory, entry.second.dbDirectory, {}};
      for (const auto& folder : entry.second.flags) share.folders.push_back(folder.first);
      searchable.push_back(std::move(share));
    }
    spotlight.SetShares(std::move(searchable));
  });
  std::string error;
  if (!service.Start(error)) {
    Log(LOG_ERR, "cannot start: %s", error.c_str());
    return 1;
  }
  fileindexd::CommandServer server(
      loop, [&service](const Json::Value& command) { service.HandleCommand(command); });
  if (!server.Listen(fileindex_daemon::Rooted(kSocketPath), group, error)) {
    Log(LOG_ERR, "cannot listen: %s", error.c_str());
    return 1;
  }
  // Searches run on the endpoint's own threads, each with its own read-only view of an
  // index, beside this loop and its writes.
  fileindexd::SpotlightEndpoint endpoint(spotlight);
  if (spotlightPort != 0) {
    if (endpoint.Start(kSpotlightAddress, spotlightPort, error)) {
      Log(LOG_INFO, "answering Spotlight searches on %s:%d", kSpotlightAddress, spotlightPort);
    } else {
      Log(LOG_ERR, "%s; Spotlight searches are not answered", error.c_str());
    }
  }
  Log(LOG_INFO, "ready");
  fileindex_daemon::NotifyServiceManager("READY=1");

  // Work runs in slices between looks at the socket, the signals and the files watched,
  // so a long crawl never keeps a command or SIGTERM waiting.
  while (loop.Running()) {
    bool busy = service.HasRunnableWork();
    if (!loop.RunOnce(busy ? std::chrono::milliseconds(0) : std::chrono::milliseconds(1000))) break;
    if (service.HasRunnableWork()) service.RunSlice(kSliceBudget);
  }
  fileindex_daemon::NotifyServiceManager("STOPPING=1");
  endpoint.Stop();
  Log(LOG_INFO, "stopped");
  return 0;
}
