// The watch lists that the host platform's MonitorQueue writes, one JSON file per queue:
//   <root>/run/tavotifyd/<queue name>/<queue path without the root>.json
//   {"queue": QUEUE PATH, "config": [{"path": FOLDER, "mask": INOTIFY MASK, "ignore": [NAME...]}],
//    "name": QUEUE NAME, "type": 1}
// A list whose "config" is empty watches nothing. Files not ending in ".json" (the writer's
// temporary files among them) are not lists.
#ifndef FILEINDEX_TAVOTIFYD_WATCH_LISTS_H
#define FILEINDEX_TAVOTIFYD_WATCH_LISTS_H

#include <sys/types.h>

#include <cstdint>
#include <map>
#include <set>
#include <string>
#include <vector>

namespace tavotifyd {

struct WatchedFolder {
  std::string path;  // absolute, without a trailing "/"
  std::uint32_t mask = 0;
  std::set<std::string> ignore;  // entry names never watched nor reported, at any depth
};

struct WatchList {
  std::string queue;
  std::vector<WatchedFolder> folders;
};

// Parses one list; false with a reason when the document is not a usable list. Entries
// that are malformed on their own are skipped and named in `skipped`.
bool ParseWatchList(const std::string& text, WatchList& list, std::string& error, std::string& skipped);

// The lists under one directory tree, re-read when they change. The tree is watched with
// inotify (Fd() becomes readable on any change); Rescan() is also cheap enough to run
// periodically, which covers a tree created after start-up.
class WatchListDirectory {
 public:
  explicit WatchListDirectory(std::string top);
  ~WatchListDirectory();
  WatchListDirectory(const WatchListDirectory&) = delete;
  WatchListDirectory& operator=(const WatchListDirectory&) = delete;

  bool Open();
  int Fd() const { return m_inotify; }
  // Consumes pending change notifications; true when there were any.
  bool DrainEvents();
  // Re-reads lists whose file changed; true when the set of lists or any list changed.
  bool Rescan();
  // By list file.
  const std::map<std::string, WatchList>& Lists() const { return m_lists; }

 private:
  struct FileIdentity {
    dev_t device = 0;
    ino_t inode = 0;
    off_t size = 0;
    std::int64_t mtimeNs = 0;
    bool operator==(const FileIdentity& other) const {
      return device == other.device && inode == other.inode && size == other.size && mtimeNs == other.mtimeNs;
    }
  };
  struct KnownFile {
    FileIdentity identity;
    bool read = false;  // identity and text are of a version read once
    bool valid = false;
    std::string text;
  };
  void Walk(const std::string& dir, int depth, std::map<std::string, FileIdentity>& found);
  void WatchNearestAncestor();
  std::string ExistingAncestor() const;

  std::string m_top;
  int m_inotify = -1;
  int m_ancestorWatch = -1;
  std::string m_ancestor;
  std::map<std::string, KnownFile> m_files;
  std::map<std::string, WatchList> m_lists;
};

}  // namespace tavotifyd

#endif
