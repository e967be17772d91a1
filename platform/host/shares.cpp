// The share database: a JSON share table under the system root,
//   {"shares": [{"name": "photo", "path": "/volume1/photo", "readonly": false,
//                "encrypted": false, "encryption": false, "recycle_bin": true}]}
// Share directories are rooted like every other fixed path.
#include <sys/stat.h>
#include <tavo/platform.h>

#include <cstdlib>
#include <cstring>
#include <fstream>
#include <mutex>
#include <sstream>
#include <string>
#include <vector>

#include "host_common.h"
#include "host_shares.h"

namespace tavo_host {

namespace {

std::mutex g_mutex;
std::vector<ShareInfo> g_shares;
std::string g_loadedPath;
struct timespec g_loadedMtime = {0, 0};
off_t g_loadedSize = -1;
ino_t g_loadedIno = 0;

bool ParseTable(const std::string& text, std::vector<ShareInfo>& out) {
  Json::CharReaderBuilder builder;
  std::string errors;
  Json::Value root;
  std::istringstream in(text);
  if (!Json::parseFromStream(builder, in, &root, &errors)) return false;
  const Json::Value& list = root.isObject() ? root["shares"] : root;
  if (!list.isArray()) return false;
  out.clear();
  for (const Json::Value& entry : list) {
    if (!entry.isObject() || !entry["name"].isString() || !entry["path"].isString()) return false;
    ShareInfo info;
    info.name = entry["name"].asString();
    info.path = Rooted(entry["path"].asString());
    info.readOnly = entry.get("readonly", false).asBool();
    info.encrypted = entry.get("encrypted", false).asBool();
    info.encryption = entry.get("encryption", false).asBool();
    info.recycleBin = entry.get("recycle_bin", false).asBool();
    out.push_back(info);
  }
  return true;
}

}  // namespace

std::string ShareTablePath() { return Rooted("/etc/tavo/shares.json"); }

bool LoadShares(std::vector<ShareInfo>& out) {
  std::lock_guard<std::mutex> guard(g_mutex);
  const std::string path = ShareTablePath();
  struct stat st;
  if (::stat(path.c_str(), &st) != 0) {
    TAVO_HOST_SET_ERROR(kErrShareTable);
    return false;
  }
  // Re-read only when the file changed.
  bool same = path == g_loadedPath && st.st_ino == g_loadedIno && st.st_size == g_loadedSize &&
              st.st_mtim.tv_sec == g_loadedMtime.tv_sec && st.st_mtim.tv_nsec == g_loadedMtime.tv_nsec;
  if (!same) {
    std::ifstream in(path);
    std::stringstream text;
    text << in.rdbuf();
    std::vector<ShareInfo> parsed;
    if (!in || !ParseTable(text.str(), parsed)) {
      TAVO_HOST_SET_ERROR(kErrShareTable);
      return false;
    }
    g_shares.swap(parsed);
    g_loadedPath = path;
    g_loadedIno = st.st_ino;
    g_loadedSize = st.st_size;
    g_loadedMtime = st.st_mtim;
  }
  out = g_shares;
  return true;
}

bool FindShare(const std::string& name, ShareInfo& out) {
  std::vector<ShareInfo> shares;
  if (!LoadShares(shares)) return false;
  for (const ShareInfo& share : shares) {
    if (share.name == name) {
      out = share;
      return true;
    }
  }
  TAVO_HOST_SET_ERROR(kErrNoSuchShare);
  return false;
}

bool NameMatchesDirectory(const ShareInfo& share) {
  std::string::size_type slash = share.path.rfind('/');
  std::string last = slash == std::string::npos ? share.path : share.path.substr(slash + 1);
  return last == share.name;
}

bool FindShareOfPath(const std::string& full, ShareInfo& out) {
  std::vector<ShareInfo> shares;
  if (!LoadShares(shares)) return false;
  const ShareInfo* best = nullptr;
  for (const ShareInfo& share : shares) {
    const std::string& dir = share.path;
    bool inside = full.compare(0, dir.size(), dir) == 0 &&
                  (full.size() == dir.size() || full[dir.size()] == '/');
    if (inside && (best == nullptr || dir.size() > best->path.size())) best = &share;
  }
  if (best == nullptr) {
    TAVO_HOST_SET_ERROR(kErrNoSuchShare);
    return false;
  }
  out = *best;
  return true;
}

}  // namespace tavo_host

