// Share and path resolution, and the small string, file and JSON helpers.
#include <fileindex/error.h>
#include <fileindex/utils.h>
#include <sys/stat.h>
#include <tavo/platform.h>

#include <cstring>

#include "internal/log.h"
#include "internal/share_record.h"

namespace TAVO {
namespace FILEINDEX {

namespace {
const char kLogUnit[] = "utils";
const int kShareNameSize = 492;
const int kFullPathSize = 4096;

// Index of the slash that ends the share component; the first character is skipped
// unexamined, whatever it is.
std::string::size_type ShareComponentEnd(const std::string& path) { return path.find('/', 1); }
}  // namespace

bool GetShareNameByPath(std::string& share, const std::string& path) {
  if (path.empty()) return false;
  std::string::size_type end = ShareComponentEnd(path);
  share = (end == std::string::npos) ? path.substr(1) : path.substr(1, end - 1);
  return true;
}

bool GetFullPath(std::string& full, const std::string& path) {
  std::string share;
  if (!GetShareNameByPath(share, path)) {
    FIDX_LOG("GetShareNameByPath failed, path=%s", path.c_str());
    return false;
  }
  internal::ShareRecord record;
  if (internal::GetShareRecord(share.c_str(), record) < 0) {
    ErrorHandler::SetError(FILEINDEX_ERR_BAD_PATH);
    return false;
  }
  // The share's directory is named after the share, so the full path is the volume
  // part of that directory followed by the whole share path.
  std::string volume = record->szPath != nullptr ? record->szPath : "";
  std::string::size_type slash = volume.rfind('/');
  if (slash != std::string::npos) volume.erase(slash);
  full = volume + path;
  return true;
}

bool GetShareNamePathByFullPath(std::string& share, std::string& sharePath, const std::string& full) {
  char name[kShareNameSize];
  char dir[kFullPathSize];
  std::memset(name, 0, sizeof(name));
  std::memset(dir, 0, sizeof(dir));
  if (TAVOShareNamePathGet(full.c_str(), name, sizeof(name), dir, sizeof(dir)) < 0) {
    FIDX_LOG("TAVOShareNamePathGet failed, path=%s", full.c_str());
    ErrorHandler::SetError(FILEINDEX_ERR_BAD_PATH);
    return false;
  }
  // The platform may fill a buffer to its end; never read past it.
  share.assign(name, strnlen(name, sizeof(name)));
  sharePath.assign(dir, strnlen(dir, sizeof(dir)));
  return true;
}

std::string ReplaceShareName(const std::string& path, const std::string& share) {
  if (path.empty()) return std::string();
  std::string::size_type end = ShareComponentEnd(path);
  if (end == std::string::npos) return "/" + share;
  return "/" + share + path.substr(end);
}

bool StringStartWith(const std::string& s, const std::string& prefix) {
  if (s.size() < prefix.size()) return false;
  return std::strncmp(s.c_str(), prefix.c_str(), prefix.size()) == 0;
}

namespace {
bool LstatIsType(const std::string& path, mode_t type) {
  struct stat st;
  std::memset(&st, 0, sizeof(st));
  if (::lstat(path.c_str(), &st) != 0) return false;
  return (st.st_mode & S_IFMT) == type;
}
}  // namespace

bool IsDirExist(const std::string& path) { return LstatIsType(path, S_IFDIR); }

bool IsFileExist(const std::string& path) { return LstatIsType(path, S_IFREG); }

bool RetrieveStringFromJsonObj(std::string& out, const std::string& key, const Json::Value& obj) {
  if (!obj.isObject() || !obj.isMember(key)) return false;
  const Json::Value& member = obj[key];
  if (!member.isString()) return false;
  out = member.asString();
  return true;
}

bool RetrieveBoolFromJsonObj(bool& out, const std::string& key, const Json::Value& obj) {
  if (!obj.isObject() || !obj.isMember(key)) return false;
  const Json::Value& member = obj[key];
  if (!member.isBool()) return false;
  out = member.asBool();
  return true;
}

}  // namespace FILEINDEX
}  // namespace TAVO
