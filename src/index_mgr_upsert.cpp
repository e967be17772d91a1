// Adding and changing indexed folders, and the notification daemon's watch list of
// each share.
#include <fileindex/error.h>
#include <fileindex/folders.h>
#include <fileindex/index_mgr.h>
#include <fileindex/utils.h>
#include <tavo/platform.h>
#include <tavo/tavotifyd.h>

#include <exception>
#include <memory>
#include <set>
#include <vector>

#include "internal/index_mgr_common.h"
#include "internal/json_io.h"
#include "internal/log.h"

namespace TAVO {
namespace FILEINDEX {

namespace {
const char kLogUnit[] = "index_mgr";
const char kWatchQueueName[] = "fileindex";
const TAVOTIFYD::_tag_monitor_queue_type_ kWatchQueueType = TAVOTIFYD::MONITOR_QUEUE_TYPE_FILE;
const int kWatchMask = 0xFFCE;
const int kSettingsEvent = 0x20000;

// One entry of a share's watch list.
Json::Value WatchEntry(const std::string& full) {
  Json::Value entry(Json::objectValue);
  entry["path"] = full;
  entry["mask"] = kWatchMask;
  Json::Value ignore(Json::arrayValue);
  ignore.append("@eaDir");
  entry["ignore"] = ignore;
  return entry;
}

// Spotlight helps but is not required for indexing: its failures are only logged. Samba
// is restarted only when Spotlight was actually switched on.
void SwitchSpotlightOn() {
  if (TAVOSMBIsEnableSpotlight() != 0) return;
  if (TAVOSMBSetSpotlight(1) < 0) {
    internal::PlatformError err = internal::PlatformError::Last();
    FIDX_LOG("TAVOSMBSetSpotlight failed: err=[0x%04X %s:%d]", err.code, err.file.c_str(), err.line);
  } else if (VLIBServiceRestart("samba") < 0) {
    internal::PlatformError err = internal::PlatformError::Last();
    FIDX_LOG("VLIBServiceRestart failed: err=[0x%04X %s:%d]", err.code, err.file.c_str(), err.line);
  }
}
}  // namespace

bool IndexMgr::Upsert(const Json::Value& folders) {
  if (!folders.isArray()) {
    FIDX_LOG("Bad param: %s", internal::JsonToString(folders).c_str());
    ErrorHandler::SetError(FILEINDEX_ERR_BAD_PARAM);
    return false;
  }

  std::vector<std::string> paths;  // in array order, duplicates kept
  Json::Value upserted(Json::objectValue);
  std::set<std::string> shares;

  auto change = [&](Folders& config) {
    // Only has to be readable; the list itself is not used.
    std::vector<Folder> current;
    if (!config.List(current)) return false;
    Json::Value result;
    for (const Json::Value& element : folders) {
      std::string path;
      RetrieveStringFromJsonObj(path, "path", element);
      if (!config.Upsert(result, element)) {
        FIDX_LOG("Upsert failed, folder=%s", internal::JsonToString(element).c_str());
        return false;
      }
      // A later element with the same path replaces the earlier report.
      upserted[path] = result;
      std::string share;
      if (!GetShareNameByPath(share, path)) {
        FIDX_LOG("GetShareNameByPath failed, path=%s", path.c_str());
        return false;
      }
      shares.insert(share);
      paths.push_back(path);
    }
    return true;
  };

  auto afterSave = [&](Folders&) {
    for (const std::string& share : shares) {
      if (!UpsertTAVotifydCfg(share)) {
        FIDX_LOG("UpsertTAVtifydCfg failed, share=%s", share.c_str());
        return false;
      }
    }
    if (VLIBServiceStart("fileindexd", 1) < 0) {
      internal::PlatformError err = internal::PlatformError::Last();
      FIDX_LOG("VLIBServiceStart failed: err=[0x%04X %s:%d]", err.code, err.file.c_str(), err.line);
      return false;
    }
    SwitchSpotlightOn();
    // One command per element: a path given twice is announced twice.
    for (const std::string& path : paths) {
      if (!SendCammandToDaemon("upsert_folder_setting", internal::OneMember("folder_path", path))) {
        FIDX_LOG("SendCammandToDaemon failed");
        return false;
      }
    }
    // One event per distinct path, in ascending path order.
    for (Json::Value::const_iterator it = upserted.begin(); it != upserted.end(); ++it) {
      const std::string path = it.name();
      std::string full;
      if (!GetFullPath(full, path)) {
        FIDX_LOG("GetFullPath failed, path=%s", path.c_str());
        ErrorHandler::SetError(FILEINDEX_ERR_BAD_PATH);
        return false;
      }
      if (!AddCustomEvent(kSettingsEvent, full, *it)) {
        FIDX_LOG("AddCustomEvent failed");
        return false;
      }
    }
    return true;
  };

  return internal::FolderTransaction(change, afterSave);
}

bool IndexMgr::Set(const Json::Value& folders) { return Upsert(folders); }

bool IndexMgr::Add(const Json::Value& folders) { return Upsert(folders); }

bool IndexMgr::UpsertTAVotifydCfg(const std::string& share) {
  std::string queuePath;
  if (!internal::ShareQueuePath(share, queuePath)) {
    FIDX_LOG("FILEIDXQueuePathGet failed, share=%s", share.c_str());
    return false;
  }
  // No lock of its own: the writers that call this hold folder.conf's lock already, and
  // this fresh object reads the file they have just saved.
  Folders config;
  if (!config.Load()) return false;
  std::vector<Folder> folders;
  if (!config.List(folders, share)) return false;

  // A share without folders still sends its empty list: that is how its last folder
  // stops being watched.
  Json::Value entries(Json::arrayValue);
  for (const Folder& folder : folders) {
    std::string full;
    if (!GetFullPath(full, folder.GetPath())) {
      FIDX_LOG("GetFullPath failed, path=%s", folder.GetPath().c_str());
      return false;
    }
    entries.append(WatchEntry(full));
  }
  Json::Value watch(Json::objectValue);
  watch["queue"] = queuePath;
  watch["config"] = entries;

  std::unique_ptr<TAVOTIFYD::MonitorQueue> queue;
  try {
    queue.reset(new TAVOTIFYD::MonitorQueue(watch));
  } catch (const std::exception&) {
    return false;
  }
  if (TAVOTIFYD::MonitorQueue::Upsert(*queue, kWatchQueueName, kWatchQueueType) == 0) {
    FIDX_LOG("MonitorQueue::Add failed");
    return false;
  }
  return true;
}

bool IndexMgr::DeleteTAVotifydCfg(const std::string& share) {
  std::string queuePath;
  if (!internal::ShareQueuePath(share, queuePath)) {
    FIDX_LOG("FILEIDXQueuePathGet failed, share=%s", share.c_str());
    return false;
  }
  if (TAVOTIFYD::MonitorQueue::Delete(queuePath, kWatchQueueName, kWatchQueueType) == 0) {
    FIDX_LOG("MonitorQueue::Delete failed");
    return false;
  }
  return true;
}

}  // namespace FILEINDEX
}  // namespace TAVO
