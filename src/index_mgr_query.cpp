// Read-only questions about the indexed folders: is a path indexed, does a directory
// contain an indexed folder, does a share hold one; the list and one folder's record.
#include <fileindex/fileindex_c.h>
#include <fileindex/folders.h>
#include <fileindex/index_mgr.h>
#include <fileindex/utils.h>

#include "internal/log.h"
#include "internal/scope_exit.h"

namespace TAVO {
namespace FILEINDEX {

namespace {
const char kLogUnit[] = "index_mgr";

// Whether inner + "/" starts with outer + "/": byte-wise, case-sensitive, no
// normalisation, so matches fall on whole path components. Computed without building
// the two strings, since a query compares against every folder.
bool LiesIn(const std::string& inner, const std::string& outer) {
  if (inner.size() < outer.size() || inner.compare(0, outer.size(), outer) != 0) return false;
  return inner.size() == outer.size() || inner[outer.size()] == '/';
}
}  // namespace

bool IndexMgr::List(std::vector<Folder>& folders) {
  // Readers do not lock: they see folder.conf as it is at this moment.
  Folders config;
  if (!config.Load()) return false;
  return config.List(folders);
}

bool IndexMgr::IsPathIndexed(const std::string& path) {
  std::vector<Folder> folders;
  if (!List(folders) || folders.empty()) return false;
  return IsPathIndexed(path, folders);
}

bool IndexMgr::IsPathIndexed(const std::string& path, const std::vector<Folder>& folders) {
  for (const Folder& folder : folders) {
    if (LiesIn(path, folder.GetPath())) return true;
  }
  return false;
}

bool IndexMgr::IsFullPathIndexed(const std::string& full) {
  std::vector<Folder> folders;
  if (!List(folders) || folders.empty()) return false;
  return IsFullPathIndexed(full, folders);
}

bool IndexMgr::IsFullPathIndexed(const std::string& full, const std::vector<Folder>& folders) {
  for (const Folder& folder : folders) {
    if (LiesIn(full, folder.GetFullPath())) return true;
  }
  return false;
}

bool IndexMgr::IsPathContainIndexed(const std::string& path) {
  std::vector<Folder> folders;
  if (!List(folders) || folders.empty()) return false;
  return IsPathContainIndexed(path, folders);
}

bool IndexMgr::IsPathContainIndexed(const std::string& path, const std::vector<Folder>& folders) {
  for (const Folder& folder : folders) {
    if (LiesIn(folder.GetPath(), path)) return true;
  }
  return false;
}

bool IndexMgr::IsShareIndexed(const std::string& share) {
  std::vector<Folder> folders;
  if (!List(folders) || folders.empty()) return false;
  for (const Folder& folder : folders) {
    std::string name;
    if (!GetShareNameByPath(name, folder.GetPath())) {
      FIDX_LOG("Failed to get share name from path: %s", folder.GetPath().c_str());
      continue;
    }
    if (name == share) return true;
  }
  return false;
}

bool IndexMgr::Get(Json::Value& result, const std::string& path) {
  // Unlike the other readers this one waits out writers, through the lock.
  Folders config;
  internal::UnlockOnExit<Folders> unlock(config);
  if (!config.Lock(true)) return false;
  if (!config.Load()) return false;
  return config.Get(result, path);
}

}  // namespace FILEINDEX
}  // namespace TAVO

extern "C" {

int FILEIDXIsFullPathIndexed(const char* full_path) {
  return TAVO::FILEINDEX::IndexMgr::IsFullPathIndexed(std::string(full_path)) ? 1 : 0;
}

int FILEIDXIsPathIndexed(const char* path) {
  return TAVO::FILEINDEX::IndexMgr::IsPathIndexed(std::string(path)) ? 1 : 0;
}

int FILEIDXIsShareIndexed(const char* share) {
  return TAVO::FILEINDEX::IndexMgr::IsShareIndexed(std::string(share)) ? 1 : 0;
}

}  // extern "C"
