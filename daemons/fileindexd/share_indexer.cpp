#include "share_indexer.h"

#include <daemon_support.h>
#include <dirent.h>
#include <fcntl.h>
#include <fileindex/utils.h>
#include <queue_events.h>
#include <queue_file.h>
#include <sys/stat.h>
#include <syslog.h>
#include <unistd.h>

#include <cerrno>
#include <cstring>
#include <map>

namespace fileindexd {

using fileindex_daemon::Log;
using fileindex_store::Entry;
using fileindex_store::Kind;

namespace {

// Enough queued work to keep a slice busy; the queue file is read on only below this, so
// a huge queue never has to fit in memory.
const std::size_t kTaskLowWater = 2048;
const std::size_t kQueueReadBlock = 256 * 1024;
const std::size_t kMaxQueueLine = 64 * 1024;

std::string DirName(const std::string& path) {
  std::string::size_type slash = path.rfind('/');
  return slash == std::string::npos ? std::string() : path.substr(0, slash);
}

std::string BaseName(const std::string& path) {
  std::string::size_type slash = path.rfind('/');
  return slash == std::string::npos ? path : path.substr(slash + 1);
}

bool IsInside(const std::string& path, const std::string& dir) {
  return dir.empty() || path == dir ||
         (path.size() > dir.size() && path.compare(0, dir.size(), dir) == 0 && path[dir.size()] == '/');
}

bool SameEntry(const Entry& a, const Entry& b) {
  return a.isDir == b.isDir && a.size == b.size && a.mtime == b.mtime && a.kind == b.kind &&
         a.folder == b.folder;
}

}  // namespace

std::unique_ptr<ShareIndexer> ShareIndexer::Open(const ShareConfig& config, std::string& error) {
  auto store = fileindex_store::IndexWriter::Open(config.dbDirectory, error);
  if (!store) return nullptr;
  std::unique_ptr<ShareIndexer> indexer(new ShareIndexer(config, std::move(store)));
  return indexer;
}

ShareIndexer::ShareIndexer(const ShareConfig& config, std::unique_ptr<fileindex_store::IndexWriter> store)
    : m_config(config), m_store(std::move(store)) {}

ShareIndexer::~ShareIndexer() {
  if (m_queueFd >= 0) ::close(m_queueFd);
  m_store->Checkpoint();
}

std::string ShareIndexer::FullPath(const std::string& relative) const {
  return relative.empty() ? m_config.directory : m_config.directory + "/" + relative;
}

bool ShareIndexer::Configure(const ShareConfig& config) {
  m_config = config;
  std::vector<fileindex_store::FolderState> applied;
  if (!m_store->Folders(applied)) {
    m_error = m_store->LastError();
    return false;
  }
  std::map<std::string, fileindex_store::FolderState> known;
  for (const auto& folder : applied) known[folder.path] = folder;
  for (const auto& entry : m_config.flags) {
    auto it = known.find(entry.first);
    const FolderFlags& flags = entry.second;
    if (it == known.end() || !it->second.crawled || it->second.document != flags.document ||
        it->second.audio != flags.audio || it->second.video != flags.video ||
        it->second.photo != flags.photo) {
      // Files kept by their names because their content's kind was off are looked at again.
      std::uint64_t forgotten = 0;
      if (it != known.end() && !m_store->ForgetKindSkipped(entry.first, forgotten)) {
        m_error = m_store->LastError();
        return false;
      }
      m_contentsForgotten += forgotten;
      CrawlFolder(entry.first, false);
    }
  }
  for (const auto& entry : known) {
    if (!m_config.flags.count(entry.first)) m_tasks.push_back({TaskType::kFolderGone, entry.first});
  }
  return true;
}

void ShareIndexer::CrawlFolder(const std::string& folder, bool force) {
  // A new folder is announced twice (its command and its queued settings event): one
  // crawl serves both, unless the flags changed since it was queued.
  auto flags = m_config.flags.find(folder);
  auto queued = m_queuedCrawls.find(folder);
  if (!force && flags != m_config.flags.end() && queued != m_queuedCrawls.end() &&
      queued->second.flags == flags->second) {
    return;
  }
  QueuedCrawl& crawl = m_queuedCrawls[folder];
  if (flags != m_config.flags.end()) crawl.flags = flags->second;
  crawl.since = Clock::now();
  crawl.entriesBefore = m_entriesWritten;
  // The folder's own entry, then everything below it, then the mark that it is done: a
  // crawl pushes subdirectories to the front, so the mark runs after the whole tree.
  AddPathTask(folder);
  m_tasks.push_back({TaskType::kTree, folder});
  m_tasks.push_back({TaskType::kFolderCrawled, folder});
}

void ShareIndexer::AddPathTask(const std::string& path) {
  if (m_pendingPaths.insert(path).second) m_tasks.push_back({TaskType::kPath, path});
}

bool ShareIndexer::HasWork() const { return !m_tasks.empty() || m_haveQueue; }

bool ShareIndexer::GoverningFolder(const std::string& full, std::string& folder) const {
  Json::Value record = TAVO::FILEINDEX::GetMostSuitableCfg(m_config.folders, full);
  if (!record.isObject() || !record["path"].isString()) return false;
  auto it = m_config.relativeByPath.find(record["path"].asString());
  if (it == m_config.relativeByPath.end()) return false;
  folder = it->second;
  return true;
}

// Whether a path below its governing folder may not be indexed: any directory on the way
// down, or the path itself, that the library's rules skip.
bool ShareIndexer::IsExcluded(const std::string& folder, const std::string& path) const {
  std::string::size_type start = folder.empty() ? 0 : folder.size() + 1;
  while (start <= path.size() && path != folder) {
    std::string::size_type slash = path.find('/', start);
    std::string prefix = slash == std::string::npos ? path : path.substr(0, slash);
    if (TAVO::FILEINDEX::IsSkipIndex(FullPath(prefix))) return true;
    if (slash == std::string::npos) break;
    start = slash + 1;
  }
  return false;
}

bool ShareIndexer::KindAllowed(const std::string& folder, Kind kind) const {
  auto it = m_config.flags.find(folder);
  if (it == m_config.flags.end()) return false;
  switch (kind) {
    case Kind::kDocument:
      return it->second.document;
    case Kind::kAudio:
      return it->second.audio;
    case Kind::kVideo:
      return it->second.video;
    case Kind::kPhoto:
      return it->second.photo;
    case Kind::kOther:
      break;
  }
  return true;  // no flag covers other files: they are found by name whatever the flags
}

ShareIndexer::KindVerdict ShareIndexer::DecideKind(const std::string& folder, const Entry* indexed,
                                                   Entry& entry) const {
  if (entry.isDir) return KindVerdict::kKeep;
  const Kind byName = entry.kind;
  // A kind that the name gives and the folder switches off drops the file whatever its
  // content: what the index holds must not depend on whether the content was read
  // before the flag changed.
  if (!KindAllowed(folder, byName)) return KindVerdict::kDrop;
  if (indexed != nullptr && !indexed->isDir && indexed->size == entry.size && indexed->mtime == entry.mtime)
    entry.kind = indexed->kind;
  if (KindAllowed(folder, entry.kind)) return KindVerdict::kKeep;
  entry.kind = byName;
  return KindVerdict::kByName;
}

Entry ShareIndexer::EntryFor(const std::string& parent, const std::string& name, const struct stat& st,
                             const std::string& folder) const {
  Entry entry;
  entry.parent = parent;
  entry.name = name;
  entry.isDir = S_ISDIR(st.st_mode);
  entry.size = entry.isDir ? 0 : static_cast<std::int64_t>(st.st_size);
  entry.mtime = static_cast<std::int64_t>(st.st_mtim.tv_sec);
  entry.kind =
      entry.isDir ? Kind::kOther : fileindex_store::KindOfExtension(fileindex_store::ExtensionOf(name));
  entry.folder = folder;
  return entry;
}

bool ShareIndexer::RunTask(const Task& task) {
  switch (task.type) {
    case TaskType::kPath:
      m_pendingPaths.erase(task.path);
      return ReconcilePath(task.path);
    case TaskType::kTree:
      return ReconcileDirectory(task);
    case TaskType::kFolderCrawled:
      return FolderCrawled(task.path);
    case TaskType::kFolderGone:
      return FolderGone(task.path);
  }
  return true;
}

// One path, looked at again: indexed as it is now, or removed with everything below it.
bool ShareIndexer::ReconcilePath(const std::string& path) {
  if (path.empty()) {
    m_tasks.push_front({TaskType::kTree, path});
    return true;
  }
  const std::string parent = DirName(path);
  const std::string name = BaseName(path);
  const std::string full = FullPath(path);
  struct stat st;
  std::string folder;
  bool keep = ::lstat(full.c_str(), &st) == 0 && GoverningFolder(full, folder) && !IsExcluded(folder, path);
  if (!keep) return m_store->Remove(parent, name);
  Entry entry = EntryFor(parent, name, st, folder);
  Entry indexed;
  bool found = false;
  if (!m_store->Find(parent, name, indexed, found)) return false;
  const KindVerdict verdict = DecideKind(folder, found ? &indexed : nullptr, entry);
  if (verdict == KindVerdict::kDrop) return m_store->Remove(parent, name);
  if (found && SameEntry(indexed, entry)) return true;
  if (found && indexed.isDir && !entry.isDir && !m_store->RemoveBelow(path)) return false;
  if (!m_store->Put(entry)) return false;
  if (verdict == KindVerdict::kByName && !m_store->ForgetContent(parent, name)) return false;
  ++m_entriesWritten;
  // A directory that is new to the index (created, moved in, renamed) is crawled.
  if (entry.isDir && (!found || !indexed.isDir || indexed.folder != entry.folder))
    m_tasks.push_front({TaskType::kTree, path});
  return true;
}

// Makes the index's entries of one directory match the directory, and queues its
// subdirectories to be crawled next.
bool ShareIndexer::ReconcileDirectory(const Task& task) {
  const std::string& dir = task.path;
  const std::string full = FullPath(dir);
  std::string folder = task.folder;
  if (!task.checked && (!GoverningFolder(full, folder) || IsExcluded(folder, dir))) {
    // Nothing here is indexed any more, except folders configured below it.
    if (!dir.empty() && !m_store->Remove(DirName(dir), BaseName(dir))) return false;
    if (!m_store->RemoveBelow(dir)) return false;
    for (const auto& configured : m_config.flags) {
      if (configured.first != dir && IsInside(configured.first, dir)) CrawlFolder(configured.first, true);
    }
    return true;
  }

  std::vector<Entry> indexedChildren;
  if (!m_store->ListChildren(dir, indexedChildren)) return false;
  std::map<std::string, Entry> indexed;
  for (Entry& entry : indexedChildren) indexed.emplace(entry.name, std::move(entry));

  int fd = ::open(full.c_str(), O_RDONLY | O_DIRECTORY | O_NOFOLLOW | O_CLOEXEC);
  std::unique_ptr<DIR, int (*)(DIR*)> stream(fd >= 0 ? ::fdopendir(fd) : nullptr, ::closedir);
  if (!stream) {
    int reason = errno;
    if (fd >= 0) ::close(fd);
    if (reason != ENOENT && reason != ENOTDIR && reason != ELOOP)
      Log(LOG_WARNING, "cannot read %s: %s", full.c_str(), std::strerror(reason));
    return ReconcilePath(dir);  // gone or replaced: its entry and everything below go
  }
  std::vector<Task> subdirectories;
  while (struct dirent* item = ::readdir(stream.get())) {
    const std::string name = item->d_name;
    if (name == "." || name == "..") continue;
    struct stat st;
    if (::fstatat(fd, name.c_str(), &st, AT_SYMLINK_NOFOLLOW) != 0) continue;  // gone meanwhile
    const std::string path = fileindex_store::JoinPath(dir, name);
    // The rules that depend on where a path lies hold for a whole directory, so they are
    // asked for each directory (and at the top of the share); the name rule for each file.
    bool isDir = S_ISDIR(st.st_mode);
    bool excluded = (isDir || dir.empty()) ? TAVO::FILEINDEX::IsSkipIndex(full + "/" + name)
                                           : TAVO::FILEINDEX::IsSystemPreservedFileName(name);
    if (excluded) continue;
    // A directory governs itself only when it is a configured folder, and even then the
    // library's order of folders decides.
    std::string entryFolder = folder;
    if (isDir && m_config.flags.count(path) && !GoverningFolder(full + "/" + name, entryFolder)) continue;
    Entry entry = EntryFor(dir, name, st, entryFolder);
    auto it = indexed.find(name);
    const KindVerdict verdict = DecideKind(folder, it != indexed.end() ? &it->second : nullptr, entry);
    if (verdict == KindVerdict::kDrop) continue;  // left in `indexed`, so removed below
    if (it != indexed.end()) {
      bool same = SameEntry(it->second, entry);
      bool wasDir = it->second.isDir;
      indexed.erase(it);
      if (wasDir && !entry.isDir && !m_store->RemoveBelow(path)) return false;
      if (same) {
        if (isDir) subdirectories.push_back({TaskType::kTree, path, entryFolder, true});
        continue;
      }
    }
    if (!m_store->Put(entry)) return false;
    if (verdict == KindVerdict::kByName && !m_store->ForgetContent(dir, name)) return false;
    ++m_entriesWritten;
    if (isDir) subdirectories.push_back({TaskType::kTree, path, entryFolder, true});
  }
  stream.reset();
  for (const auto& gone : indexed) {
    if (!m_store->Remove(dir, gone.first)) return false;
  }
  for (auto it = subdirectories.rbegin(); it != subdirectories.rend(); ++it)
    m_tasks.push_front(std::move(*it));
  return true;
}

bool ShareIndexer::FolderCrawled(const std::string& folder) {
  auto queued = m_queuedCrawls.find(folder);
  if (queued != m_queuedCrawls.end()) {
    auto ms =
        std::chrono::duration_cast<std::chrono::milliseconds>(Clock::now() - queued->second.since).count();
    Log(LOG_INFO, "share %s: folder /%s crawled in %lld ms (%llu entries written)", m_config.name.c_str(),
        folder.c_str(), static_cast<long long>(ms),
        static_cast<unsigned long long>(m_entriesWritten - queued->second.entriesBefore));
    m_queuedCrawls.erase(queued);
  }
  auto it = m_config.flags.find(folder);
  if (it == m_config.flags.end()) return true;  // removed meanwhile; its removal is queued
  fileindex_store::FolderState state;
  state.path = folder;
  state.document = it->second.document;
  state.audio = it->second.audio;
  state.video = it->second.video;
  state.photo = it->second.photo;
  state.crawled = true;
  return m_store->PutFolder(state);
}

bool ShareIndexer::FolderGone(const std::string& folder) {
  if (m_config.flags.count(folder)) return true;  // configured again meanwhile
  if (!m_store->RemoveFolder(folder)) return false;
  // Crawling it again with the folders as they are now drops what nothing governs and
  // hands the rest to the folder that governs it now.
  AddPathTask(folder);
  m_tasks.push_front({TaskType::kTree, folder});
  return true;
}

void ShareIndexer::PollQueue() {
  if (m_haveQueue) return;
  switch (fileindex_queue::TakeQueue(m_config.queuePath)) {
    case fileindex_queue::TakeResult::kTaken: {
      const std::string tmp = fileindex_queue::TmpCompanion(m_config.queuePath);
      m_queueFd = ::open(tmp.c_str(), O_RDONLY | O_CLOEXEC | O_NOFOLLOW | O_NONBLOCK);
      if (m_queueFd < 0) {
        Log(LOG_ERR, "cannot read queue %s: %s", tmp.c_str(), std::strerror(errno));
        return;
      }
      m_haveQueue = true;
      m_queueOffset = 0;
      m_queueAtEnd = false;
      m_skippingLongLine = false;
      break;
    }
    case fileindex_queue::TakeResult::kFailed:
      Log(LOG_ERR, "cannot take queue %s: %s", m_config.queuePath.c_str(), std::strerror(errno));
      break;
    case fileindex_queue::TakeResult::kEmpty:
    case fileindex_queue::TakeResult::kBusy:
      break;
  }
}

void ShareIndexer::ReadQueue() {
  if (!m_haveQueue || m_queueAtEnd) return;
  std::string block(kQueueReadBlock, '\0');
  ssize_t n = ::pread(m_queueFd, &block[0], block.size(), static_cast<off_t>(m_queueOffset));
  if (n <= 0) {
    if (n < 0) Log(LOG_ERR, "cannot read queue of %s: %s", m_config.name.c_str(), std::strerror(errno));
    m_queueAtEnd = true;
    return;
  }
  block.resize(static_cast<std::size_t>(n));
  std::size_t start = 0;
  for (;;) {
    std::size_t newline = block.find('\n', start);
    if (newline == std::string::npos) break;
    if (m_skippingLongLine) {
      m_skippingLongLine = false;
    } else {
      QueueLine(block.data() + start, newline - start);
    }
    start = newline + 1;
  }
  if (start == 0 && block.size() >= kMaxQueueLine) {
    // A line longer than any event: drop it up to its end.
    if (!m_skippingLongLine)
      Log(LOG_ERR, "queue of %s: line over %zu bytes skipped", m_config.name.c_str(), kMaxQueueLine);
    m_skippingLongLine = true;
    start = block.size();
  }
  m_queueOffset += start;
  if (static_cast<std::size_t>(n) < kQueueReadBlock && start < block.size()) {
    // A last line without its newline: writers write whole lines under the lock, so this
    // is a torn line from a writer that failed; it is checked once the queue is finished.
    m_queueAtEnd = true;
  }
  if (static_cast<std::size_t>(n) < kQueueReadBlock && start == block.size()) m_queueAtEnd = true;
}

void ShareIndexer::QueueLine(const char* line, std::size_t size) {
  fileindex_queue::QueueEvent event;
  if (!fileindex_queue::ParseQueueLine(line, size, event)) {
    Log(LOG_ERR, "queue of %s: malformed line skipped: %.*s", m_config.name.c_str(),
        static_cast<int>(size > 200 ? 200 : size), line);
    return;
  }
  std::string path;
  if (!RelativeToShare(m_config.directory, event.path, path)) {
    Log(LOG_ERR, "queue of %s: event outside the share skipped: %s", m_config.name.c_str(),
        event.path.c_str());
    return;
  }
  switch (event.code) {
    case fileindex_queue::kReindex:
      CrawlFolder(path, true);
      break;
    case fileindex_queue::kSettingsChanged:
      // The folder list is read again when folder.conf changes; crawl in case this event
      // came without such a change reaching us (the folder's settings are compared there).
      if (m_config.flags.count(path)) {
        Configure(m_config);
      } else {
        AddPathTask(path);
      }
      break;
    case fileindex_queue::kRenamed: {
      std::string old;
      if (RelativeToShare(m_config.directory, event.pathOld, old)) AddPathTask(old);
      AddPathTask(path);
      break;
    }
    default:
      AddPathTask(path);
  }
}

void ShareIndexer::FinishQueueIfDone() {
  if (!m_haveQueue || !m_queueAtEnd || !m_tasks.empty()) return;
  switch (fileindex_queue::FinishQueue(m_config.queuePath, m_queueOffset)) {
    case fileindex_queue::FinishResult::kRemoved:
      ::close(m_queueFd);
      m_queueFd = -1;
      m_haveQueue = false;
      PollQueue();  // writers may have started a new queue meanwhile
      break;
    case fileindex_queue::FinishResult::kMore: {
      struct stat st;
      // Whatever follows the last whole line is a torn line left by a failed writer.
      std::uint64_t before = m_queueOffset;
      m_queueAtEnd = false;
      ReadQueue();
      if (m_queueOffset == before && ::fstat(m_queueFd, &st) == 0) {
        Log(LOG_ERR, "queue of %s: torn last line skipped", m_config.name.c_str());
        m_queueOffset = static_cast<std::uint64_t>(st.st_size);
      }
      break;
    }
    case fileindex_queue::FinishResult::kBusy:
      break;
    case fileindex_queue::FinishResult::kFailed:
      Log(LOG_ERR, "cannot finish queue %s: %s", m_config.queuePath.c_str(), std::strerror(errno));
      break;
  }
}

ShareIndexer::SliceResult ShareIndexer::RunSlice(Clock::time_point deadline) {
  if (m_tasks.size() < kTaskLowWater) ReadQueue();
  if (m_tasks.empty()) {
    FinishQueueIfDone();
    return HasWork() ? SliceResult::kMore : SliceResult::kIdle;
  }
  if (!m_store->Begin()) {
    m_error = m_store->LastError();
    return SliceResult::kStoreFailed;
  }
  std::vector<Task> done;
  std::size_t count = 0;
  while (!m_tasks.empty()) {
    Task task = std::move(m_tasks.front());
    m_tasks.pop_front();
    done.push_back(task);
    if (!RunTask(task)) {
      m_error = m_store->LastError();
      m_store->Rollback();
      // Nothing of this slice was kept: put its work back, to be done again.
      for (auto it = done.rbegin(); it != done.rend(); ++it) m_tasks.push_front(*it);
      return SliceResult::kStoreFailed;
    }
    if ((++count & 63) == 0) {
      if (Clock::now() >= deadline) break;
      if (m_tasks.size() < kTaskLowWater) ReadQueue();
    }
  }
  if (!m_store->Commit()) {
    m_error = m_store->LastError();
    m_store->Rollback();
    for (auto it = done.rbegin(); it != done.rend(); ++it) m_tasks.push_front(*it);
    return SliceResult::kStoreFailed;
  }
  FinishQueueIfDone();
  return HasWork() ? SliceResult::kMore : SliceResult::kIdle;
}

}  // namespace fileindexd
