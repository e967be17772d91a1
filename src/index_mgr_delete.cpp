// Removing indexed folders and what follows from it, reindex requests, settings events
// and the removal of a share's index data.
#include <fileindex/error.h>
#include <fileindex/folders.h>
#include <fileindex/index_mgr.h>
#include <fileindex/status_mgr.h>
#include <fileindex/utils.h>
#include <sys/stat.h>
#include <tavo/platform.h>

#include <set>
#include <vector>

#include "internal/index_mgr_common.h"
#include "internal/json_io.h"
#include "internal/log.h"

namespace TAVO {
namespace FILEINDEX {

namespace {
const char kLogUnit[] = "index_mgr";
const int kReindexEvent = 0x10000;
const int kSettingsEvent = 0x20000;

void RemoveTree(const std::string& path) { VLIBCExec("/bin/rm", "-rf", path.c_str(), nullptr, nullptr); }
}  // namespace

bool IndexMgr::Delete(const Json::Value& paths) {
  if (!paths.isArray()) {
    FIDX_LOG("Bad param: %s", internal::JsonToString(paths).c_str());
    ErrorHandler::SetError(FILEINDEX_ERR_BAD_PARAM);
    return false;
  }

  std::vector<std::string> deleted;  // in array order
  // Each deletion overwrites it, so only the last element's report is announced.
  Json::Value removed;
  std::set<std::string> shares;

  auto change = [&](Folders& config) {
    for (const Json::Value& element : paths) {
      // An object or an array has no string form; the JSON library would throw on it.
      if (!element.isConvertibleTo(Json::stringValue)) {
        FIDX_LOG("Bad param: %s", internal::JsonToString(element).c_str());
        ErrorHandler::SetError(FILEINDEX_ERR_BAD_PARAM);
        return false;
      }
      const std::string path = element.asString();
      if (!config.Delete(removed, path)) {
        FIDX_LOG("Delete failed, path=%s", path.c_str());
        return false;
      }
      std::string share;
      if (!GetShareNameByPath(share, path)) {
        FIDX_LOG("GetShareNameByPath failed, path=%s", path.c_str());
        return false;
      }
      shares.insert(share);
      deleted.push_back(path);
    }
    return true;
  };

  auto afterSave = [&](Folders& config) {
    if (internal::HoldsNoFolder(config)) {
      // Nothing is left to index: the daemon goes, and with it any reason to tell it.
      internal::StopIndexing();
    } else {
      for (const std::string& path : deleted) {
        if (!SendCammandToDaemon("delete_folder_setting", internal::OneMember("folder_path", path))) {
          FIDX_LOG("SendCammandToDaemon failed");
          return false;
        }
      }
      for (Json::Value::const_iterator it = removed.begin(); it != removed.end(); ++it) {
        if (!Update(it.name(), *it)) {
          FIDX_LOG("Update failed");
          return false;
        }
      }
    }
    for (const std::string& share : shares) {
      if (!IsShareIndexed(share)) {
        if (!CleanShareIndexData(share)) {
          FIDX_LOG("CleanShareIndexData failed, share=%s", share.c_str());
          return false;
        }
        if (!DeleteTAVotifydCfg(share)) {
          FIDX_LOG("DeleteTAVtifydCfg failed, share=%s", share.c_str());
          return false;
        }
      } else if (!UpsertTAVotifydCfg(share)) {
        // The watch list must stop naming the deleted folders.
        FIDX_LOG("UpsertTAVotifydCfg failed, share=%s", share.c_str());
        return false;
      }
    }
    return true;
  };

  return internal::FolderTransaction(change, afterSave);
}

bool IndexMgr::Reindex(const Json::Value& paths) {
  // No lock: folder.conf is only read.
  if (!paths.isArray()) {
    FIDX_LOG("Malformed jsArrPath: %s", internal::JsonToString(paths).c_str());
    ErrorHandler::SetError(FILEINDEX_ERR_BAD_PARAM);
    return false;
  }
  // Every path is checked before any event is written, and shares stopped for lack of
  // space are revived first, so their workers are there to take the events.
  std::set<std::string> toRevive;
  for (const Json::Value& element : paths) {
    if (!element.isString()) {
      FIDX_LOG("Malformed jsArrPath: %s", internal::JsonToString(element).c_str());
      ErrorHandler::SetError(FILEINDEX_ERR_BAD_PARAM);
      return false;
    }
    const std::string path = element.asString();
    std::string share;
    if (!GetShareNameByPath(share, path)) {
      FIDX_LOG("Failed to get share name from path: %s", path.c_str());
      return false;
    }
    if (!IsShareIndexed(share)) return false;
    if (StatusMgr::ShareIsNoSpace(share)) toRevive.insert(share);
  }
  for (const std::string& share : toRevive) {
    if (!StatusMgr::ShareRevive(share)) {
      FIDX_LOG("ShareRevice failed, share=%s", share.c_str());
    }
  }
  // Events written for earlier paths stay when a later one fails.
  for (const Json::Value& element : paths) {
    const std::string path = element.asString();
    std::string full;
    if (!GetFullPath(full, path)) {
      FIDX_LOG("GetFullPath failed, path=%s", path.c_str());
      ErrorHandler::SetError(FILEINDEX_ERR_BAD_PATH);
      return false;
    }
    if (!AddCustomEvent(kReindexEvent, full, Json::Value())) {
      FIDX_LOG("AddCustomEvent failed, path=%s", path.c_str());
      return false;
    }
  }
  return true;
}

bool IndexMgr::Update(const std::string& path, const Json::Value& setting) {
  std::string full;
  if (!GetFullPath(full, path)) {
    FIDX_LOG("GetFullPath failed, path=%s", path.c_str());
    ErrorHandler::SetError(FILEINDEX_ERR_BAD_PATH);
    return false;
  }
  if (!AddCustomEvent(kSettingsEvent, full, setting)) {
    FIDX_LOG("AddCustomEvent failed");
    return false;
  }
  return true;
}

bool IndexMgr::CleanShareIndexData(const std::string& share) {
  // rm -rf removes a link found at the path itself, never what it points to, but it
  // follows links in the directories above. The index data lies in the share's "@eaDir",
  // which share users could replace by a link to a directory elsewhere, and rm runs as
  // root: a removal through such a link is skipped, with a log line. A real "@eaDir" (or
  // none at all) is removed from exactly as before. rm resolves the path again, so a link
  // swapped in between is not caught; the check narrows that window, it cannot close it.
  auto removeInsideShare = [](const std::string& path) {
    const std::string::size_type slash = path.rfind('/');
    struct stat st;
    if (slash != std::string::npos && slash > 0 && ::lstat(path.substr(0, slash).c_str(), &st) == 0 &&
        S_ISLNK(st.st_mode)) {
      FIDX_LOG("Skip removing %s: its directory is a symbolic link", path.c_str());
      return;
    }
    RemoveTree(path);
  };
  // What rm makes of each path is not examined; only unknown locations fail.
  std::string queuePath;
  if (!internal::ShareQueuePath(share, queuePath)) {
    FIDX_LOG("FILEIDXQueuePathGet failed, share=%s", share.c_str());
    return false;
  }
  removeInsideShare(queuePath);
  removeInsideShare(queuePath + ".tmp");
  std::string dbPath;
  if (!internal::ShareDbPath(share, dbPath)) {
    FIDX_LOG("FILEIDXDBPathGet failed, share=%s", share.c_str());
    return false;
  }
  removeInsideShare(dbPath);
  return true;
}

}  // namespace FILEINDEX
}  // namespace TAVO
