#include "indexing_service.h"

#include <fileindex/status_mgr.h>
#include <fileindex/utils.h>
#include <sys/epoll.h>
#include <sys/inotify.h>
#include <sys/stat.h>
#include <syslog.h>
#include <unistd.h>

#include <cerrno>
#include <climits>
#include <cstring>
#include <ctime>

namespace fileindexd {

using fileindex_daemon::Log;
using std::chrono::milliseconds;

namespace {
const char kConfigDirectory[] = "/usr/tavo/etc/fileindex";
const char kFolderConf[] = "folder.conf";
const char kStatusConf[] = "status.conf";
// Events come in bursts (a writer appends line after line); one look after a short pause
// sees the whole burst.
const milliseconds kSettleDelay(20);
const milliseconds kTickInterval(1000);
const milliseconds kSpaceCheckInterval(1000);
const milliseconds kRetryAfterFailure(5000);

std::string DirName(const std::string& path) { return path.substr(0, path.rfind('/')); }

bool MakeDirectories(const std::string& path) {
  if (path.empty()) return true;
  struct stat st;
  if (::stat(path.c_str(), &st) == 0) return S_ISDIR(st.st_mode);
  if (!MakeDirectories(DirName(path))) return false;
  return ::mkdir(path.c_str(), 0755) == 0 || errno == EEXIST;
}
}  // namespace

IndexingService::IndexingService(fileindex_daemon::EventLoop& loop)
    : m_loop(loop), m_extraction(loop, [this]() {
        std::map<std::string, ShareIndexer*> shares;
        if (m_paused) return shares;
        for (auto& entry : m_shares) {
          if (entry.second.stop == Stop::kNone && entry.second.indexer)
            shares[entry.first] = entry.second.indexer.get();
        }
        return shares;
      }) {}

IndexingService::~IndexingService() {
  m_extraction.Flush();
  m_shares.clear();  // closes every index cleanly
  if (m_inotify >= 0) {
    m_loop.Unwatch(m_inotify);
    ::close(m_inotify);
  }
}

bool IndexingService::Start(std::string& error) {
  m_inotify = ::inotify_init1(IN_NONBLOCK | IN_CLOEXEC);
  if (m_inotify < 0) {
    error = std::string("inotify: ") + std::strerror(errno);
    return false;
  }
  m_loop.Watch(m_inotify, EPOLLIN, [this](std::uint32_t) { OnInotify(); });
  // folder.conf and status.conf are replaced by rename when saved: watch their directory.
  m_configDirectory = fileindex_daemon::Rooted(kConfigDirectory);
  if (!MakeDirectories(m_configDirectory)) {
    error = m_configDirectory + ": " + std::strerror(errno);
    return false;
  }
  m_configWatch = ::inotify_add_watch(m_inotify, m_configDirectory.c_str(),
                                      IN_MOVED_TO | IN_CLOSE_WRITE | IN_DELETE | IN_CREATE | IN_ONLYDIR);
  if (m_configWatch < 0) {
    error = m_configDirectory + ": " + std::strerror(errno);
    return false;
  }
  ReloadPause();
  ReloadConfig();
  m_loop.After(kTickInterval, [this]() { Tick(); });
  m_extraction.Start();
  m_extraction.Wake();
  return true;
}

void IndexingService::Tick() {
  PollQueues();
  if (m_paused && m_resumeTime > 0 && static_cast<long long>(std::time(nullptr)) >= m_resumeTime)
    ReloadPause();
  m_extraction.Wake();
  m_loop.After(kTickInterval, [this]() { Tick(); });
}

void IndexingService::ReloadPause() {
  bool wasPaused = m_paused;
  if (!ReadPause(m_paused, m_resumeTime)) {
    Log(LOG_ERR, "cannot read the pause state; indexing goes on");
  }
  if (m_paused != wasPaused) {
    if (m_paused && m_resumeTime > 0) {
      char when[64];
      time_t t = static_cast<time_t>(m_resumeTime);
      std::strftime(when, sizeof(when), "%Y-%m-%d %H:%M:%S", std::localtime(&t));
      Log(LOG_INFO, "indexing paused until %s", when);
    } else {
      Log(LOG_INFO, m_paused ? "indexing paused until resumed" : "indexing resumed");
    }
  }
  if (!m_paused) {
    PollQueues();
    m_extraction.Wake();
  }
}

void IndexingService::OpenIndexer(const std::string& name, Share& share, const ShareConfig& config) {
  std::string error;
  share.indexer = ShareIndexer::Open(config, error);
  if (!share.indexer) {
    Log(LOG_ERR, "share %s: cannot open its index: %s", name.c_str(), error.c_str());
    share.stop = Stop::kStoreFailed;
    share.retryAt = Clock::now() + kRetryAfterFailure;
    return;
  }
  const std::string& note = share.indexer->Store().SetAsideNote();
  if (!note.empty())
    Log(LOG_ERR, "share %s: its index was damaged (%s); indexing it again", name.c_str(), note.c_str());
  if (!share.indexer->Configure(config)) {
    Log(LOG_ERR, "share %s: %s", name.c_str(), share.indexer->LastError().c_str());
    if (RebuildIfDamaged(name, share)) return;
  }
  share.indexer->PollQueue();
}

bool IndexingService::RebuildIfDamaged(const std::string& name, Share& share) {
  if (!share.indexer || !share.indexer->Store().IsDamaged()) return false;
  const ShareConfig config = share.indexer->config();
  m_extraction.Flush();
  share.indexer.reset();
  std::string error;
  if (!fileindex_store::IndexWriter::SetAside(config.dbDirectory, error)) {
    Log(LOG_ERR, "share %s: its index is damaged and cannot be set aside: %s", name.c_str(), error.c_str());
    share.stop = Stop::kStoreFailed;
    share.retryAt = Clock::now() + kRetryAfterFailure;
    return true;
  }
  Log(LOG_ERR, "share %s: its index is damaged; it is kept as %s.damaged and the share is indexed again",
      name.c_str(), fileindex_store::IndexFilePath(config.dbDirectory).c_str());
  OpenIndexer(name, share, config);
  return true;
}

void IndexingService::WatchQueueDirectory(Share& share, const std::string& queuePath) {
  if (share.watch >= 0) return;
  const std::string dir = DirName(queuePath);
  share.watch = ::inotify_add_watch(m_inotify, dir.c_str(),
                                    IN_CREATE | IN_MOVED_TO | IN_CLOSE_WRITE | IN_MODIFY | IN_ONLYDIR);
  if (share.watch < 0) {
    // The once-a-second look at every queue still finds its events.
    Log(LOG_WARNING, "cannot watch %s (%s); its queue is checked every second", dir.c_str(),
        std::strerror(errno));
  }
}

void IndexingService::ReloadConfig() {
  std::map<std::string, ShareConfig> configs;
  std::vector<std::string> problems;
  std::string error;
  if (!LoadShareConfigs(configs, problems, error)) {
    Log(LOG_ERR, "%s; keeping the folders as they were", error.c_str());
    return;
  }
  for (const std::string& problem : problems) Log(LOG_ERR, "%s; not indexed", problem.c_str());

  // Shares no longer listed (removed, or renamed: the new name comes as a new share whose
  // index moved with its directory) stop being served.
  for (auto it = m_shares.begin(); it != m_shares.end();) {
    if (configs.count(it->first)) {
      ++it;
      continue;
    }
    Log(LOG_INFO, "share %s: no longer indexed", it->first.c_str());
    if (it->second.watch >= 0) ::inotify_rm_watch(m_inotify, it->second.watch);
    m_extraction.Flush();
    it = m_shares.erase(it);
  }
  for (const auto& entry : configs) {
    const std::string& name = entry.first;
    const ShareConfig& config = entry.second;
    bool added = !m_shares.count(name);
    Share& share = m_shares[name];
    if (added) {
      Log(LOG_INFO, "share %s: indexing %zu folder(s)", name.c_str(), config.folders.size());
      if (m_stoppedByCommand.count(name)) share.stop = Stop::kByCommand;
      if (TAVO::FILEINDEX::StatusMgr::ShareIsNoSpace(name)) share.stop = Stop::kNoSpace;
    }
    WatchQueueDirectory(share, config.queuePath);
    if (share.indexer && share.indexer->config().dbDirectory != config.dbDirectory) {
      m_extraction.Flush();
      share.indexer.reset();
    }
    if (!share.indexer) {
      OpenIndexer(name, share, config);
    } else if (!share.indexer->Configure(config)) {
      Log(LOG_ERR, "share %s: %s", name.c_str(), share.indexer->LastError().c_str());
    }
  }
  if (m_observer) m_observer(configs);
  m_extraction.Wake();
}

void IndexingService::OnInotify() {
  alignas(inotify_event) char buffer[16384];
  bool configChanged = false;
  bool queueChanged = false;
  for (;;) {
    ssize_t n = ::read(m_inotify, buffer, sizeof(buffer));
    if (n <= 0) break;
    for (char* p = buffer; p < buffer + n;) {
      auto* event = reinterpret_cast<inotify_event*>(p);
      p += sizeof(inotify_event) + event->len;
      const char* name = event->len > 0 ? event->name : "";
      if (event->mask & IN_Q_OVERFLOW) {
        configChanged = queueChanged = true;
      } else if (event->wd == m_configWatch) {
        if (std::strcmp(name, kFolderConf) == 0) configChanged = true;
        if (std::strcmp(name, kStatusConf) == 0) ReloadPause();
      } else {
        queueChanged = true;
      }
    }
  }
  if (configChanged && m_reloadTimer == 0) {
    m_reloadTimer = m_loop.After(kSettleDelay, [this]() {
      m_reloadTimer = 0;
      ReloadConfig();
    });
  }
  if (queueChanged) SchedulePoll();
}

void IndexingService::SchedulePoll() {
  if (m_pollTimer != 0) return;
  m_pollTimer = m_loop.After(kSettleDelay, [this]() {
    m_pollTimer = 0;
    PollQueues();
  });
}

void IndexingService::PollQueues() {
  if (m_paused) return;  // queues wait, and writers keep appending to them
  for (auto& entry : m_shares) {
    Share& share = entry.second;
    if (share.stop == Stop::kStoreFailed && Clock::now() >= share.retryAt) {
      share.stop = Stop::kNone;
      if (!share.indexer) {
        std::map<std::string, ShareConfig> configs;
        std::vector<std::string> problems;
        std::string error;
        if (LoadShareConfigs(configs, problems, error) && configs.count(entry.first))
          OpenIndexer(entry.first, share, configs[entry.first]);
      }
    }
    if (share.stop == Stop::kNone && share.indexer) share.indexer->PollQueue();
  }
}

bool IndexingService::HasRunnableWork() const {
  if (m_paused) return false;
  for (const auto& entry : m_shares) {
    const Share& share = entry.second;
    if (share.stop == Stop::kNone && share.indexer && share.indexer->HasWork()) return true;
  }
  return false;
}

bool IndexingService::HasSpace(const std::string& name, Share& share) {
  Clock::time_point now = Clock::now();
  if (now < share.nextSpaceCheck) return true;
  share.nextSpaceCheck = now + kSpaceCheckInterval;
  if (TAVO::FILEINDEX::IsShareSpaceEnough(name)) return true;
  Log(LOG_ERR, "share %s: out of space; its indexing stops until it is revived", name.c_str());
  // Marking the share raises the administrators' notification the first time.
  if (!TAVO::FILEINDEX::StatusMgr::ShareSetNoSpace(name, true))
    Log(LOG_ERR, "share %s: cannot mark it out of space", name.c_str());
  share.stop = Stop::kNoSpace;
  return false;
}

void IndexingService::RunSlice(milliseconds budget) {
  if (m_paused || m_shares.empty()) return;
  // The first share after the one served last that has work.
  auto it = m_shares.upper_bound(m_nextShare);
  for (std::size_t i = 0; i <= m_shares.size(); ++i, ++it) {
    if (it == m_shares.end()) it = m_shares.begin();
    Share& share = it->second;
    if (share.stop == Stop::kNone && share.indexer && share.indexer->HasWork()) break;
  }
  Share& share = it->second;
  const std::string name = it->first;
  m_nextShare = name;
  if (share.stop != Stop::kNone || !share.indexer || !share.indexer->HasWork()) return;
  if (!HasSpace(name, share)) return;
  const ShareIndexer::SliceResult result = share.indexer->RunSlice(Clock::now() + budget);
  m_extraction.Wake();
  if (result == ShareIndexer::SliceResult::kStoreFailed) {
    const std::string error = share.indexer->LastError();
    Log(LOG_ERR, "share %s: index write failed: %s", name.c_str(), error.c_str());
    if (RebuildIfDamaged(name, share)) return;
    if (error.find("full") != std::string::npos) {
      share.nextSpaceCheck = Clock::time_point();
      if (!HasSpace(name, share)) return;
    }
    share.stop = Stop::kStoreFailed;
    share.retryAt = Clock::now() + kRetryAfterFailure;
  }
}

void IndexingService::HandleCommand(const Json::Value& command) {
  const std::string type = command["type"].asString();
  const Json::Value& data = command["data"];
  std::string share = data.isObject() && data["share_name"].isString() ? data["share_name"].asString() : "";
  if (type == "upsert_folder_setting" || type == "delete_folder_setting") {
    ReloadConfig();
  } else if (type == "pause" || type == "resume") {
    ReloadPause();  // status.conf, already saved by the sender, is the authority
  } else if (type == "delete_share_worker" || type == "revive_share_worker") {
    if (share.empty()) {
      Log(LOG_ERR, "command %s without a share name dropped", type.c_str());
      return;
    }
    bool stop = type == "delete_share_worker";
    Log(LOG_INFO, "share %s: worker %s", share.c_str(), stop ? "stopped" : "revived");
    auto it = m_shares.find(share);
    if (stop) {
      m_stoppedByCommand.insert(share);
      if (it != m_shares.end()) {
        m_extraction.Flush();
        it->second.stop = Stop::kByCommand;
        it->second.indexer.reset();  // its index is closed cleanly until it is revived
      }
      return;
    }
    // Revival also ends a stop for lack of space: the space is checked again first.
    m_stoppedByCommand.erase(share);
    if (it != m_shares.end()) {
      it->second.stop = Stop::kNone;
      it->second.nextSpaceCheck = Clock::time_point();
    }
    ReloadConfig();
  } else {
    Log(LOG_ERR, "unknown command \"%s\" dropped", type.c_str());
  }
}

}  // namespace fileindexd
