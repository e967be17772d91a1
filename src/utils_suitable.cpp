// The folder whose settings govern a full path.
#include <fileindex/folder.h>
#include <fileindex/utils.h>

namespace TAVO {
namespace FILEINDEX {

Json::Value GetMostSuitableCfg(std::vector<Folder> folders, const std::string& path) {
  const Folder* best = nullptr;
  const std::string query = path + "/";
  for (const Folder& folder : folders) {
    const std::string full = folder.GetFullPath();
    // Position alone decides: a later match replaces an earlier one, even a deeper one.
    if (StringStartWith(query, full + "/") && !full.empty()) best = &folder;
  }
  if (best == nullptr) return Json::Value(Json::objectValue);
  return best->asJson();
}

}  // namespace FILEINDEX
}  // namespace TAVO
