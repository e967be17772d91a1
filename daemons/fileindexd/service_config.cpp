#include "service_config.h"

#include <fileindex/error.h>
#include <fileindex/fileindex_c.h>
#include <fileindex/index_mgr.h>
#include <fileindex/status_mgr.h>
#include <fileindex/utils.h>

#include <ctime>

namespace fileindexd {

namespace {
const int kPathBufferSize = 4096;

bool LocationOf(int (*get)(const char*, char*, int), const std::string& share, std::string& out) {
  char buffer[kPathBufferSize] = {0};
  if (get(share.c_str(), buffer, sizeof(buffer)) < 0) return false;
  out = buffer;
  return true;
}
}  // namespace

bool RelativeToShare(const std::string& shareDirectory, const std::string& full, std::string& relative) {
  if (full == shareDirectory) {
    relative.clear();
    return true;
  }
  if (full.size() <= shareDirectory.size() + 1 ||
      full.compare(0, shareDirectory.size(), shareDirectory) != 0 || full[shareDirectory.size()] != '/') {
    return false;
  }
  relative = full.substr(shareDirectory.size() + 1);
  return true;
}

bool LoadShareConfigs(std::map<std::string, ShareConfig>& shares, std::vector<std::string>& problems,
                      std::string& error) {
  using namespace TAVO::FILEINDEX;
  std::vector<Folder> folders;
  if (!IndexMgr::List(folders)) {
    error = "cannot read the folder list (error " + std::to_string(ErrorHandler::GetError()) + ")";
    return false;
  }
  shares.clear();
  std::map<std::string, bool> broken;
  for (const Folder& folder : folders) {
    std::string name;
    if (!GetShareNameByPath(name, folder.GetPath())) {
      problems.push_back("folder " + folder.GetPath() + ": no share name");
      continue;
    }
    if (broken.count(name)) continue;
    auto it = shares.find(name);
    if (it == shares.end()) {
      ShareConfig share;
      share.name = name;
      if (!GetFullPath(share.directory, "/" + name) ||
          !LocationOf(FILEIDXQueuePathGet, name, share.queuePath) ||
          !LocationOf(FILEIDXDBPathGet, name, share.dbDirectory)) {
        problems.push_back("share " + name + ": not found");
        broken[name] = true;
        continue;
      }
      it = shares.emplace(name, share).first;
    }
    ShareConfig& share = it->second;
    std::string relative;
    if (!RelativeToShare(share.directory, folder.GetFullPath(), relative)) {
      problems.push_back("folder " + folder.GetPath() + ": outside its share's directory");
      continue;
    }
    share.folders.push_back(folder);
    FolderFlags flags;
    flags.document = folder.IsDocument();
    flags.audio = folder.IsAudio();
    flags.video = folder.IsVideo();
    flags.photo = folder.IsPhoto();
    share.flags[relative] = flags;
    share.relativeByPath[folder.GetPath()] = relative;
  }
  return true;
}

bool ReadPause(bool& paused, long long& resumeTime) {
  resumeTime = -1;
  if (!TAVO::FILEINDEX::StatusMgr::GetPauseInfo(resumeTime)) {
    paused = false;
    return false;
  }
  paused = resumeTime == 0 || (resumeTime > 0 && static_cast<long long>(std::time(nullptr)) < resumeTime);
  return true;
}

}  // namespace fileindexd
