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

}  // namespace internal
}  // namespace FILEINDEX
}  // namespace TAVO

#endif
