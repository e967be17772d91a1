#include <cstdlib>

#include "host_common.h"

namespace tavo_host {

std::string Rooted(const std::string& path) {
  const char* root = ::secure_getenv("FILEINDEX_SYSROOT");
  if (root == nullptr || *root == '\0') return path;
  return std::string(root) + path;
}

}  // namespace tavo_host
