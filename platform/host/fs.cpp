// File-system facts from the real file system.
#include <sys/stat.h>
#include <sys/statfs.h>
#include <sys/statvfs.h>
#include <tavo/platform.h>

#include <cerrno>
#include <cstring>
#include <string>

#include "host_common.h"
#include "host_shares.h"

namespace {

// statfs magic numbers of network and image file systems.
const long kNfs = 0x6969;
const long kSmb = 0x517B;
const long kCifs = static_cast<long>(0xFF534D42);
const long kSmb2 = static_cast<long>(0xFE534D42);
const long kFuse = 0x65735546;
const long kIso9660 = 0x9660;
const long kUdf = 0x15013346;
const long kSquashfs = 0x73717368;

std::string Parent(const std::string& path) {
  std::string p = path;
  while (p.size() > 1 && p.back() == '/') p.pop_back();
  std::string::size_type slash = p.rfind('/');
  if (slash == std::string::npos) return ".";
  if (slash == 0) return "/";
  return p.substr(0, slash);
}

}  // namespace

extern "C" int TAVOGetFSType(const char* szPath, int /*flag*/) {
  struct statfs st;
  if (szPath == nullptr || ::statfs(szPath, &st) != 0) return -1;
  // The type is the magic number folded into a non-negative int.
  return static_cast<int>(static_cast<unsigned long>(st.f_type) & 0x7fffffff);
}

extern "C" int TAVOFSIsRemoteFS(int fsType) {
  for (long magic : {kNfs, kSmb, kCifs, kSmb2, kFuse}) {
    if ((magic & 0x7fffffff) == fsType) return 1;
  }
  return 0;
}

extern "C" int TAVOFSIsImageFS(int fsType) {
  for (long magic : {kIso9660, kUdf, kSquashfs}) {
    if ((magic & 0x7fffffff) == fsType) return 1;
  }
  return 0;
}

extern "C" int TAVOFSDirIsMntPoint(const char* szPath) {
  if (szPath == nullptr) return -1;
  struct stat self, parent;
  if (::stat(szPath, &self) != 0 || !S_ISDIR(self.st_mode)) return 0;
  if (::stat(Parent(szPath).c_str(), &parent) != 0) return -1;
  return self.st_dev != parent.st_dev || self.st_ino == parent.st_ino ? 1 : 0;
}

extern "C" int VLIBFhsPathInSnapshot(const char* szPath, int* pblInSnapshot) {
  if (szPath == nullptr || pblInSnapshot == nullptr) {
    TAVO_HOST_SET_ERROR(tavo_host::kErrBadArgument);
    return -1;
  }
  *pblInSnapshot = 0;
  tavo_host::ShareInfo share;
  if (!tavo_host::FindShareOfPath(szPath, share)) return 0;
  const std::string top = share.path + "/#snapshot";
  const std::string full = szPath;
  if (full.compare(0, top.size(), top) == 0 && (full.size() == top.size() || full[top.size()] == '/'))
    *pblInSnapshot = 1;
  return 0;
}

extern "C" int TAVOEAIsHiddenDir(const char* szName) {
  return szName != nullptr && std::strcmp(szName, "@eaDir") == 0 ? 1 : 0;
}

extern "C" int TAVOEAMKDir(int /*flag*/, const char* szPath) {
  if (szPath == nullptr) {
    TAVO_HOST_SET_ERROR(tavo_host::kErrBadArgument);
    return -1;
  }
  if (::mkdir(szPath, 0755) != 0 && errno != EEXIST) {
    TAVO_HOST_SET_ERROR(tavo_host::kErrSystem);
    return -1;
  }
  struct stat st;
  if (::lstat(szPath, &st) != 0 || !S_ISDIR(st.st_mode)) {
    TAVO_HOST_SET_ERROR(tavo_host::kErrSystem);
    return -1;
  }
  return 0;
}

extern "C" int TAVOQuotaIsEnough(unsigned int /*uid*/, const char* szPath, unsigned long long cbSize) {
  struct statvfs st;
  if (szPath == nullptr || ::statvfs(szPath, &st) != 0) {
    TAVO_HOST_SET_ERROR(tavo_host::kErrQuota);
    return 0;
  }
  unsigned long long available = static_cast<unsigned long long>(st.f_bavail) * st.f_frsize;
  if (available < cbSize) {
    TAVO_HOST_SET_ERROR(tavo_host::kErrNoSpace);
    return 0;
  }
  return 1;
}
