#include "watch_lists.h"

#include <dirent.h>
#include <fcntl.h>
#include <json/json.h>
#include <sys/inotify.h>
#include <sys/stat.h>
#include <syslog.h>
#include <unistd.h>

#include <cerrno>
#include <cstring>
#include <memory>
#include <utility>

#include "daemon_support.h"

namespace tavotifyd {

using fileindex_daemon::Log;

namespace {

// The list tree is a few levels of queue path; a deeper one is a loop or a mistake.
const int kMaxListDepth = 32;
const std::size_t kMaxListBytes = 4 * 1024 * 1024;

std::string WithoutTrailingSlashes(std::string path) {
  while (path.size() > 1 && path.back() == '/') path.pop_back();
  return path;
}

bool ReadSmallFile(const std::string& path, std::string& text) {
  int fd = ::open(path.c_str(), O_RDONLY | O_CLOEXEC | O_NOFOLLOW);
  if (fd < 0) return false;
  text.clear();
  char buffer[8192];
  for (;;) {
    ssize_t n = ::read(fd, buffer, sizeof(buffer));
    if (n < 0 && errno == EINTR) continue;
    if (n <= 0 || text.size() + static_cast<std::size_t>(n) > kMaxListBytes) {
      ::close(fd);
      return n == 0;
    }
    text.append(buffer, static_cast<std::size_t>(n));
  }
}

bool EndsWith(const std::string& text, const char* suffix) {
  std::size_t length = std::strlen(suffix);
  return text.size() >= length && text.compare(text.size() - length, length, suffix) == 0;
}

}  // namespace

bool ParseWatchList(const std::string& text, WatchList& list, std::string& error, std::string& skipped) {
  Json::CharReaderBuilder builder;
  builder["collectComments"] = false;
  std::unique_ptr<Json::CharReader> reader(builder.newCharReader());
  Json::Value document;
  list = WatchList();
  skipped.clear();
  try {
    if (!reader->parse(text.data(), text.data() + text.size(), &document, &error)) return false;
    if (!document.isObject() || !document["queue"].isString() || !document["config"].isArray()) {
      error = "not an object with a string \"queue\" and an array \"config\"";
      return false;
    }
    list.queue = document["queue"].asString();
    if (list.queue.empty() || list.queue[0] != '/') {
      error = "\"queue\" is not an absolute path";
      return false;
    }
    for (const Json::Value& entry : document["config"]) {
      WatchedFolder folder;
      bool usable = entry.isObject() && entry["path"].isString() && entry["mask"].isIntegral() &&
                    (!entry.isMember("ignore") || entry["ignore"].isArray());
      if (usable) {
        folder.path = WithoutTrailingSlashes(entry["path"].asString());
        folder.mask = static_cast<std::uint32_t>(entry["mask"].asLargestUInt());
        usable = !folder.path.empty() && folder.path[0] == '/';
        for (const Json::Value& name : entry["ignore"]) {
          if (name.isString()) folder.ignore.insert(name.asString());
        }
      }
      if (usable) {
        list.folders.push_back(std::move(folder));
      } else {
        Json::StreamWriterBuilder writer;
        writer["indentation"] = "";
        skipped += (skipped.empty() ? "" : ", ") + Json::writeString(writer, entry);
      }
    }
    return true;
  } catch (const Json::Exception& e) {
    error = e.what();
    return false;
  }
}

WatchListDirectory::WatchListDirectory(std::string top) : m_top(WithoutTrailingSlashes(std::move(top))) {}

WatchListDirectory::~WatchListDirectory() {
  if (m_inotify >= 0) ::close(m_inotify);
}

bool WatchListDirectory::Open() {
  m_inotify = ::inotify_init1(IN_NONBLOCK | IN_CLOEXEC);
  return m_inotify >= 0;
}

bool WatchListDirectory::DrainEvents() {
  alignas(inotify_event) char buffer[16384];
  bool any = false;
  for (;;) {
    ssize_t n = ::read(m_inotify, buffer, sizeof(buffer));
    if (n <= 0) return any;
    any = true;
  }
}

void WatchListDirectory::Walk(const std::string& dir, int depth, std::map<std::string, FileIdentity>& found) {
  if (depth > kMaxListDepth) return;
  // Adding a watch that exists is a cheap no-op, and re-adding on every scan catches
  // directories created between a notification and this walk.
  ::inotify_add_watch(
      m_inotify, dir.c_str(),
      IN_CREATE | IN_DELETE | IN_MOVED_FROM | IN_MOVED_TO | IN_CLOSE_WRITE | IN_ONLYDIR | IN_DONT_FOLLOW);
  int fd = ::open(dir.c_str(), O_RDONLY | O_DIRECTORY | O_NOFOLLOW | O_CLOEXEC);
  if (fd < 0) return;
  DIR* stream = ::fdopendir(fd);
  if (stream == nullptr) {
    ::close(fd);
    return;
  }
  std::vector<std::string> subdirectories;
  while (dirent* entry = ::readdir(stream)) {
    std::string name = entry->d_name;
    if (name == "." || name == "..") continue;
    struct stat st;
    if (::fstatat(fd, entry->d_name, &st, AT_SYMLINK_NOFOLLOW) != 0) continue;
    std::string path = dir + "/" + name;
    if (S_ISDIR(st.st_mode)) {
      subdirectories.push_back(path);
    } else if (S_ISREG(st.st_mode) && EndsWith(name, ".json")) {
      found[path] = {st.st_dev, st.st_ino, st.st_size,
                     static_cast<std::int64_t>(st.st_mtim.tv_sec) * 1000000000 + st.st_mtim.tv_nsec};
    }
  }
  ::closedir(stream);
  for (const std::string& sub : subdirectories) Walk(sub, depth + 1, found);
}

void WatchListDirectory::WatchNearestAncestor() {
  struct stat st;
  bool topExists = ::lstat(m_top.c_str(), &st) == 0;
  if (m_ancestorWatch >= 0 && (topExists || m_ancestor != ExistingAncestor())) {
    ::inotify_rm_watch(m_inotify, m_ancestorWatch);
    m_ancestorWatch = -1;
  }
  if (topExists || m_ancestorWatch >= 0) return;
  // Until the tree exists, its creation (by the first list written) is noticed here rather
  // than by the next periodic scan.
  m_ancestor = ExistingAncestor();
  m_ancestorWatch = ::inotify_add_watch(m_inotify, m_ancestor.c_str(), IN_CREATE | IN_MOVED_TO | IN_ONLYDIR);
}

std::string WatchListDirectory::ExistingAncestor() const {
  std::string dir = m_top;
  struct stat st;
  do {
    std::size_t slash = dir.rfind('/');
    dir = slash == 0 || slash == std::string::npos ? "/" : dir.substr(0, slash);
  } while (dir != "/" && ::lstat(dir.c_str(), &st) != 0);
  return dir;
}

bool WatchListDirectory::Rescan() {
  WatchNearestAncestor();
  std::map<std::string, FileIdentity> found;
  Walk(m_top, 0, found);
  bool changed = false;
  for (auto it = m_files.begin(); it != m_files.end();) {
    if (found.count(it->first)) {
      ++it;
      continue;
    }
    if (it->second.valid) Log(LOG_INFO, "watch list %s removed", it->first.c_str());
    changed = changed || it->second.valid;
    m_lists.erase(it->first);
    it = m_files.erase(it);
  }
  for (const auto& [path, identity] : found) {
    KnownFile& known = m_files[path];
    if (known.read && known.identity == identity) continue;
    std::string text;
    if (!ReadSmallFile(path, text)) continue;  // replaced meanwhile: the next scan reads it
    bool unchanged = known.read && text == known.text;
    known.identity = identity;
    known.read = true;
    if (unchanged) continue;
    known.text = text;
    WatchList list;
    std::string error, skipped;
    bool wasValid = known.valid;
    known.valid = ParseWatchList(text, list, error, skipped);
    if (!known.valid) {
      Log(LOG_ERR, "watch list %s ignored: %s", path.c_str(), error.c_str());
      m_lists.erase(path);
      changed = changed || wasValid;
      continue;
    }
    if (!skipped.empty())
      Log(LOG_ERR, "watch list %s: malformed entries skipped: %s", path.c_str(), skipped.c_str());
    Log(LOG_INFO, "watch list %s %s: queue %s, %zu folders", path.c_str(), wasValid ? "changed" : "added",
        list.queue.c_str(), list.folders.size());
    m_lists[path] = std::move(list);
    changed = true;
  }
  return changed;
}

}  // namespace tavotifyd
