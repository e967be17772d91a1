// The folders of every watch list, watched recursively with one inotify instance, and the
// queue lines their events become.
//
// Each directory has one watch, whatever number of folders (of one list or of several)
// cover it; the watch records which folders own it. A directory inherits the owners of
// its parent except those that ignore its name, so nested folders and the same directory
// in two lists need no extra handling. The watch mask is the owners' masks plus what
// recursion needs; a line is written only for the events an owner's mask asks for.
#ifndef FILEINDEX_TAVOTIFYD_TREE_WATCHER_H
#define FILEINDEX_TAVOTIFYD_TREE_WATCHER_H

#include <sys/inotify.h>

#include <chrono>
#include <cstdint>
#include <deque>
#include <map>
#include <set>
#include <string>
#include <tuple>
#include <unordered_map>
#include <unordered_set>
#include <vector>

#include "daemon_support.h"
#include "queue_writer.h"
#include "watch_lists.h"

namespace tavotifyd {

class TreeWatcher {
 public:
  explicit TreeWatcher(QueueWriter& writer);
  ~TreeWatcher();
  TreeWatcher(const TreeWatcher&) = delete;
  TreeWatcher& operator=(const TreeWatcher&) = delete;

  bool Open();
  int Fd() const { return m_inotify; }

  // Follows the lists (by list file): folders no longer listed stop being watched, new
  // ones are watched from now on. Unchanged folders keep their watches.
  void SetLists(const std::map<std::string, WatchList>& lists);
  // Reads and handles every pending event.
  void ReadEvents();
  // A move's two halves may arrive in separate reads: the first half waits this long.
  static constexpr std::chrono::milliseconds kMovePartnerWait{10};
  bool HasUnpairedMoves() const { return !m_movedFrom.empty(); }
  // Reports moves whose partner did not come in time (all of them when `all`) as deletions.
  void ExpireUnpairedMoves(bool all);
  // Retries folders that are missing or only partly watched.
  void RetryIncomplete();

  std::vector<std::string> FoldersOfQueue(const std::string& queue) const;
  std::size_t WatchCount() const { return m_dirs.size(); }
  std::size_t FolderCount() const { return m_folders.size(); }

 private:
  using FolderId = std::uint32_t;
  using Owners = std::vector<FolderId>;  // sorted

  struct Folder {
    std::string listFile;
    std::string queue;
    WatchedFolder config;
    int rootWatch = -1;
    bool lost = false;  // its root was watched once and went away: reindex when back
    bool missingLogged = false;
    bool incomplete = false;  // some directory could not be watched
    std::chrono::seconds retryDelay{0};
    fileindex_daemon::Clock::time_point nextRetry;
  };
  struct Directory {
    std::string path;
    std::string name;
    int parent = -1;
    std::map<std::string, int> children;
    Owners owners;
    Owners rootOf;  // folders whose root this directory is
    std::uint32_t mask = 0;
  };
  struct MovedFrom {
    std::uint32_t cookie;
    int watch;
    std::string name;
    std::string path;
    bool isDirectory;
    Owners owners;
    fileindex_daemon::Clock::time_point deadline;
  };
  // What a crawl does besides adding watches.
  struct CrawlMode {
    bool reportContents = false;  // a created line for every entry found
    bool descendKnown = false;    // walk into directories already watched for these owners
    FolderId rootOf = 0;          // non-zero: the crawl starts at this folder's root
  };
  using FolderKey = std::tuple<std::string, std::string, std::string, std::uint32_t, std::set<std::string>>;

  void Handle(const inotify_event& event);
  void HandleSelf(int watch, std::uint32_t mask);
  void Moved(const MovedFrom& from, int toWatch, const std::string& toName);
  void MovedOut(const MovedFrom& from);

  // Returns the number of directories that could not be watched.
  std::size_t Crawl(const std::string& path, int parent, const std::string& name, const Owners& owners,
                    const CrawlMode& mode);
  bool AttachRoot(FolderId id);
  void WatchFailed(const Owners& owners, const std::string& path, int error);
  void DropOwners(int watch, const Owners& owners, bool subtree);
  void ForgetDirectory(int watch);
  void Relink(int watch, int parent, const std::string& name);
  void SetPath(int watch, const std::string& path);
  void UpdateMask(Directory& dir);
  std::uint32_t MaskFor(const Owners& owners) const;
  Owners Visible(const Directory& dir, const std::string& name) const;
  void Report(const Owners& owners, std::uint32_t wanted, std::uint32_t code, const std::string& path);
  void Overflowed();

  QueueWriter& m_writer;
  int m_inotify = -1;
  FolderId m_nextFolder = 1;
  std::unordered_map<FolderId, Folder> m_folders;
  std::map<FolderKey, FolderId> m_folderByKey;
  std::unordered_map<int, Directory> m_dirs;
  std::unordered_map<std::string, int> m_dirByPath;
  std::unordered_set<std::string> m_queueFiles;  // never reported: writing them would feed back
  std::deque<MovedFrom> m_movedFrom;
};

}  // namespace tavotifyd

#endif
