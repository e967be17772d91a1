// Pieces shared by the index manager's writers: the folder.conf transaction, the
// shutdown of indexing when no folder remains, the per-share locations and the
// platform's last error for log lines.
#ifndef FILEINDEX_INTERNAL_INDEX_MGR_COMMON_H
#define FILEINDEX_INTERNAL_INDEX_MGR_COMMON_H

#include <fileindex/folders.h>
#include <json/json.h>

#include <functional>
#include <string>

namespace TAVO {
namespace FILEINDEX {
namespace internal {

using FoldersStep = std::function<bool(Folders&)>;

// The one shape of every folder.conf change: lock, load, change, save, then the side
// effects, each step ending the transaction with false when it fails. Unlock() runs on
// every way out, whether or not the lock was taken; nothing is rolled back after the save.
bool FolderTransaction(const FoldersStep& change, const FoldersStep& afterSave = FoldersStep());

// Whether the in-memory collection (what was just saved) holds no folder at all.
bool HoldsNoFolder(Folders& folders);

// Stops "fileindexd" and switches Spotlight off (restarting Samba when that worked).
// Every failure is logged and passed over: the configuration is already saved.
void StopIndexing();

// The platform's last error as the service-failure log lines print it.
struct PlatformError {
  unsigned code;
  std::string file;
  int line;
  static PlatformError Last();
};

// The share's event queue file and index database, looked up in 4096-byte buffers.
// False when the platform does not know the share; out is then unchanged.
bool ShareQueuePath(const std::string& share, std::string& out);
bool ShareDbPath(const std::string& share, std::string& out);

// {key: value}, the payload of the daemon commands.
Json::Value OneMember(const char* key, const std::string& value);

}  // namespace internal
}  // namespace FILEINDEX
}  // namespace TAVO

#endif
