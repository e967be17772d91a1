// File-system facts from the real file system, and the quota check.
#include <sys/stat.h>
#include <sys/statfs.h>
#include <sys/statvfs.h>
#include <sys/sysmacros.h>
#include <tavo/platform.h>

#include <cerrno>
#include <climits>
#include <cstdio>
#include <cstdlib>
#include <cstring>
#include <sstream>
#include <string>

#include "host_common.h"
#include "host_shares.h"

namespace {

// statfs magic numbers.
const unsigned long kNfs = 0x6969;
const unsigned long kSmb = 0x517B;
const unsigned long kCifs = 0xFF534D42;
const unsigned long kSmb2 = 0xFE534D42;
const unsigned long kCoda = 0x73757245;
const unsigned long kAfs = 0x5346414F;
const unsigned long kCeph = 0x00C36400;
const unsigned long k9p = 0x01021997;
const unsigned long kFuse = 0x65735546;
const unsigned long kIso9660 = 0x9660;
const unsigned long kUdf = 0x15013346;
const unsigned long kSquashfs = 0x73717368;

// A type code is the magic number folded into a non-negative int (-1 stays "unknown").
int TypeCode(unsigned long magic) { return static_cast<int>(magic & 0x7fffffffUL); }

// FUSE carries local and network file systems alike under one magic number; these
// subtypes (the "fuse.<name>" of the mount table) reach over the network. They get a
// type code of their own, which no kernel magic number uses.
const int kFuseNetworkType = 0x7FFF0001;
const char* const kFuseNetworkSubtypes[] = {"sshfs",     "s3fs",   "rclone",     "gcsfuse",  "glusterfs",
                                            "curlftpfs", "davfs",  "gvfsd-fuse", "smbnetfs", "afpfs",
                                            "cephfs",    "goofys", "blobfuse",   "blobfuse2"};

std::string Unescape(const std::string& field) {
  std::string out;
  for (size_t i = 0; i < field.size(); ++i) {
    if (field[i] == '\\' && i + 3 < field.size()) {
      int value = 0;
      bool octal = true;
      for (size_t k = 1; k <= 3; ++k) {
        char c = field[i + k];
        if (c < '0' || c > '7') octal = false;
        value = value * 8 + (c - '0');
      }
      if (octal) {
        out += static_cast<char>(value);
        i += 3;
        continue;
      }
    }
    out += field[i];
  }
  return out;
}

struct MountEntry {
  dev_t dev = 0;
  std::string mountPoint;
  std::string fsType;
};

// Calls visit for every entry of the mount table until it returns true.
template <typename Visit>
bool ForEachMount(Visit visit) {
  std::string text;
  if (!tavo_host::ReadFile("/proc/self/mountinfo", text)) return false;
  std::istringstream lines(text);
  std::string line;
  while (std::getline(lines, line)) {
    std::istringstream fields(line);
    std::string id, parent, majMin, root, mountPoint, field;
    if (!(fields >> id >> parent >> majMin >> root >> mountPoint)) continue;
    while (fields >> field && field != "-") {
    }
    MountEntry entry;
    if (!(fields >> entry.fsType)) continue;
    unsigned major = 0, minor = 0;
    if (std::sscanf(majMin.c_str(), "%u:%u", &major, &minor) != 2) continue;
    entry.dev = makedev(major, minor);
    entry.mountPoint = Unescape(mountPoint);
    if (visit(entry)) return true;
  }
  return false;
}

bool IsNetworkFuse(const char* path) {
  struct stat st;
  if (::stat(path, &st) != 0) return false;
  return ForEachMount([&](const MountEntry& mount) {
    if (mount.dev != st.st_dev || mount.fsType.compare(0, 5, "fuse.") != 0) return false;
    const std::string subtype = mount.fsType.substr(5);
    for (const char* network : kFuseNetworkSubtypes) {
      if (subtype == network) return true;
    }
    return false;
  });
}

std::string Parent(const std::string& path) {
  std::string p = path;
  while (p.size() > 1 && p.back() == '/') p.pop_back();
  std::string::size_type slash = p.rfind('/');
  if (slash == std::string::npos) return ".";
  if (slash == 0) return "/";
  return p.substr(0, slash);
}

bool InSpecialTopDirectory(const char* full, const char* name) {
  tavo_host::ShareInfo share;
  return tavo_host::FindShareOfPath(full, share) && tavo_host::IsUnder(full, share.path + "/" + name);
}

}  // namespace

