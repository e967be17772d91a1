// The collection of indexed folders kept in folder.conf.
#include <fileindex/error.h>
#include <fileindex/folders.h>
#include <fileindex/utils.h>

#include "internal/folder_conf_view.h"
#include "internal/full_path_resolver.h"
#include "internal/json_io.h"
#include "internal/log.h"
#include "internal/sysroot.h"

namespace TAVO {
namespace FILEINDEX {

namespace {
const char kLogUnit[] = "folders";
const std::size_t kMaxFolders = 1000;
const char* const kFlags[] = {"document", "audio", "video", "photo"};

// Which file-type flags differ between the settings that governed a path before a change
// and those after it; a side without settings counts as a change of every flag.
Json::Value FlagChanges(const Json::Value& before, const Json::Value& after) {
  Json::Value changes(Json::objectValue);
  for (const char* flag : kFlags) {
    if (!before.isMember(flag) || !after.isMember(flag)) {
      changes[flag] = true;
    } else {
      changes[flag] = before[flag].asBool() != after[flag].asBool();
    }
  }
  return changes;
}
}  // namespace

Folders::Folders() {}

Folders::~Folders() { m_mapFolders.clear(); }

std::string Folders::GetLockPath() const { return internal::SystemPath("/tmp/fileidx_cfg_folder.lock"); }

std::string Folders::GetPath() const { return internal::SystemPath("/usr/tavo/etc/fileindex/folder.conf"); }

bool Folders::Load() {
  // Each record is read as Folder::Load does, except that the full paths come from one
  // resolver for the whole file, so a share holding many folders is looked up once.
  internal::FullPathResolver resolver;
  // The strings start empty; the flags start as the previous record left them.
  bool flags[4] = {false, false, false, false};  // document, audio, video, photo
  auto add = [&](std::string path, std::string name) {
    Folder folder;
    folder.m_strPath = std::move(path);
    folder.m_strName = std::move(name);
    folder.m_blDocument = flags[0];
    folder.m_blAudio = flags[1];
    folder.m_blVideo = flags[2];
    folder.m_blPhoto = flags[3];
    // A folder whose share cannot be resolved is kept, with an empty full path.
    resolver.Resolve(folder.m_strFullPath, folder.m_strPath);
    // Members come in ascending key order, so the end is the right hint.
    const std::string key = folder.m_strPath;
    m_mapFolders.emplace_hint(m_mapFolders.end(), key, std::move(folder));
  };

  // folder.conf as the library writes it is read without building the document; every
  // other text (and a missing file) is left to the strict parse, the authority.
  const std::string path = GetPath();
  std::string text;
  std::vector<internal::FolderConfRecord> records;
  if (IsFileExist(path) && internal::ReadWholeFile(path, text) &&
      internal::ViewFolderConf(text.data(), text.size(), records)) {
    for (const internal::FolderConfRecord& record : records) {
      for (int i = 0; i < 4; ++i) {
        if (record.flags[i] >= 0) flags[i] = record.flags[i] != 0;
      }
      add(std::string(record.path.data, record.path.size),
          record.name != nullptr ? std::string(record.name, record.nameSize) : std::string());
    }
    return true;
  }

  if (!LoadJson()) return false;
  if (!m_jsDocument.isObject()) {
    FIDX_LOG("Malformed folders: %s", internal::JsonToString(m_jsDocument).c_str());
    ErrorHandler::SetError(FILEINDEX_ERR_MALFORMED_CONFIG);
    return false;
  }
  for (Json::Value::const_iterator it = m_jsDocument.begin(); it != m_jsDocument.end(); ++it) {
    const Json::Value& record = *it;
    std::string name;
    RetrieveStringFromJsonObj(name, "name", record);
    for (int i = 0; i < 4; ++i) RetrieveBoolFromJsonObj(flags[i], kFlags[i], record);
    add(it.name(), std::move(name));
  }
  return true;
}

bool Folders::Save() {
  m_jsDocument = Json::Value(Json::objectValue);
  for (const auto& entry : m_mapFolders) {
    if (!entry.second.AddToJson(m_jsDocument)) return false;
  }
  return SaveJson();
}

bool Folders::Get(Json::Value& result, const std::string& path) {
  auto it = m_mapFolders.find(path);
  if (it == m_mapFolders.end()) {
    FIDX_LOG("No such folder: %s", path.c_str());
    ErrorHandler::SetError(FILEINDEX_ERR_NO_SUCH_FOLDER);
    return false;
  }
  result = it->second.asJson();
  return true;
}

bool Folders::List(std::vector<Folder>& out) { return List(out, ""); }

bool Folders::List(std::vector<Folder>& out, const std::string& share) {
  out.clear();
  for (const auto& entry : m_mapFolders) {
    if (!share.empty()) {
      std::string name;
      if (!GetShareNameByPath(name, entry.second.GetPath()) || name != share) continue;
    }
    out.push_back(entry.second);
  }
  return true;
}

bool Folders::Upsert(Json::Value& result, const Json::Value& folder) {
  std::vector<Folder> before;
  if (!List(before)) return false;

  std::string path;
  std::string full;
  if (!RetrieveStringFromJsonObj(path, "path", folder) || !GetFullPath(full, path)) {
    FIDX_LOG("Bad param: %s", internal::JsonToString(folder).c_str());
    ErrorHandler::SetError(FILEINDEX_ERR_BAD_PARAM);
    return false;
  }

  Json::Value upserted;
  auto it = m_mapFolders.find(path);
  if (it == m_mapFolders.end()) {
    Folder added;
    added.Reload(path, folder);
    upserted = added.asJson();
    m_mapFolders.emplace(path, std::move(added));
    // The new entry stays in memory; the caller does not save after this failure.
    if (m_mapFolders.size() > kMaxFolders) {
      FIDX_LOG("Exceed max folder size");
      ErrorHandler::SetError(FILEINDEX_ERR_EXCEED_MAX_FOLDER);
      return false;
    }
  } else {
    // A partial update: members the request lacks keep their stored values.
    Folder updated = it->second;
    updated.Load(path, folder);
    upserted = updated.asJson();
    it->second = std::move(updated);
  }

  result = FlagChanges(GetMostSuitableCfg(before, full), upserted);
  return true;
}

bool Folders::Delete(Json::Value& result, const std::string& path) {
  std::vector<Folder> before;
  if (!List(before)) return false;
  // An unknown path is no error: the result then compares a path's settings with
  // themselves.
  m_mapFolders.erase(path);
  std::vector<Folder> after;
  if (!List(after)) return false;

  std::string full;
  if (!GetFullPath(full, path)) return true;
  Json::Value wrapped(Json::objectValue);
  wrapped[path] = FlagChanges(GetMostSuitableCfg(before, full), GetMostSuitableCfg(after, full));
  result = wrapped;
  return true;
}

}  // namespace FILEINDEX
}  // namespace TAVO
