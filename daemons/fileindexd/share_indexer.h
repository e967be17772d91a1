// The indexing of one share: its index store, the work it has to do (crawls and single
// paths to look at again), and the consumption of its event queue.
//
// Every piece of work compares the file system with the index and makes the index agree,
// so work may be repeated or reordered without harm: a queue replayed after a crash, a
// folder crawled twice, an event about a file that is gone again.
#ifndef FILEINDEXD_SHARE_INDEXER_H
#define FILEINDEXD_SHARE_INDEXER_H

#include <store.h>
#include <sys/stat.h>

#include <chrono>
#include <cstdint>
#include <deque>
#include <map>
#include <memory>
#include <string>
#include <unordered_set>
#include <vector>

#include "service_config.h"

namespace fileindexd {

using Clock = std::chrono::steady_clock;

class ShareIndexer {
 public:
  // Opens the share's index. Null with error set when it cannot be opened.
  static std::unique_ptr<ShareIndexer> Open(const ShareConfig& config, std::string& error);
  ~ShareIndexer();

  const ShareConfig& config() const { return m_config; }

  // Applies a (possibly changed) folder list of this share: folders that are new, changed
  // their flags or never finished a crawl are crawled; folders no longer listed give up
  // their entries (those still governed by another folder stay).
  bool Configure(const ShareConfig& config);

  // Takes the share's queue when there is one (or finishes one left by an earlier run).
  void PollQueue();

  bool HasWork() const;

  enum class SliceResult { kIdle, kMore, kStoreFailed };
  // Works until the deadline; a failed store transaction is rolled back and its work kept.
  SliceResult RunSlice(Clock::time_point deadline);

  const std::string& LastError() const { return m_error; }

  // Figures for logs and tests.
  std::uint64_t entriesWritten() const { return m_entriesWritten; }
  // Grows whenever the index gains files whose contents are to be extracted.
  std::uint64_t changes() const { return m_entriesWritten + m_contentsForgotten; }

  // For the extraction of contents, which writes into the same index between slices.
  fileindex_store::IndexWriter& Store() { return *m_store; }
  bool AllowsKind(const std::string& folder, fileindex_store::Kind kind) const {
    return KindAllowed(folder, kind);
  }
  std::string PathOnDisk(const std::string& relative) const { return FullPath(relative); }

 private:
  enum class TaskType { kPath, kTree, kFolderCrawled, kFolderGone };
  struct Task {
    Task(TaskType type, std::string path, std::string folder = "", bool checked = false)
        : type(type), path(std::move(path)), folder(std::move(folder)), checked(checked) {}
    TaskType type;
    std::string path;  // relative to the share directory
    // For a directory reached by a crawl from its parent: the folder governing it, its
    // place already checked against the rules on the way down.
    std::string folder;
    bool checked = false;
  };

  ShareIndexer(const ShareConfig& config, std::unique_ptr<fileindex_store::IndexWriter> store);

  bool RunTask(const Task& task);
  bool ReconcilePath(const std::string& path);
  bool ReconcileDirectory(const Task& task);
  bool FolderCrawled(const std::string& folder);
  bool FolderGone(const std::string& folder);
  // Crawls a folder with its current flags, unless such a crawl is already queued and
  // `force` is false.
  void CrawlFolder(const std::string& folder, bool force);
  void AddPathTask(const std::string& path);

  // The governing folder of a full path (relative to the share); false when none.
  bool GoverningFolder(const std::string& full, std::string& folder) const;
  bool IsExcluded(const std::string& folder, const std::string& path) const;
  std::string FullPath(const std::string& relative) const;
  fileindex_store::Entry EntryFor(const std::string& parent, const std::string& name, const struct stat& st,
                                  const std::string& folder) const;
  bool KindAllowed(const std::string& folder, fileindex_store::Kind kind) const;
  // A file's entry is indexed as the kind its content was found to be while the file is
  // the version extracted, else as its name suggests. kDrop: the kind its name suggests
  // is switched off in folder; kByName: its content's kind is, and it is kept by its name
  // only.
  enum class KindVerdict { kKeep, kDrop, kByName };
  KindVerdict DecideKind(const std::string& folder, const fileindex_store::Entry* indexed,
                         fileindex_store::Entry& entry) const;

  // Queue consumption.
  void ReadQueue();
  void QueueLine(const char* line, std::size_t size);
  void FinishQueueIfDone();

  ShareConfig m_config;
  std::unique_ptr<fileindex_store::IndexWriter> m_store;
  std::deque<Task> m_tasks;
  std::unordered_set<std::string> m_pendingPaths;
  // Folders whose crawl is queued, with the flags it was queued for, and when it began.
  struct QueuedCrawl {
    FolderFlags flags;
    Clock::time_point since;
    std::uint64_t entriesBefore = 0;
  };
  std::map<std::string, QueuedCrawl> m_queuedCrawls;
  std::string m_error;
  std::uint64_t m_entriesWritten = 0;
  std::uint64_t m_contentsForgotten = 0;

  bool m_haveQueue = false;  // the ".tmp" companion is being consumed
  int m_queueFd = -1;
  std::uint64_t m_queueOffset = 0;
  bool m_queueAtEnd = false;
  bool m_skippingLongLine = false;
};

}  // namespace fileindexd

#endif
