// fileindexd's core: the shares it serves as folder.conf lists them, the pause state of
// status.conf, the commands of the library, and the order in which shares get to work.
#ifndef FILEINDEXD_INDEXING_SERVICE_H
#define FILEINDEXD_INDEXING_SERVICE_H

#include <daemon_support.h>
#include <json/json.h>

#include <functional>
#include <map>
#include <memory>
#include <set>
#include <string>

#include "extraction.h"
#include "share_indexer.h"

namespace fileindexd {

class IndexingService {
 public:
  using ConfigObserver = std::function<void(const std::map<std::string, ShareConfig>&)>;

  explicit IndexingService(fileindex_daemon::EventLoop& loop);
  ~IndexingService();

  // Told the shares served each time folder.conf has been read (before Start returns too).
  void ObserveConfig(ConfigObserver observer) { m_observer = std::move(observer); }
  bool Start(std::string& error);
  void HandleCommand(const Json::Value& command);

  // Whether some share has work it may do now (not paused, not stopped).
  bool HasRunnableWork() const;
  // Gives the next share with work one slice of at most `budget`.
  void RunSlice(std::chrono::milliseconds budget);

 private:
  enum class Stop { kNone, kByCommand, kNoSpace, kStoreFailed };
  struct Share {
    std::unique_ptr<ShareIndexer> indexer;
    int watch = -1;  // inotify watch of the queue's directory
    Stop stop = Stop::kNone;
    Clock::time_point nextSpaceCheck;
    Clock::time_point retryAt;
  };

  void ReloadConfig();
  void ReloadPause();
  void OnInotify();
  void Tick();
  void PollQueues();
  void SchedulePoll();
  void WatchQueueDirectory(Share& share, const std::string& queuePath);
  bool HasSpace(const std::string& name, Share& share);
  void OpenIndexer(const std::string& name, Share& share, const ShareConfig& config);
  // After a failed write: a damaged index is set aside and the share indexed again from
  // the disk. False when the index is not damaged.
  bool RebuildIfDamaged(const std::string& name, Share& share);

  fileindex_daemon::EventLoop& m_loop;
  std::map<std::string, Share> m_shares;
  std::set<std::string> m_stoppedByCommand;  // kept across configuration changes
  std::string m_nextShare;                   // round robin
  int m_inotify = -1;
  int m_configWatch = -1;
  std::string m_configDirectory;
  bool m_paused = false;
  long long m_resumeTime = -1;
  std::uint64_t m_reloadTimer = 0;
  std::uint64_t m_pollTimer = 0;
  std::uint64_t m_pauseTimer = 0;
  ConfigObserver m_observer;
  // Last, so that it goes first: it writes its results into the shares' indexes.
  Extraction m_extraction;
};

}  // namespace fileindexd

#endif
