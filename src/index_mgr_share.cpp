// Keeping the index in step with whole shares: removed, renamed, paused and resumed.
#include <fileindex/folders.h>
#include <fileindex/index_mgr.h>
#include <fileindex/utils.h>

#include <vector>

#include "internal/index_mgr_common.h"
#include "internal/log.h"

namespace TAVO {
namespace FILEINDEX {

namespace {
const char kLogUnit[] = "index_mgr";
}  // namespace

bool IndexMgr::ShareRemove(const std::string& share) {
  // The share's queue, database and watch list are left alone: the share itself is gone.
  auto change = [&share](Folders& config) {
    std::vector<Folder> folders;
    if (!config.List(folders, share)) return false;
    Json::Value result;
    for (const Folder& folder : folders) {
      if (!config.Delete(result, folder.GetPath())) return false;
    }
    return true;
  };
  auto afterSave = [](Folders& config) {
    if (internal::HoldsNoFolder(config)) internal::StopIndexing();
    return true;
  };
  return internal::FolderTransaction(change, afterSave);
}

bool IndexMgr::ShareRename(const std::string& old_share, const std::string& new_share) {
  // All or nothing: one failing folder and nothing is saved.
  auto change = [&old_share, &new_share](Folders& config) {
    std::vector<Folder> folders;
    if (!config.List(folders, old_share)) return false;
    Json::Value result;
    for (Folder& folder : folders) {
      if (!config.Delete(result, folder.GetPath())) return false;
      // The name and the flags travel with the folder to its new path.
      folder.SetPath(ReplaceShareName(folder.GetPath(), new_share));
      if (!config.Upsert(result, folder.asJson())) return false;
    }
    return true;
  };
  return internal::FolderTransaction(change);
}

bool IndexMgr::SharePause(const std::string& share) {
  // The daemon is told first, then the watch list goes; folder.conf keeps the share's
  // folders for the resume.
  if (!SendCammandToDaemon("delete_share_worker", internal::OneMember("share_name", share))) return false;
  if (!DeleteTAVotifydCfg(share)) {
    FIDX_LOG("DeleteTAVotifydCfg failed, share=%s", share.c_str());
    return false;
  }
  return true;
}

bool IndexMgr::ShareResume(const std::string& share) {
  // The mirror of SharePause: the watch list comes back before the worker is revived.
  if (!UpsertTAVotifydCfg(share)) {
    FIDX_LOG("UpsertTAVotifydCfg failed, share=%s", share.c_str());
    return false;
  }
  return SendCammandToDaemon("revive_share_worker", internal::OneMember("share_name", share));
}

}  // namespace FILEINDEX
}  // namespace TAVO
