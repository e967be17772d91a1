// One indexed folder and its JSON record.
#include <fileindex/folder.h>
#include <fileindex/utils.h>

#include "internal/full_path_resolver.h"
#include "internal/log.h"

namespace TAVO {
namespace FILEINDEX {

namespace {
const char kLogUnit[] = "folder";
// The source line of this message is fixed: log watchers match it.
const int kRetryFullPathLine = 61;
}  // namespace

namespace internal {

std::string RetryFullPath(const std::string& path) {
  std::string full;
  if (!::TAVO::FILEINDEX::GetFullPath(full, path)) {
    FIDX_LOG_AT(kRetryFullPathLine, "Failed to get full path from %s", path.c_str());
    return std::string();
  }
  return full;
}

}  // namespace internal

Folder::Folder() : m_blDocument(false), m_blAudio(false), m_blVideo(false), m_blPhoto(false) {}

bool Folder::Load(const std::string& path, const Json::Value& record) {
  m_strPath = path;
  // A member that is absent or of the wrong type keeps its current value.
  RetrieveStringFromJsonObj(m_strName, "name", record);
  RetrieveBoolFromJsonObj(m_blDocument, "document", record);
  RetrieveBoolFromJsonObj(m_blAudio, "audio", record);
  RetrieveBoolFromJsonObj(m_blVideo, "video", record);
  RetrieveBoolFromJsonObj(m_blPhoto, "photo", record);
  return ::TAVO::FILEINDEX::GetFullPath(m_strFullPath, m_strPath);
}

bool Folder::Reload(const std::string& path, const Json::Value& record) {
  // The full path is left alone: Load resolves it again.
  m_strName.clear();
  m_strPath.clear();
  m_blDocument = false;
  m_blAudio = false;
  m_blVideo = false;
  m_blPhoto = false;
  return Load(path, record);
}

Json::Value Folder::asJson() const {
  Json::Value record(Json::objectValue);
  record["path"] = m_strPath;
  record["name"] = m_strName;
  record["document"] = m_blDocument;
  record["audio"] = m_blAudio;
  record["video"] = m_blVideo;
  record["photo"] = m_blPhoto;
  return record;
}

bool Folder::AddToJson(Json::Value& container) const {
  if (!container.isObject()) return false;
  container[m_strPath] = asJson();
  return true;
}

std::string Folder::GetFullPath() const {
  if (!m_strFullPath.empty()) return m_strFullPath;
  return internal::RetryFullPath(m_strPath);
}

bool Folder::SetPath(const std::string& path) {
  m_strPath = path;
  return ::TAVO::FILEINDEX::GetFullPath(m_strFullPath, m_strPath);
}

}  // namespace FILEINDEX
}  // namespace TAVO
