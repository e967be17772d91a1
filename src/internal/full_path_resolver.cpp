#include "internal/full_path_resolver.h"

#include <fileindex/error.h>
#include <fileindex/utils.h>

namespace TAVO {
namespace FILEINDEX {
namespace internal {

bool FullPathResolver::Resolve(std::string& full, const std::string& path) {
  std::string share;
  // Without a share name there is nothing to remember; GetFullPath logs the failure.
  if (!GetShareNameByPath(share, path)) return GetFullPath(full, path);

  auto it = volumes_.find(share);
  if (it == volumes_.end()) {
    std::string resolved;
    const bool ok = GetFullPath(resolved, path);
    // A full path is the share's volume part followed by the whole share path.
    Volume volume{ok, ok ? resolved.substr(0, resolved.size() - path.size()) : std::string()};
    volumes_.emplace(share, std::move(volume));
    if (ok) full = resolved;
    return ok;
  }
  if (!it->second.known) {
    // What GetFullPath leaves behind for a share the platform does not know.
    ErrorHandler::SetError(FILEINDEX_ERR_BAD_PATH);
    return false;
  }
  full = it->second.prefix + path;
  return true;
}

}  // namespace internal
}  // namespace FILEINDEX
}  // namespace TAVO
