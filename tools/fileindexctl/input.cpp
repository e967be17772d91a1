#include "input.h"

#include <fileindex/utils.h>
#include <sys/stat.h>
#include <tavo/platform.h>

#include <cerrno>
#include <climits>
#include <cstdint>
#include <cstdio>
#include <cstdlib>
#include <cstring>
#include <ctime>
#include <memory>
#include <vector>

namespace fileindexctl {

namespace FI = TAVO::FILEINDEX;

namespace {

bool ValidUtf8(const std::string& text) {
  static const uint32_t kMin[] = {0, 0x80, 0x800, 0x10000};
  size_t i = 0;
  while (i < text.size()) {
    unsigned char c = static_cast<unsigned char>(text[i]);
    size_t extra = c < 0x80             ? 0
                   : (c & 0xE0) == 0xC0 ? 1
                   : (c & 0xF0) == 0xE0 ? 2
                   : (c & 0xF8) == 0xF0 ? 3
                                        : 4;
    if (extra == 4 || (extra > 0 && i + extra >= text.size())) return false;
    uint32_t code = extra == 0 ? c : c & (0x3F >> extra);
    for (size_t k = 1; k <= extra; ++k) {
      unsigned char next = static_cast<unsigned char>(text[i + k]);
      if ((next & 0xC0) != 0x80) return false;
      code = (code << 6) | (next & 0x3F);
    }
    if (code < kMin[extra] || code > 0x10FFFF || (code >= 0xD800 && code <= 0xDFFF)) return false;
    i += extra + 1;
  }
  return true;
}

using ShareRecord = std::unique_ptr<TAVOSHARE, void (*)(PTAVOSHARE)>;

ShareRecord GetShare(const std::string& name) {
  PTAVOSHARE record = nullptr;
  if (TAVOShareGet(name.c_str(), &record) < 0) record = nullptr;
  return ShareRecord(record, &TAVOShareFree);
}

}  // namespace

bool NormaliseSharePath(const std::string& path, std::string& out, std::string& why) {
  if (!ValidUtf8(path)) {
    why = "not valid UTF-8";
    return false;
  }
  for (unsigned char c : path) {
    if (c < 0x20 || c == 0x7F) {
      why = "holds a control character";
      return false;
    }
  }
  if (path.empty() || path[0] != '/') {
    why = "a share path starts with \"/\" and the share name (/share/folder)";
    return false;
  }
  std::string normal;
  size_t i = 0;
  while (i < path.size()) {
    while (i < path.size() && path[i] == '/') ++i;
    size_t end = path.find('/', i);
    if (end == std::string::npos) end = path.size();
    std::string component = path.substr(i, end - i);
    if (component == "." || component == "..") {
      why = "holds a \"" + component + "\" component";
      return false;
    }
    if (!component.empty()) normal += "/" + component;
    i = end;
  }
  if (normal.empty()) {
    why = "names no share";
    return false;
  }
  out = normal;
  return true;
}

std::string ShareOf(const std::string& sharePath) {
  std::string::size_type end = sharePath.find('/', 1);
  return sharePath.substr(1, end == std::string::npos ? std::string::npos : end - 1);
}

bool ShareExists(const std::string& name) { return !name.empty() && GetShare(name) != nullptr; }

std::string IndexRule(const std::string& sharePath) {
  const std::string share = ShareOf(sharePath);
  ShareRecord record = GetShare(share);
  std::string full, shareDir;
  if (record == nullptr || !FI::GetFullPath(full, sharePath) || !FI::GetFullPath(shareDir, "/" + share))
    return "no such share";
  // What the library does not look at itself: the folder must be a directory that exists.
  struct stat st;
  if (::lstat(full.c_str(), &st) != 0) return std::strerror(errno);
  char resolved[PATH_MAX];
  if (S_ISLNK(st.st_mode) || (::realpath(full.c_str(), resolved) != nullptr && full != resolved)) {
    std::string target = ::realpath(full.c_str(), resolved) != nullptr ? resolved : "";
    if (target.compare(0, shareDir.size() + 1, shareDir + "/") != 0 && target != shareDir)
      return "a symbolic link leaving the share";
    return "a symbolic link to /" + share + target.substr(shareDir.size());
  }
  if (!S_ISDIR(st.st_mode)) return "not a directory";
  if (FI::CanPathBeIndexed(sharePath)) return "";
  if (share == "surveillance" || share == "NetBackup") return "a share that is never indexed";
  int encrypted = 0, readOnly = 0;
  VLIBShareIsEncryptedGet(record.get(), &encrypted);
  VLIBShareIsReadOnlyGet(record.get(), &readOnly);
  if (encrypted != 0) return "encrypted share";
  if (readOnly != 0) return "read-only share";
  if (full.find("#recycle") != std::string::npos && TAVOShareIsShareRecycle(full.c_str()) != 0)
    return "recycle bin";
  int inSnapshot = 0;
  if (full.find("#snapshot") != std::string::npos && VLIBFhsPathInSnapshot(full.c_str(), &inSnapshot) == 0 &&
      inSnapshot == 1)
    return "snapshot";
  int type = TAVOGetFSType(full.c_str(), 0);
  if (type == -1) return "unknown file system";
  if (TAVOFSIsRemoteFS(type) != 0 || TAVOFSIsImageFS(type) != 0 || type == 12)
    return "remote or image file system";
  if (TAVOFSDirIsMntPoint(full.c_str()) == 1) return "mount point";
  return "refused by the indexing rules";
}

std::string Printable(const std::string& text) {
  const bool utf8 = ValidUtf8(text);
  std::string out;
  for (unsigned char c : text) {
    if (c < 0x20 || c == 0x7F || (c >= 0x80 && !utf8)) {
      char escaped[8];
      std::snprintf(escaped, sizeof(escaped), "\\x%02X", c);
      out += escaped;
    } else {
      out += static_cast<char>(c);
    }
  }
  return out;
}

bool ParsePauseHours(const std::string& text, long long now, int& hours, std::string& why) {
  why = "expected whole hours, \"5h\", \"3d\" or \"1w\"";
  if (text.empty() || text[0] < '0' || text[0] > '9') return false;
  errno = 0;
  char* end = nullptr;
  unsigned long long value = std::strtoull(text.c_str(), &end, 10);
  std::string unit = end;
  unsigned long long factor = unit.empty() || unit == "h" ? 1 : unit == "d" ? 24 : unit == "w" ? 168 : 0;
  if (factor == 0) return false;
  // The end of a pause is kept as a signed 32-bit count of seconds.
  const long long latest = (static_cast<long long>(INT32_MAX) - now) / 3600;
  if (errno == ERANGE || value > static_cast<unsigned long long>(latest) / factor) {
    why = "too long: a pause can last at most " + std::to_string(latest) + " hours (until January 2038)";
    return false;
  }
  hours = static_cast<int>(value * factor);
  return true;
}

bool ParseUntil(const std::string& text, long long now, int& hours, std::string& why) {
  static const char* const kFormats[] = {"%Y-%m-%d %H:%M:%S", "%Y-%m-%d %H:%M", "%Y-%m-%dT%H:%M:%S",
                                         "%Y-%m-%dT%H:%M"};
  std::tm local = {};
  bool parsed = false;
  for (const char* format : kFormats) {
    local = std::tm{};
    const char* end = ::strptime(text.c_str(), format, &local);
    if (end != nullptr && *end == '\0') {
      parsed = true;
      break;
    }
  }
  if (!parsed) {
    why = "expected a local date-time \"YYYY-MM-DD HH:MM\"";
    return false;
  }
  local.tm_isdst = -1;
  std::tm asked = local;
  std::time_t when = std::mktime(&local);
  if (when == static_cast<std::time_t>(-1) || asked.tm_mday != local.tm_mday) {
    why = "no such date";
    return false;
  }
  if (when <= now) {
    why = "that time has passed";
    return false;
  }
  long long rounded = (static_cast<long long>(when) - now + 3599) / 3600;
  return ParsePauseHours(std::to_string(rounded), now, hours, why);
}

}  // namespace fileindexctl
