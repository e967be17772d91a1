// Read-only questions about the indexed folders: is a path indexed, does a directory
// contain an indexed folder, does a share hold one; the list and one folder's record.
#include <fileindex/fileindex_c.h>
#include <fileindex/folders.h>
#include <fileindex/index_mgr.h>
#include <fileindex/utils.h>

#include "internal/folder_conf_view.h"
#include "internal/full_path_resolver.h"
#include "internal/json_io.h"
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

// The folders' paths as a load of folder.conf lists them, read by the fast reader
// without building the document or the folders, each resolved to its full path as the
// load resolves it: the same platform calls, error codes and log lines, in the same
// order. Nothing is kept between calls.
struct QuickFolders {
  std::vector<std::string> paths;
  std::vector<std::string> fulls;  // when asked for; empty for a share that is not known

  // False when the fast reader leaves the file to the load (a missing file included).
  bool Read(bool wantFulls) {
    const std::string confPath = Folders().GetPath();
    std::string text;
    std::vector<internal::FolderConfRecord> records;
    if (!IsFileExist(confPath) || !internal::ReadWholeFile(confPath, text) ||
        !internal::ViewFolderConf(text.data(), text.size(), records))
      return false;
    internal::FullPathResolver resolver;
    paths.reserve(records.size());
    if (wantFulls) fulls.reserve(records.size());
    for (const internal::FolderConfRecord& record : records) {
      paths.emplace_back(record.path.data, record.path.size);
      std::string full;
      resolver.Resolve(full, paths.back());
      if (wantFulls) fulls.push_back(std::move(full));
    }
    return true;
  }
};
}  // namespace

bool IndexMgr::List(std::vector<Folder>& folders) {
  // Readers do not lock: they see folder.conf as it is at this moment.
  Folders config;
  if (!config.Load()) return false;
  return config.List(folders);
}

bool IndexMgr::IsPathIndexed(const std::string& path) {
  QuickFolders quick;
  if (quick.Read(false)) {
    for (const std::string& folder : quick.paths) {
      if (LiesIn(path, folder)) return true;
    }
    return false;
  }
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
  QuickFolders quick;
  if (quick.Read(true)) {
    for (size_t i = 0; i < quick.fulls.size(); ++i) {
      // As Folder::GetFullPath: a path not resolved at load is tried again.
      if (LiesIn(full, quick.fulls[i].empty() ? internal::RetryFullPath(quick.paths[i]) : quick.fulls[i]))
        return true;
    }
    return false;
  }
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
  QuickFolders quick;
  if (quick.Read(false)) {
    for (const std::string& folder : quick.paths) {
      if (LiesIn(folder, path)) return true;
    }
    return false;
  }
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
  QuickFolders quick;
  std::vector<std::string> paths;
  if (quick.Read(false)) {
    paths.swap(quick.paths);
  } else {
    std::vector<Folder> folders;
    if (!List(folders)) return false;
    for (const Folder& folder : folders) paths.push_back(folder.GetPath());
  }
  for (const std::string& path : paths) {
    std::string name;
    if (!GetShareNameByPath(name, path)) {
      FIDX_LOG("Failed to get share name from path: %s", path.c_str());
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
