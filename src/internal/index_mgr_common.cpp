#include "internal/index_mgr_common.h"

#include <fileindex/fileindex_c.h>
#include <tavo/platform.h>

#include <cstring>

#include "internal/log.h"
#include "internal/scope_exit.h"

namespace TAVO {
namespace FILEINDEX {
namespace internal {

namespace {
const char kLogUnit[] = "index_mgr";
const int kPathSize = 4096;

bool LocationGet(int (*get)(const char*, char*, int), const std::string& share, std::string& out) {
  char buffer[kPathSize];
  std::memset(buffer, 0, sizeof(buffer));
  if (get(share.c_str(), buffer, sizeof(buffer)) < 0) return false;
  out.assign(buffer, strnlen(buffer, sizeof(buffer)));
  return true;
}
}  // namespace

bool FolderTransaction(const FoldersStep& change, const FoldersStep& afterSave) {
  Folders folders;
  UnlockOnExit<Folders> unlock(folders);
  if (!folders.Lock(true)) return false;
  if (!folders.Load()) return false;
  if (!change(folders)) return false;
  if (!folders.Save()) return false;
  return afterSave ? afterSave(folders) : true;
}

bool HoldsNoFolder(Folders& folders) {
  std::vector<Folder> all;
  return folders.List(all) && all.empty();
}

PlatformError PlatformError::Last() {
  const char* file = VLIBCErrorGetFile();
  return PlatformError{static_cast<unsigned>(VLIBCErrGet()), file != nullptr ? file : "",
                       VLIBCErrorGetLine()};
}

void StopIndexing() {
  if (VLIBServiceStop("fileindexd", 1) < 0) {
    PlatformError err = PlatformError::Last();
    FIDX_LOG("VLIBServiceStop failed: err=[0x%04X %s:%d]", err.code, err.file.c_str(), err.line);
  }
  if (TAVOSMBIsEnableSpotlight() == 0) return;
  if (TAVOSMBSetSpotlight(0) < 0) {
    PlatformError err = PlatformError::Last();
    FIDX_LOG("TAVOSMBSetSpotlight failed: err=[0x%04X %s:%d]", err.code, err.file.c_str(), err.line);
  } else if (VLIBServiceRestart("samba") < 0) {
    PlatformError err = PlatformError::Last();
    FIDX_LOG("VLIBServiceRestart failed: err=[0x%04X %s:%d]", err.code, err.file.c_str(), err.line);
  }
}

bool ShareQueuePath(const std::string& share, std::string& out) {
  return LocationGet(FILEIDXQueuePathGet, share, out);
}

bool ShareDbPath(const std::string& share, std::string& out) {
  return LocationGet(FILEIDXDBPathGet, share, out);
}

Json::Value OneMember(const char* key, const std::string& value) {
  Json::Value object(Json::objectValue);
  object[key] = value;
  return object;
}

}  // namespace internal
}  // namespace FILEINDEX
}  // namespace TAVO
