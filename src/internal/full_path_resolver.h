// Share path to full path for many paths at once, looking each share up only once.
#ifndef FILEINDEX_INTERNAL_FULL_PATH_RESOLVER_H
#define FILEINDEX_INTERNAL_FULL_PATH_RESOLVER_H

#include <string>
#include <unordered_map>

namespace TAVO {
namespace FILEINDEX {
namespace internal {

// Gives the same results, log lines and error codes as GetFullPath for every path, but
// remembers each share's volume part (or that the share is unknown) for its own
// lifetime. Meant to live for one load of folder.conf: shares may change between calls.
class FullPathResolver {
 public:
  bool Resolve(std::string& full, const std::string& path);

 private:
  struct Volume {
    bool known;
    std::string prefix;
  };
  std::unordered_map<std::string, Volume> volumes_;
};

// A folder's full path found again when none was stored (its share was unknown when the
// folder was loaded), so that a share that has come back is found; empty, with a log
// line, when it still is not.
std::string RetryFullPath(const std::string& path);

}  // namespace internal
}  // namespace FILEINDEX
}  // namespace TAVO

#endif
