#include "tree_watcher.h"

#include <dirent.h>
#include <fcntl.h>
#include <sys/stat.h>
#include <syslog.h>
#include <unistd.h>

#include <algorithm>
#include <cerrno>
#include <cstring>
#include <iterator>

#include "queue_events.h"

namespace tavotifyd {

using fileindex_daemon::Clock;
using fileindex_daemon::Log;
namespace queue = fileindex_queue;

namespace {

// What following a tree needs whatever a list asks for: new and moved-in directories get
// watches, and a folder's root going away is noticed. Symbolic links are never followed,
// and events of files already unlinked (still open elsewhere) are of no use.
const std::uint32_t kRecursionMask = IN_CREATE | IN_MOVED_FROM | IN_MOVED_TO | IN_DELETE_SELF | IN_MOVE_SELF |
                                     IN_ONLYDIR | IN_DONT_FOLLOW | IN_EXCL_UNLINK;
// A folder whose tree stays partly unwatched is retried with growing pauses: each retry
// ends in a reindex, and a crawl of a big share is not free.
const std::chrono::seconds kFirstRetry(30);
const std::chrono::seconds kLongestRetry(600);

std::string Join(const std::string& dir, const std::string& name) {
  return dir == "/" ? "/" + name : dir + "/" + name;
}

std::string ParentOf(const std::string& path) {
  std::size_t slash = path.rfind('/');
  return slash == 0 ? "/" : path.substr(0, slash);
}

std::string BaseName(const std::string& path) { return path.substr(path.rfind('/') + 1); }

template <typename T>
std::vector<T> Difference(const std::vector<T>& a, const std::vector<T>& b) {
  std::vector<T> out;
  std::set_difference(a.begin(), a.end(), b.begin(), b.end(), std::back_inserter(out));
  return out;
}

template <typename T>
std::vector<T> Union(const std::vector<T>& a, const std::vector<T>& b) {
  std::vector<T> out;
  std::set_union(a.begin(), a.end(), b.begin(), b.end(), std::back_inserter(out));
  return out;
}

template <typename T>
bool Intersects(const std::vector<T>& a, const std::vector<T>& b) {
  for (const T& item : a) {
    if (std::binary_search(b.begin(), b.end(), item)) return true;
  }
  return false;
}

void AddOnce(std::vector<std::string>& queues, const std::string& queue) {
  if (std::find(queues.begin(), queues.end(), queue) == queues.end()) queues.push_back(queue);
}

}  // namespace

constexpr std::chrono::milliseconds TreeWatcher::kMovePartnerWait;

TreeWatcher::TreeWatcher(QueueWriter& writer) : m_writer(writer) {}

TreeWatcher::~TreeWatcher() {
  if (m_inotify >= 0) ::close(m_inotify);
}

bool TreeWatcher::Open() {
  m_inotify = ::inotify_init1(IN_NONBLOCK | IN_CLOEXEC);
  return m_inotify >= 0;
}

std::uint32_t TreeWatcher::MaskFor(const Owners& owners) const {
  std::uint32_t mask = kRecursionMask;
  for (FolderId id : owners) {
    auto it = m_folders.find(id);
    // Bits outside IN_ALL_EVENTS (IN_IGNORED, IN_Q_OVERFLOW, ...) are reported anyway.
    if (it != m_folders.end()) mask |= it->second.config.mask & IN_ALL_EVENTS;
  }
  return mask;
}

TreeWatcher::Owners TreeWatcher::Visible(const Directory& dir, const std::string& name) const {
  Owners visible;
  for (FolderId id : dir.owners) {
    auto it = m_folders.find(id);
    if (it != m_folders.end() && !it->second.config.ignore.count(name)) visible.push_back(id);
  }
  return visible;
}

void TreeWatcher::Report(const Owners& owners, std::uint32_t wanted, std::uint32_t code,
                         const std::string& path) {
  std::string line;
  std::vector<std::string> written;
  for (FolderId id : owners) {
    auto it = m_folders.find(id);
    if (it == m_folders.end() || !(it->second.config.mask & wanted)) continue;
    const std::string& queue = it->second.queue;
    if (std::find(written.begin(), written.end(), queue) != written.end()) continue;
    if (line.empty()) line = queue::FormatQueueLine(code, path);
    m_writer.Add(queue, line);
    written.push_back(queue);
  }
}

void TreeWatcher::SetPath(int watch, const std::string& path) {
  std::vector<std::pair<int, std::string>> todo{{watch, path}};
  while (!todo.empty()) {
    auto [current, newPath] = todo.back();
    todo.pop_back();
    auto it = m_dirs.find(current);
    if (it == m_dirs.end()) continue;
    Directory& dir = it->second;
    auto indexed = m_dirByPath.find(dir.path);
    if (indexed != m_dirByPath.end() && indexed->second == current) m_dirByPath.erase(indexed);
    dir.path = newPath;
    m_dirByPath[newPath] = current;
    for (const auto& [name, child] : dir.children) todo.emplace_back(child, Join(newPath, name));
  }
}

void TreeWatcher::Relink(int watch, int parent, const std::string& name) {
  Directory& dir = m_dirs.at(watch);
  auto old = m_dirs.find(dir.parent);
  if (old != m_dirs.end()) {
    auto child = old->second.children.find(dir.name);
    if (child != old->second.children.end() && child->second == watch) old->second.children.erase(child);
  }
  dir.name = name;
  auto next = m_dirs.find(parent);
  dir.parent = next != m_dirs.end() ? parent : -1;
  if (next != m_dirs.end()) next->second.children[name] = watch;
}

void TreeWatcher::ForgetDirectory(int watch) {
  auto it = m_dirs.find(watch);
  if (it == m_dirs.end()) return;
  Relink(watch, -1, it->second.name);
  for (const auto& entry : it->second.children) {
    auto child = m_dirs.find(entry.second);
    if (child != m_dirs.end()) child->second.parent = -1;
  }
  for (FolderId id : it->second.rootOf) {
    auto folder = m_folders.find(id);
    if (folder != m_folders.end() && folder->second.rootWatch == watch) folder->second.rootWatch = -1;
  }
  auto indexed = m_dirByPath.find(it->second.path);
  if (indexed != m_dirByPath.end() && indexed->second == watch) m_dirByPath.erase(indexed);
  m_dirs.erase(it);
}

void TreeWatcher::UpdateMask(Directory& dir) {
  std::uint32_t mask = MaskFor(dir.owners);
  if (mask == dir.mask) return;
  // Without IN_MASK_ADD the mask is replaced: narrower once a folder asking for more left.
  int watch = ::inotify_add_watch(m_inotify, dir.path.c_str(), mask);
  if (watch >= 0 && !m_dirs.count(watch))
    ::inotify_rm_watch(m_inotify, watch);  // the path names another directory now
  dir.mask = mask;
}

void TreeWatcher::DropOwners(int watch, const Owners& owners, bool subtree) {
  std::vector<int> todo{watch};
  while (!todo.empty()) {
    int current = todo.back();
    todo.pop_back();
    auto it = m_dirs.find(current);
    if (it == m_dirs.end()) continue;
    Directory& dir = it->second;
    // Owners are inherited: a directory without them has no descendant with them.
    if (!Intersects(dir.owners, owners)) continue;
    if (subtree) {
      for (const auto& entry : dir.children) todo.push_back(entry.second);
    }
    for (FolderId id : dir.rootOf) {
      auto folder = m_folders.find(id);
      if (std::binary_search(owners.begin(), owners.end(), id) && folder != m_folders.end())
        folder->second.rootWatch = -1;
    }
    dir.owners = Difference(dir.owners, owners);
    dir.rootOf = Difference(dir.rootOf, owners);
    if (dir.owners.empty()) {
      ::inotify_rm_watch(m_inotify, current);
      ForgetDirectory(current);
    } else {
      UpdateMask(dir);
    }
  }
}

void TreeWatcher::WatchFailed(const Owners& owners, const std::string& path, int error) {
  for (FolderId id : owners) {
    Folder& folder = m_folders.at(id);
    if (folder.incomplete) continue;  // said once; the retry says when it is whole again
    if (error == ENOSPC) {
      Log(LOG_ERR,
          "cannot watch %s: the inotify watch limit is reached (raise fs.inotify.max_user_watches); "
          "folder %s is only partly watched and will be reindexed",
          path.c_str(), folder.config.path.c_str());
    } else {
      Log(LOG_ERR, "cannot watch %s: %s; folder %s is only partly watched and will be reindexed",
          path.c_str(), std::strerror(error), folder.config.path.c_str());
    }
    folder.incomplete = true;
    folder.retryDelay = kFirstRetry;
    folder.nextRetry = Clock::now() + folder.retryDelay;
    m_writer.AddReindex(folder.queue, folder.config.path);
  }
}

std::size_t TreeWatcher::Crawl(const std::string& path, int parent, const std::string& name,
                               const Owners& owners, const CrawlMode& mode) {
  struct Item {
    std::string path;
    int parent;
    std::string name;
    Owners owners;
    bool isRoot;
  };
  std::vector<Item> todo{{path, parent, name, owners, mode.rootOf != 0}};
  std::size_t failures = 0;
  while (!todo.empty()) {
    Item item = std::move(todo.back());
    todo.pop_back();
    if (item.owners.empty()) continue;
    std::uint32_t mask = MaskFor(item.owners);
    int watch = ::inotify_add_watch(m_inotify, item.path.c_str(), mask | IN_MASK_ADD);
    if (watch < 0) {
      // Gone or replaced since it was listed: the parent's events say what happened.
      if (errno == ENOENT || errno == ENOTDIR) continue;
      ++failures;
      WatchFailed(item.owners, item.path, errno);
      continue;
    }
    auto [it, added] = m_dirs.try_emplace(watch);
    if (added) {
      it->second.path = item.path;
      m_dirByPath[item.path] = watch;
      Relink(watch, item.parent, item.name);
    } else if (it->second.path != item.path || (it->second.parent < 0 && item.parent >= 0)) {
      // Reached by another path than recorded: a move whose events were lost.
      Relink(watch, item.parent, item.name);
      SetPath(watch, item.path);
    }
    Directory& dir = it->second;
    dir.mask |= mask;
    Owners fresh = Difference(item.owners, dir.owners);
    dir.owners = Union(dir.owners, fresh);
    if (item.isRoot) {
      dir.rootOf = Union(dir.rootOf, Owners{mode.rootOf});
      m_folders.at(mode.rootOf).rootWatch = watch;
    }
    if (fresh.empty() && !mode.descendKnown) continue;
    const Owners walking = mode.descendKnown ? item.owners : fresh;
    const std::string dirPath = dir.path;
    int fd = ::open(dirPath.c_str(), O_RDONLY | O_DIRECTORY | O_NOFOLLOW | O_CLOEXEC);
    DIR* stream = fd >= 0 ? ::fdopendir(fd) : nullptr;
    if (stream == nullptr) {
      int error = errno;
      if (fd >= 0) ::close(fd);
      if (error != ENOENT && error != ENOTDIR) {
        ++failures;
        WatchFailed(walking, dirPath, error);
      }
      continue;
    }
    while (dirent* entry = ::readdir(stream)) {
      const std::string entryName = entry->d_name;
      if (entryName == "." || entryName == "..") continue;
      const std::string entryPath = Join(dirPath, entryName);
      if (m_queueFiles.count(entryPath)) continue;
      Owners entryOwners;
      for (FolderId id : walking) {
        if (!m_folders.at(id).config.ignore.count(entryName)) entryOwners.push_back(id);
      }
      if (entryOwners.empty()) continue;
      if (mode.reportContents) Report(entryOwners, IN_CREATE, queue::kCreated, entryPath);
      bool isDirectory = entry->d_type == DT_DIR;
      if (entry->d_type == DT_UNKNOWN) {
        struct stat st;
        isDirectory = ::fstatat(fd, entry->d_name, &st, AT_SYMLINK_NOFOLLOW) == 0 && S_ISDIR(st.st_mode);
      }
      if (isDirectory) todo.push_back({entryPath, watch, entryName, std::move(entryOwners), false});
    }
    ::closedir(stream);
  }
  return failures;
}

bool TreeWatcher::AttachRoot(FolderId id) {
  Folder& folder = m_folders.at(id);
  const std::string path = folder.config.path;
  struct stat st;
  if (::lstat(path.c_str(), &st) != 0 || !S_ISDIR(st.st_mode)) {
    if (!folder.missingLogged)
      Log(LOG_WARNING, "folder %s %s; it is watched once it is a directory", path.c_str(),
          errno == ENOENT ? "does not exist" : "is not a directory");
    folder.missingLogged = true;
    return false;
  }
  folder.missingLogged = false;
  bool wasIncomplete = folder.incomplete;
  auto parent = m_dirByPath.find(ParentOf(path));
  CrawlMode mode;
  mode.rootOf = id;
  std::size_t failures =
      Crawl(path, parent != m_dirByPath.end() ? parent->second : -1, BaseName(path), {id}, mode);
  if (folder.rootWatch < 0) return false;
  if (folder.lost || (wasIncomplete && failures == 0)) {
    // Whatever happened there while it was not watched is unknown.
    Log(LOG_INFO, "folder %s is watched again; reindexing it", path.c_str());
    m_writer.AddReindex(folder.queue, path);
    folder.lost = false;
    if (failures == 0) folder.incomplete = false;
  }
  return true;
}

void TreeWatcher::SetLists(const std::map<std::string, WatchList>& lists) {
  std::set<FolderKey> wanted;
  m_queueFiles.clear();
  for (const auto& [file, list] : lists) {
    m_queueFiles.insert(list.queue);
    m_queueFiles.insert(queue::TmpCompanion(list.queue));
    for (const WatchedFolder& folder : list.folders)
      wanted.insert(FolderKey{file, list.queue, folder.path, folder.mask, folder.ignore});
  }
  Owners gone;
  for (const auto& [key, id] : m_folderByKey) {
    if (!wanted.count(key)) gone.push_back(id);
  }
  std::sort(gone.begin(), gone.end());
  if (!gone.empty()) {
    std::vector<int> owned;
    for (const auto& [watch, dir] : m_dirs) {
      if (Intersects(dir.owners, gone)) owned.push_back(watch);
    }
    for (int watch : owned) DropOwners(watch, gone, false);
    for (FolderId id : gone) {
      const Folder& folder = m_folders.at(id);
      Log(LOG_INFO, "folder %s no longer watched for queue %s", folder.config.path.c_str(),
          folder.queue.c_str());
      m_folderByKey.erase(FolderKey{folder.listFile, folder.queue, folder.config.path, folder.config.mask,
                                    folder.config.ignore});
      m_folders.erase(id);
    }
  }
  for (const FolderKey& key : wanted) {
    if (m_folderByKey.count(key)) continue;
    FolderId id = m_nextFolder++;
    Folder& folder = m_folders[id];
    folder.listFile = std::get<0>(key);
    folder.queue = std::get<1>(key);
    folder.config.path = std::get<2>(key);
    folder.config.mask = std::get<3>(key);
    folder.config.ignore = std::get<4>(key);
    m_folderByKey[key] = id;
    if (AttachRoot(id))
      Log(LOG_INFO, "watching folder %s for queue %s (%zu directories watched in all)",
          folder.config.path.c_str(), folder.queue.c_str(), m_dirs.size());
  }
}

void TreeWatcher::ReadEvents() {
  alignas(inotify_event) char buffer[64 * 1024];
  // Bounded, so that a flood of events does not keep the loop from its timers.
  for (int reads = 0; reads < 16; ++reads) {
    ssize_t n = ::read(m_inotify, buffer, sizeof(buffer));
    if (n < 0 && errno == EINTR) continue;
    if (n <= 0) return;
    for (char* at = buffer; at < buffer + n;) {
      const inotify_event* event = reinterpret_cast<const inotify_event*>(at);
      Handle(*event);
      at += sizeof(inotify_event) + event->len;
    }
  }
}

void TreeWatcher::Handle(const inotify_event& event) {
  if (event.mask & IN_Q_OVERFLOW) {
    Overflowed();
    return;
  }
  auto it = m_dirs.find(event.wd);
  if (it == m_dirs.end()) return;  // a watch already dropped
  if (event.mask & IN_IGNORED) {
    for (FolderId id : it->second.rootOf) m_folders.at(id).lost = true;
    ForgetDirectory(event.wd);
    return;
  }
  if (event.len == 0 || event.name[0] == '\0') {
    HandleSelf(event.wd, event.mask);
    return;
  }
  const std::string name = event.name;
  const std::string path = Join(it->second.path, name);
  const bool isDirectory = event.mask & IN_ISDIR;
  const Owners owners = m_queueFiles.count(path) ? Owners{} : Visible(it->second, name);
  if (event.mask & IN_MOVED_TO) {
    auto from = std::find_if(m_movedFrom.begin(), m_movedFrom.end(),
                             [&](const MovedFrom& moved) { return moved.cookie == event.cookie; });
    if (from != m_movedFrom.end()) {
      MovedFrom paired = std::move(*from);
      m_movedFrom.erase(from);
      Moved(paired, event.wd, name);
      return;
    }
  }
  if (event.mask & IN_MOVED_FROM) {
    m_movedFrom.push_back(
        {event.cookie, event.wd, name, path, isDirectory, owners, Clock::now() + kMovePartnerWait});
    return;
  }
  if (owners.empty()) return;
  CrawlMode reportingCrawl;
  reportingCrawl.reportContents = true;
  if (event.mask & (IN_CREATE | IN_MOVED_TO)) {
    // Moved in from outside the watched trees: new here.
    Report(owners, event.mask & (IN_CREATE | IN_MOVED_TO), queue::kCreated, path);
    // Entries made before the new directory's watch existed are found by listing it.
    if (isDirectory) Crawl(path, event.wd, name, owners, reportingCrawl);
  }
  // IN_MODIFY comes with every write(); the close that ends the writing is worth one line
  // for all of them, and the consumer reads the file's state then anyway.
  if (event.mask & IN_CLOSE_WRITE) Report(owners, IN_CLOSE_WRITE, queue::kModified, path);
  if (event.mask & IN_ATTRIB) Report(owners, IN_ATTRIB, queue::kAttributes, path);
  if (event.mask & IN_DELETE) Report(owners, IN_DELETE, queue::kDeleted, path);
}

void TreeWatcher::HandleSelf(int watch, std::uint32_t mask) {
  Directory& dir = m_dirs.at(watch);
  if (mask & IN_UNMOUNT) Log(LOG_WARNING, "the file system of %s was unmounted", dir.path.c_str());
  // Events of other directories are reported by their parent's watch, with their name.
  if (dir.rootOf.empty()) return;
  const Owners roots = dir.rootOf;
  if (mask & IN_ATTRIB) Report(roots, IN_ATTRIB, queue::kAttributes, dir.path);
  if (mask & IN_DELETE_SELF) {
    Log(LOG_WARNING, "folder %s was removed; it is watched again once it is back", dir.path.c_str());
    Report(roots, IN_DELETE_SELF | IN_DELETE, queue::kDeleted, dir.path);
  }
  if (mask & IN_MOVE_SELF) {
    // The folder's path no longer names this directory: stop following it; a directory
    // that appears at the path later is watched (and reindexed) then.
    for (FolderId id : roots) {
      Folder& folder = m_folders.at(id);
      Report({id}, IN_MOVE_SELF | IN_DELETE_SELF, queue::kDeleted, folder.config.path);
      folder.lost = true;
      Log(LOG_WARNING, "folder %s was moved away", folder.config.path.c_str());
    }
    DropOwners(watch, roots, true);
  }
}

void TreeWatcher::Moved(const MovedFrom& from, int toWatch, const std::string& toName) {
  const Directory& to = m_dirs.at(toWatch);
  const std::string newPath = Join(to.path, toName);
  const Owners arrivingOwners = m_queueFiles.count(newPath) ? Owners{} : Visible(to, toName);
  std::vector<std::string> leftQueues, reachedQueues;
  for (FolderId id : from.owners) {
    auto it = m_folders.find(id);
    if (it != m_folders.end() && (it->second.config.mask & IN_MOVED_FROM))
      AddOnce(leftQueues, it->second.queue);
  }
  for (FolderId id : arrivingOwners) {
    const Folder& folder = m_folders.at(id);
    if (folder.config.mask & IN_MOVED_TO) AddOnce(reachedQueues, folder.queue);
  }
  // A queue that sees both ends sees a rename; one that sees one end, a deletion or a creation.
  for (const std::string& queue : leftQueues) {
    bool both = std::find(reachedQueues.begin(), reachedQueues.end(), queue) != reachedQueues.end();
    m_writer.Add(queue, both ? queue::FormatQueueLine(queue::kRenamed, newPath, from.path)
                             : queue::FormatQueueLine(queue::kDeleted, from.path));
  }
  for (const std::string& queue : reachedQueues) {
    if (std::find(leftQueues.begin(), leftQueues.end(), queue) == leftQueues.end())
      m_writer.Add(queue, queue::FormatQueueLine(queue::kCreated, newPath));
  }
  if (!from.isDirectory) return;
  CrawlMode reportingCrawl;
  reportingCrawl.reportContents = true;
  int moved = -1;
  auto source = m_dirs.find(from.watch);
  if (source != m_dirs.end()) {
    auto child = source->second.children.find(from.name);
    if (child != source->second.children.end()) moved = child->second;
  }
  if (moved < 0) {
    // Not watched before (its name was ignored there): new to the folders that see it now.
    if (!arrivingOwners.empty()) Crawl(newPath, toWatch, toName, arrivingOwners, reportingCrawl);
    return;
  }
  Relink(moved, toWatch, toName);
  SetPath(moved, newPath);
  const Directory& dir = m_dirs.at(moved);
  Owners leaving = Difference(Difference(dir.owners, arrivingOwners), dir.rootOf);
  Owners joining = Difference(arrivingOwners, dir.owners);
  if (!leaving.empty()) DropOwners(moved, leaving, true);
  if (!joining.empty()) Crawl(newPath, toWatch, toName, joining, reportingCrawl);
}

void TreeWatcher::MovedOut(const MovedFrom& from) {
  Report(from.owners, IN_MOVED_FROM, queue::kDeleted, from.path);
  if (!from.isDirectory) return;
  auto source = m_dirs.find(from.watch);
  if (source == m_dirs.end()) return;
  auto child = source->second.children.find(from.name);
  if (child == source->second.children.end()) return;
  int moved = child->second;
  const Directory& dir = m_dirs.at(moved);
  DropOwners(moved, Difference(dir.owners, dir.rootOf), true);
  // Still the root of a folder: its own IN_MOVE_SELF deals with that; its old place is not its parent.
  if (m_dirs.count(moved)) Relink(moved, -1, from.name);
}

void TreeWatcher::ExpireUnpairedMoves(bool all) {
  Clock::time_point now = Clock::now();
  while (!m_movedFrom.empty() && (all || m_movedFrom.front().deadline <= now)) {
    MovedFrom from = std::move(m_movedFrom.front());
    m_movedFrom.pop_front();
    MovedOut(from);
  }
}

void TreeWatcher::Overflowed() {
  Log(LOG_WARNING,
      "inotify events were lost (queue overflow; see fs.inotify.max_queued_events); reindexing all %zu "
      "folders",
      m_folders.size());
  for (const auto& [id, folder] : m_folders) m_writer.AddReindex(folder.queue, folder.config.path);
  // Directories created meanwhile have no watch yet.
  CrawlMode recrawl;
  recrawl.descendKnown = true;
  for (const auto& [id, folder] : m_folders) {
    if (folder.rootWatch < 0) continue;
    auto parent = m_dirByPath.find(ParentOf(folder.config.path));
    Crawl(folder.config.path, parent != m_dirByPath.end() ? parent->second : -1, BaseName(folder.config.path),
          {id}, recrawl);
  }
}

void TreeWatcher::RetryIncomplete() {
  Clock::time_point now = Clock::now();
  std::vector<FolderId> ids;
  for (const auto& entry : m_folders) ids.push_back(entry.first);
  CrawlMode recrawl;
  recrawl.descendKnown = true;
  for (FolderId id : ids) {
    Folder& folder = m_folders.at(id);
    if (folder.rootWatch < 0) {
      AttachRoot(id);
      continue;
    }
    if (!folder.incomplete || now < folder.nextRetry) continue;
    auto parent = m_dirByPath.find(ParentOf(folder.config.path));
    std::size_t failures = Crawl(folder.config.path, parent != m_dirByPath.end() ? parent->second : -1,
                                 BaseName(folder.config.path), {id}, recrawl);
    // Changes in the part that was not watched were missed either way.
    m_writer.AddReindex(folder.queue, folder.config.path);
    if (failures == 0) {
      Log(LOG_INFO, "folder %s is completely watched now; reindexing it", folder.config.path.c_str());
      folder.incomplete = false;
    } else {
      folder.retryDelay = std::min(folder.retryDelay * 2, kLongestRetry);
      folder.nextRetry = now + folder.retryDelay;
    }
  }
}

std::vector<std::string> TreeWatcher::FoldersOfQueue(const std::string& queue) const {
  std::vector<std::string> folders;
  for (const auto& entry : m_folders) {
    if (entry.second.queue == queue) AddOnce(folders, entry.second.config.path);
  }
  std::sort(folders.begin(), folders.end());
  return folders;
}

}  // namespace tavotifyd
