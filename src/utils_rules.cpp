// Indexability rules: which shares and paths may be configured for indexing, and which
// files the indexing daemon skips.
#include <fileindex/error.h>
#include <fileindex/utils.h>
#include <tavo/platform.h>

#include <climits>
#include <cstdlib>
#include <cstring>
#include <string>
#include <vector>

#include "internal/log.h"
#include "internal/share_record.h"

namespace TAVO {
namespace FILEINDEX {

namespace {
const char kLogUnit[] = "utils";
const int kFullPathSize = 4096;
static_assert(kFullPathSize >= PATH_MAX, "realpath needs a PATH_MAX buffer");

// File-system type that is refused like remote and image file systems.
const int kRefusedFsType = 12;
const int kUnknownFsType = -1;

// The library's and the platform's own files inside shares; never indexed.
const std::vector<std::string> g_preserved_file_names = {
    ".TemporaryItems", "TAVO@.fileindexdb", "TAVO@file_index_queue", ".TAVOPPSDB", ".DS_Store",
};

// Shares whose folders are never indexed.
const std::vector<std::string> g_unindexable_shares = {
    "surveillance",
    "NetBackup",
};

// Exact comparison: same length, same bytes, case-sensitive.
bool InList(const std::vector<std::string>& list, const std::string& name) {
  for (const std::string& entry : list) {
    if (entry == name) return true;
  }
  return false;
}

bool Contains(const std::string& text, const char* fragment) {
  return text.find(fragment) != std::string::npos;
}

bool IsRecycleBin(const std::string& full) {
  return Contains(full, "#recycle") && TAVOShareIsShareRecycle(full.c_str()) != 0;
}

bool IsInSnapshot(const std::string& full) {
  if (!Contains(full, "#snapshot")) return false;
  int inSnapshot = 0;
  return VLIBFhsPathInSnapshot(full.c_str(), &inSnapshot) == 0 && inSnapshot == 1;
}

bool IsRefusedFsType(int fsType) {
  return TAVOFSIsRemoteFS(fsType) != 0 || TAVOFSIsImageFS(fsType) != 0 || fsType == kRefusedFsType;
}
}  // namespace

bool IsSystemPreservedFileName(const std::string& name) {
  if (TAVOEAIsHiddenDir(name.c_str()) == 1) return true;
  return InList(g_preserved_file_names, name);
}

bool IsSkipIndex(const std::string& full) {
  // The type is taken before anything else, and used only by the last rule.
  int fsType = TAVOGetFSType(full.c_str(), 0);
  std::string::size_type slash = full.rfind('/');
  if (slash == std::string::npos) return true;
  if (IsSystemPreservedFileName(full.substr(slash + 1))) return true;
  if (IsRecycleBin(full)) return true;
  if (IsInSnapshot(full)) return true;
  // A type that cannot be determined is no reason to skip.
  if (fsType != kUnknownFsType && IsRefusedFsType(fsType)) return true;
  return false;
}

bool CanShareBeIndexed(_tag_TAVOSHARE* share) {
  if (share == nullptr) return false;
  if (share->szName != nullptr && InList(g_unindexable_shares, share->szName)) return false;
  int encrypted = 0;
  int readOnly = 0;
  if (VLIBShareIsEncryptedGet(share, &encrypted) < 0) return false;
  if (VLIBShareIsReadOnlyGet(share, &readOnly) < 0) return false;
  if (encrypted != 0) return false;
  if (readOnly != 0) return false;
  return true;
}

bool CanFullPathBeIndexed(const std::string& full) {
  if (IsRecycleBin(full)) return false;
  if (IsInSnapshot(full)) return false;
  // Unlike IsSkipIndex, a folder on a file system of unknown type is not configured.
  int fsType = TAVOGetFSType(full.c_str(), 0);
  if (fsType == kUnknownFsType) return false;
  if (IsRefusedFsType(fsType)) return false;

  std::string share;
  std::string sharePath;
  if (!GetShareNamePathByFullPath(share, sharePath, full)) {
    FIDX_LOG("GetShareNamePathByFullPath failed, path=%s", full.c_str());
    return false;
  }
  internal::ShareRecord record;
  if (internal::GetShareRecord(share.c_str(), record) < 0) {
    FIDX_LOG("TAVOShareGet failed, share=%s", share.c_str());
    return false;
  }
  if (!CanShareBeIndexed(record.get())) return false;

  // A mount point is allowed only as the root of a share that uses encryption (the
  // encrypted volume is mounted there), or when the platform cannot tell.
  if (TAVOFSDirIsMntPoint(full.c_str()) == 1) {
    int encryption = 0;
    if (VLIBShareIsEncryptionGet(record.get(), &encryption) == 0 && encryption == 0) {
      FIDX_LOG("Mount point[%s] is not allowed to be indexed", full.c_str());
      return false;
    }
  }

  // Only canonical paths are configured: no links, no "." or "..", no doubled or
  // trailing slashes.
  char resolved[kFullPathSize];
  std::memset(resolved, 0, sizeof(resolved));
  if (::realpath(full.c_str(), resolved) == nullptr || std::strlen(resolved) != full.size() ||
      std::memcmp(resolved, full.data(), full.size()) != 0) {
    FIDX_LOG("check realpath failed, path=%s", full.c_str());
    return false;
  }
  return true;
}

bool CanPathBeIndexed(const std::string& path) {
  std::string full;
  if (!GetFullPath(full, path)) {
    FIDX_LOG("GetFullPath failed, path=%s", path.c_str());
    ErrorHandler::SetError(FILEINDEX_ERR_BAD_PATH);
    return false;
  }
  return CanFullPathBeIndexed(full);
}

}  // namespace FILEINDEX
}  // namespace TAVO