extern "C" int TAVOGetFSType(const char* szPath, int /*flag*/) {
  struct statfs st;
  if (szPath == nullptr) {
    TAVO_HOST_SET_ERROR(tavo_host::kErrBadArgument);
    return -1;
  }
  if (::statfs(szPath, &st) != 0) {
    TAVO_HOST_SET_ERROR(tavo_host::kErrSystem);
    return -1;
  }
  unsigned long magic = static_cast<unsigned long>(st.f_type) & 0xffffffffUL;
  if (magic == kFuse && IsNetworkFuse(szPath)) return kFuseNetworkType;
  return TypeCode(magic);
}

extern "C" int TAVOFSIsRemoteFS(int fsType) {
  if (fsType == kFuseNetworkType) return 1;
  for (unsigned long magic : {kNfs, kSmb, kCifs, kSmb2, kCoda, kAfs, kCeph, k9p}) {
    if (TypeCode(magic) == fsType) return 1;
  }
  return 0;
}

extern "C" int TAVOFSIsImageFS(int fsType) {
  for (unsigned long magic : {kIso9660, kUdf, kSquashfs}) {
    if (TypeCode(magic) == fsType) return 1;
  }
  return 0;
}

// 1 when the directory is on another device than its parent, or is listed as a mount
// point itself (a bind mount within one file system keeps the device); 0 otherwise.
extern "C" int TAVOFSDirIsMntPoint(const char* szPath) {
  if (szPath == nullptr) {
    TAVO_HOST_SET_ERROR(tavo_host::kErrBadArgument);
    return -1;
  }
  struct stat self, parent;
  if (::lstat(szPath, &self) != 0) {
    TAVO_HOST_SET_ERROR(tavo_host::kErrSystem);
    return -1;
  }
  if (!S_ISDIR(self.st_mode)) return 0;
  if (::stat(Parent(szPath).c_str(), &parent) != 0) {
    TAVO_HOST_SET_ERROR(tavo_host::kErrSystem);
    return -1;
  }
  if (self.st_dev != parent.st_dev || self.st_ino == parent.st_ino) return 1;
  char resolved[PATH_MAX];
  if (::realpath(szPath, resolved) == nullptr) return 0;
  const std::string canonical = resolved;
  return ForEachMount([&](const MountEntry& mount) { return mount.mountPoint == canonical; }) ? 1 : 0;
}

// The "#snapshot" directory at the top of a share holds snapshots.
extern "C" int VLIBFhsPathInSnapshot(const char* szPath, int* pblInSnapshot) {
  if (szPath == nullptr || pblInSnapshot == nullptr) {
    TAVO_HOST_SET_ERROR(tavo_host::kErrBadArgument);
    return -1;
  }
  *pblInSnapshot = InSpecialTopDirectory(szPath, "#snapshot") ? 1 : 0;
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

// The volume's free space (with the blocks reserved for root when uid is 0), and the
// share's own "free_bytes" quota when the share table gives one.
extern "C" int TAVOQuotaIsEnough(unsigned int uid, const char* szPath, unsigned long long cbSize) {
  struct statvfs st;
  if (szPath == nullptr) {
    TAVO_HOST_SET_ERROR(tavo_host::kErrBadArgument);
    return 0;
  }
  if (::statvfs(szPath, &st) != 0) {
    TAVO_HOST_SET_ERROR(tavo_host::kErrSystem);
    return 0;
  }
  unsigned long long blocks = uid == 0 ? st.f_bfree : st.f_bavail;
  if (blocks * st.f_frsize < cbSize) {
    TAVO_HOST_SET_ERROR(tavo_host::kErrNoSpace);
    return 0;
  }
  tavo_host::ShareInfo share;
  if (tavo_host::FindShareOfPath(szPath, share) && share.freeBytes >= 0 &&
      static_cast<unsigned long long>(share.freeBytes) < cbSize) {
    TAVO_HOST_SET_ERROR(tavo_host::kErrQuotaExceeded);
    return 0;
  }
  return 1;
}
