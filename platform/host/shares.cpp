// The share database: a JSON share table under the system root,
//   {"shares": [{"name": "photo", "path": "/volume1/photo", "readonly": false,
//                "encrypted": false, "encryption": false, "recycle_bin": true}]}
// Share directories are rooted like every other fixed path.
#include <json/json.h>
#include <sys/stat.h>
#include <tavo/platform.h>

#include <cstdlib>
#include <cstring>
#include <memory>
#include <mutex>
#include <set>
#include <string>
#include <vector>

#include "host_common.h"
#include "host_shares.h"

namespace tavo_host {

namespace {

struct TableCache {
  std::mutex mutex;
  std::vector<ShareInfo> shares;
  std::string path;
  struct stat st = {};
  bool valid = false;
};

TableCache& Cache() {
  static TableCache* cache = new TableCache();  // never destroyed: used until exit
  return *cache;
}

bool SameFile(const struct stat& a, const struct stat& b) {
  return a.st_dev == b.st_dev && a.st_ino == b.st_ino && a.st_size == b.st_size &&
         a.st_mtim.tv_sec == b.st_mtim.tv_sec && a.st_mtim.tv_nsec == b.st_mtim.tv_nsec &&
         a.st_ctim.tv_sec == b.st_ctim.tv_sec && a.st_ctim.tv_nsec == b.st_ctim.tv_nsec;
}

bool ReadFlag(const Json::Value& entry, const char* key, bool& out) {
  if (!entry.isMember(key)) return true;
  if (!entry[key].isBool()) return false;
  out = entry[key].asBool();
  return true;
}

// A share directory as stored: absolute, no empty, "." or ".." component, no trailing slash.
bool NormalisedDirectory(const std::string& in, std::string& out) {
  if (in.empty() || in[0] != '/') return false;
  out.clear();
  size_t start = 1;
  while (start <= in.size()) {
    size_t end = in.find('/', start);
    if (end == std::string::npos) end = in.size();
    std::string part = in.substr(start, end - start);
    if (part == "." || part == "..") return false;
    if (!part.empty()) out += "/" + part;
    start = end + 1;
  }
  return !out.empty();
}

bool ParseTable(const std::string& text, std::vector<ShareInfo>& out) {
  Json::CharReaderBuilder builder;
  Json::CharReaderBuilder::strictMode(&builder.settings_);
  std::unique_ptr<Json::CharReader> reader(builder.newCharReader());
  Json::Value root;
  std::string errors;
  if (!reader->parse(text.data(), text.data() + text.size(), &root, &errors)) return false;
  if (!root.isObject() || !root["shares"].isArray()) return false;
  std::vector<ShareInfo> parsed;
  std::set<std::string> names;
  for (const Json::Value& entry : root["shares"]) {
    if (!entry.isObject() || !entry["name"].isString() || !entry["path"].isString()) return false;
    ShareInfo info;
    info.name = entry["name"].asString();
    std::string dir;
    if (info.name.empty() || info.name.find('/') != std::string::npos || !names.insert(info.name).second ||
        !NormalisedDirectory(entry["path"].asString(), dir)) {
      return false;
    }
    info.path = Rooted(dir);
    if (!ReadFlag(entry, "readonly", info.readOnly) || !ReadFlag(entry, "encrypted", info.encrypted) ||
        !ReadFlag(entry, "encryption", info.encryption) || !ReadFlag(entry, "recycle_bin", info.recycleBin)) {
      return false;
    }
    if (entry.isMember("free_bytes")) {
      if (!entry["free_bytes"].isIntegral() || entry["free_bytes"].asLargestInt() < 0) return false;
      info.freeBytes = entry["free_bytes"].asLargestInt();
    }
    parsed.push_back(info);
  }
  out.swap(parsed);
  return true;
}

}  // namespace

std::string ShareTablePath() { return Rooted("/etc/tavo/shares.json"); }

bool LoadShares(std::vector<ShareInfo>& out) {
  TableCache& cache = Cache();
  std::lock_guard<std::mutex> guard(cache.mutex);
  const std::string path = ShareTablePath();
  struct stat st;
  if (::stat(path.c_str(), &st) != 0) {
    TAVO_HOST_SET_ERROR(kErrShareTable);
    return false;
  }
  if (!cache.valid || cache.path != path || !SameFile(cache.st, st)) {
    std::string text;
    std::vector<ShareInfo> parsed;
    if (!ReadFile(path, text) || !ParseTable(text, parsed)) {
      cache.valid = false;
      TAVO_HOST_SET_ERROR(kErrShareTable);
      return false;
    }
    cache.shares.swap(parsed);
    cache.path = path;
    cache.st = st;
    cache.valid = true;
  }
  out = cache.shares;
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

bool IsUnder(const std::string& full, const std::string& dir) {
  return full.compare(0, dir.size(), dir) == 0 && (full.size() == dir.size() || full[dir.size()] == '/');
}

bool NameMatchesDirectory(const ShareInfo& share) {
  return share.path.substr(share.path.rfind('/') + 1) == share.name;
}

bool FindShareOfPath(const std::string& full, ShareInfo& out) {
  std::vector<ShareInfo> shares;
  if (!LoadShares(shares)) return false;
  const ShareInfo* best = nullptr;
  for (const ShareInfo& share : shares) {
    if (IsUnder(full, share.path) && (best == nullptr || share.path.size() > best->path.size()))
      best = &share;
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
  if (share->szName == nullptr || share->szComment == nullptr || share->szPath == nullptr) {
    TAVOShareFree(share);
    TAVO_HOST_SET_ERROR(tavo_host::kErrSystem);
    return -1;
  }
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

// Non-zero for the share's "#recycle" directory and what lies below it, when the
// share's recycle bin is on.
extern "C" int TAVOShareIsShareRecycle(const char* szFullPath) {
  if (szFullPath == nullptr) return 0;
  ShareInfo info;
  if (!tavo_host::FindShareOfPath(szFullPath, info) || !info.recycleBin) return 0;
  return tavo_host::IsUnder(szFullPath, info.path + "/#recycle") ? 1 : 0;
}

namespace {
int GetFlag(PTAVOSHARE share, int* out, int TAVOSHARE::*member) {
  if (share == nullptr || out == nullptr) {
    TAVO_HOST_SET_ERROR(tavo_host::kErrBadArgument);
    return -1;
  }
  *out = share->*member;
  return 0;
}
}  // namespace

extern "C" int VLIBShareIsEncryptedGet(PTAVOSHARE pShare, int* pblEncrypted) {
  return GetFlag(pShare, pblEncrypted, &TAVOSHARE::blEncrypted);
}

extern "C" int VLIBShareIsEncryptionGet(PTAVOSHARE pShare, int* pblEncryption) {
  return GetFlag(pShare, pblEncryption, &TAVOSHARE::blEncryption);
}

extern "C" int VLIBShareIsReadOnlyGet(PTAVOSHARE pShare, int* pblReadOnly) {
  return GetFlag(pShare, pblReadOnly, &TAVOSHARE::blReadOnly);
}
