// What every benchmark stands on: a private system root with shares on the fake
// platform, generated folder.conf and queue files, and the naive implementations that
// the library's figures are compared with.
#ifndef FILEINDEX_BENCH_BENCH_ENV_H
#define FILEINDEX_BENCH_BENCH_ENV_H

#include <json/json.h>

#include <cstdint>
#include <string>
#include <vector>

namespace bench {

// A temporary system root, removed with the object. Several may exist; Activate() points
// FILEINDEX_SYSROOT and the fake platform at this one.
class Sysroot {
 public:
  Sysroot();
  ~Sysroot();
  Sysroot(const Sysroot&) = delete;
  Sysroot& operator=(const Sysroot&) = delete;

  void Activate() const;
  // <root>/volume1/<name>, registered with the fake platform (now and on Activate).
  std::string AddShare(const std::string& name);
  // Makes <root>/volume1<path> (a share path such as /photo/2019).
  void MakeFolder(const std::string& path) const;

  const std::string& Root() const { return root_; }
  std::string Full(const std::string& path) const { return root_ + "/volume1" + path; }
  std::string FolderConfPath() const { return root_ + "/usr/tavo/etc/fileindex/folder.conf"; }
  std::string SocketPath() const { return root_ + "/var/run/fileindexd.sock"; }
  // The share's queue file; its directory is created.
  std::string QueuePath(const std::string& share) const;

 private:
  std::string root_;
  std::vector<std::string> shares_;
};

// Deterministic generator (xorshift64*), the same data on every machine.
class Rng {
 public:
  explicit Rng(uint64_t seed) : state_(seed * 2654435761u + 1) {}
  uint64_t Next() {
    state_ ^= state_ >> 12;
    state_ ^= state_ << 25;
    state_ ^= state_ >> 27;
    return state_ * 2685821657736338717ULL;
  }
  unsigned Below(unsigned n) { return static_cast<unsigned>(Next() % n); }

 private:
  uint64_t state_;
};

// A queue as the indexing daemon leaves it while a share is indexed: file events in the
// folder and elsewhere in the share (a sibling whose name extends the folder's among
// them), renames with "path_old" in and out of the folder, settings and reindex events,
// names in plain ASCII, raw UTF-8 and \u escapes. malformedPerMille lines in a thousand
// are broken the ways a queue breaks (cut short, garbage, wrong types, trailing bytes).
struct QueueRecipe {
  std::string shareFull;  // the share's directory
  std::string folder;     // the folder of interest, a directory name in the share
  uint64_t lines = 0;
  unsigned malformedPerMille = 0;
  uint64_t seed = 1;
  // Lines as the JSON library writes them, which is how the notification daemon and the
  // library's own events are written: members in the order of their names, "data" always
  // there. Otherwise "event" comes first, as the queue format is documented.
  bool writerOrder = false;
};

struct QueueStats {
  uint64_t bytes = 0;
  uint64_t lines = 0;
  uint64_t malformed = 0;
};

// Writes the queue (streaming, constant memory) and then appends extraLines as they are.
QueueStats WriteQueue(const std::string& path, const QueueRecipe& recipe, const std::string& extraLines = "");

// One folder.conf record as the library stores it.
Json::Value FolderRecord(const std::string& path, const std::string& name, unsigned flags);

void WriteFile(const std::string& path, const std::string& content);
uint64_t FileSize(const std::string& path);
// Reads the file once so that it is in the page cache.
void WarmPageCache(const std::string& path);

// The obvious implementations: std::getline and a JsonCpp CharReader per line.
// Whether some valid line's "path" (or, for event 256, "path_old") lies in folderFull;
// every invalid line is logged like the library logs it.
bool NaiveIsPathInQueue(const std::string& folderFull, const std::string& queuePath);
// Whether some valid line is event 65536 on exactly full.
bool NaiveQueueHasReindex(const std::string& full, const std::string& queuePath);

}  // namespace bench

#endif
