#include "internal/sysroot.h"

#include <cstdlib>

namespace TAVO {
namespace FILEINDEX {
namespace internal {

std::string SystemPath(const char* fixedPath) {
  const char* root = ::secure_getenv("FILEINDEX_SYSROOT");
  if (root == nullptr || *root == '\0') return fixedPath;
  return std::string(root) + fixedPath;
}

}  // namespace internal
}  // namespace FILEINDEX
}  // namespace TAVO