using tavo_host::ShareInfo;

extern "C" int TAVOShareGet(const char* szName, PTAVOSHARE* ppShare) {
  if (szName == nullptr || ppShare == nullptr) {
    TAVO_HOST_SET_ERROR(tavo_host::kErrBadArgument);
    return -1;
  }
  ShareInfo info;
  if (!tavo_host::FindShare(szName, info)) return -1;
  if (!tavo_host::NameMatchesDirectory(info)) {
    // The library builds full paths from the volume and the share name, so a share
    // whose directory is named otherwise cannot be served.
    TAVO_HOST_SET_ERROR(tavo_host::kErrShareNameMismatch);
    return -1;
  }
  PTAVOSHARE share = static_cast<PTAVOSHARE>(std::calloc(1, sizeof(TAVOSHARE)));
  if (share == nullptr) {
    TAVO_HOST_SET_ERROR(tavo_host::kErrSystem);
    return -1;
  }
  share->szName = ::strdup(info.name.c_str());
  share->szComment = ::strdup("");
  share->szPath = ::strdup(info.path.c_str());
  share->blReadOnly = info.readOnly;
  share->blEncrypted = info.encrypted;
  share->blEncryption = info.encryption;
  share->blRecycleBin = info.recycleBin;
  *ppShare = share;
  return 0;
}

extern "C" void TAVOShareFree(PTAVOSHARE pShare) {
  if (pShare == nullptr) return;
  std::free(pShare->szName);
  std::free(pShare->szComment);
  std::free(pShare->szPath);
  std::free(pShare);
}

extern "C" int TAVOShareNamePathGet(const char* szFullPath, char* szName, int cbName, char* szPath,
                                    int cbPath) {
  if (szFullPath == nullptr || szName == nullptr || szPath == nullptr || cbName <= 0 || cbPath <= 0) {
    TAVO_HOST_SET_ERROR(tavo_host::kErrBadArgument);
    return -1;
  }
  ShareInfo info;
  if (!tavo_host::FindShareOfPath(szFullPath, info)) return -1;
  if (!tavo_host::NameMatchesDirectory(info)) {
    TAVO_HOST_SET_ERROR(tavo_host::kErrShareNameMismatch);
    return -1;
  }
  if (info.name.size() >= static_cast<size_t>(cbName) || info.path.size() >= static_cast<size_t>(cbPath)) {
    TAVO_HOST_SET_ERROR(tavo_host::kErrBufferTooSmall);
    return -1;
  }
  std::memcpy(szName, info.name.c_str(), info.name.size() + 1);
  std::memcpy(szPath, info.path.c_str(), info.path.size() + 1);
  return 0;
}

extern "C" int TAVOShareIsShareRecycle(const char* szFullPath) {
  if (szFullPath == nullptr) return 0;
  ShareInfo info;
  if (!tavo_host::FindShareOfPath(szFullPath, info) || !info.recycleBin) return 0;
  const std::string top = info.path + "/#recycle";
  const std::string full = szFullPath;
  return full.compare(0, top.size(), top) == 0 && (full.size() == top.size() || full[top.size()] == '/');
}

extern "C" int VLIBShareIsEncryptedGet(PTAVOSHARE pShare, int* pblEncrypted) {
  if (pShare == nullptr || pblEncrypted == nullptr) {
    TAVO_HOST_SET_ERROR(tavo_host::kErrBadArgument);
    return -1;
  }
  *pblEncrypted = pShare->blEncrypted;
  return 0;
}

extern "C" int VLIBShareIsEncryptionGet(PTAVOSHARE pShare, int* pblEncryption) {
  if (pShare == nullptr || pblEncryption == nullptr) {
    TAVO_HOST_SET_ERROR(tavo_host::kErrBadArgument);
    return -1;
  }
  *pblEncryption = pShare->blEncryption;
  return 0;
}

extern "C" int VLIBShareIsReadOnlyGet(PTAVOSHARE pShare, int* pblReadOnly) {
  if (pShare == nullptr || pblReadOnly == nullptr) {
    TAVO_HOST_SET_ERROR(tavo_host::kErrBadArgument);
    return -1;
  }
  *pblReadOnly = pShare->blReadOnly;
  return 0;
}
