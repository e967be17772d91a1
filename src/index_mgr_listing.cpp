// The index manager's paged folder listing.
#include <fileindex/folders.h>
#include <fileindex/index_mgr.h>

namespace TAVO {
namespace FILEINDEX {

bool IndexMgr::List(Json::Value& result, unsigned long offset, unsigned long limit,
                    const std::string& sort_by, const std::string& sort_direction,
                    const Json::Value& additional) {
  // A pure reader: folder.conf is read as it is, without the lock.
  Folders config;
  if (!config.Load()) return false;
  return config.List(result, offset, limit, sort_by, sort_direction, additional);
}

}  // namespace FILEINDEX
}  // namespace TAVO
