// The one-time migration after an upgrade: services, Spotlight, watch lists and a
// reindex of every folder brought into line with folder.conf.
#include <fileindex/folders.h>
#include <fileindex/index_mgr.h>
#include <fileindex/utils.h>
#include <tavo/platform.h>

#include <set>
#include <string>
#include <vector>

#include "internal/log.h"

namespace TAVO {
namespace FILEINDEX {

namespace {
const char kLogUnit[] = "utils";
const char kDaemonService[] = "fileindexd";
}  // namespace

bool Updater_vem60_beta2() {
  // A pure reader: folder.conf is read without the lock.
  Folders config;
  std::vector<Folder> folders;
  if (!config.Load() || !config.List(folders)) return false;

  if (folders.empty()) {
    if (VLIBServiceStop(kDaemonService, 1) < 0) {
      // The message names the start call, as the service log has always read.
      FIDX_LOG("VLIBServiceStart failed: err=[0x%04X %s:%d]", static_cast<unsigned>(VLIBCErrGet()),
               VLIBCErrorGetFile(), VLIBCErrorGetLine());
      return false;
    }
    return true;
  }

  if (VLIBServiceStart(kDaemonService, 1) < 0) {
    FIDX_LOG("VLIBServiceStart failed: err=[0x%04X %s:%d]", static_cast<unsigned>(VLIBCErrGet()),
             VLIBCErrorGetFile(), VLIBCErrorGetLine());
    return false;
  }
  // Whether any folder is configured, which is always so here. Samba is not restarted.
  if (TAVOSMBSetSpotlight(1) < 0) {
    FIDX_LOG("TAVOSMBSetSpotlight failed: err=[0x%04X %s:%d]", static_cast<unsigned>(VLIBCErrGet()),
             VLIBCErrorGetFile(), VLIBCErrorGetLine());
    return false;
  }

  std::set<std::string> shares;
  Json::Value paths(Json::arrayValue);
  for (const Folder& folder : folders) {
    std::string share;
    if (!GetShareNameByPath(share, folder.GetPath())) {
      FIDX_LOG("GetShareNameByPath failed, path=%s", folder.GetPath().c_str());
      return false;
    }
    shares.insert(share);
    paths.append(folder.GetPath());
  }

  for (const std::string& share : shares) {
    if (!IndexMgr::UpsertTAVotifydCfg(share)) {
      FIDX_LOG("UpsertTAVotifydCfg failed, share=%s", share.c_str());
      return false;
    }
  }
  if (!IndexMgr::Reindex(paths)) {
    FIDX_LOG("Reindex failed");
    return false;
  }
  return true;
}

}  // namespace FILEINDEX
}  // namespace TAVO
