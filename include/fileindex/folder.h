// One indexed folder: share path, display name and four file-type flags.
#ifndef FILEINDEX_FOLDER_H
#define FILEINDEX_FOLDER_H

#include <json/json.h>

#include <string>

namespace TAVO {
namespace FILEINDEX {

class Folder {
 public:
  Folder();

  // Sets the path, reads "name" and the flags present with the right type, resolves the
  // full path; returns whether the full path resolved.
  bool Load(const std::string& path, const Json::Value& record);
  // Clears every member, then Load().
  bool Reload(const std::string& path, const Json::Value& record);
  // The record {"path","name","document","audio","video","photo"}.
  Json::Value asJson() const;
  // The record plus "additional" with the requested computed fields; always the record.
  Json::Value asJson(const Json::Value& additional) const;
  // Stores asJson() under the path in an object container; false for a non-object.
  bool AddToJson(Json::Value& container) const;
  // The stored full path, or a fresh resolution of the path while none is stored.
  std::string GetFullPath() const;
  // Sets the path and resolves the full path again.
  bool SetPath(const std::string& path);
  // One computed field ("status" or "is_valid"); false and error 1 for another name.
  bool GetAdditional(Json::Value& out, const std::string& name) const;
  // Several computed fields from an array of names; false and error 1 for a bad argument.
  bool GetAdditional(Json::Value& out, const Json::Value& names) const;

  const std::string& GetPath() const { return m_strPath; }
  const std::string& GetName() const { return m_strName; }
  bool IsDocument() const { return m_blDocument; }
  bool IsAudio() const { return m_blAudio; }
  bool IsVideo() const { return m_blVideo; }
  bool IsPhoto() const { return m_blPhoto; }

 private:
  // The collection loads many records at once and resolves each share only once.
  friend class Folders;

  std::string m_strFullPath;
  std::string m_strPath;
  std::string m_strName;
  bool m_blDocument;
  bool m_blAudio;
  bool m_blVideo;
  bool m_blPhoto;
};

}  // namespace FILEINDEX
}  // namespace TAVO

#endif
