// The system root: FILEINDEX_SYSROOT, read as the library reads it, so that the paths
// both build (configuration files, share directories, queues) agree.
#include <cstdlib>

#include "host_common.h"

namespace tavo_host {

std::string SystemRoot() {
  const char* root = ::secure_getenv("FILEINDEX_SYSROOT");
  return root != nullptr ? root : "";
}

std::string Rooted(const std::string& path) { return SystemRoot() + path; }

std::string Unrooted(const std::string& path) {
  const std::string root = SystemRoot();
  if (!root.empty() && path.compare(0, root.size(), root) == 0 &&
      (path.size() == root.size() || path[root.size()] == '/')) {
    return path.size() == root.size() ? "/" : path.substr(root.size());
  }
  return path;
}

}  // namespace tavo_host
