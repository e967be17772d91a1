// The collection of indexed folders kept in folder.conf.
#ifndef FILEINDEX_FOLDERS_H
#define FILEINDEX_FOLDERS_H

#include <fileindex/config.h>
#include <fileindex/folder.h>

#include <map>
#include <string>
#include <vector>

namespace TAVO {
namespace FILEINDEX {

class Folders : public Config {
 public:
  Folders();
  ~Folders() override;

  // Loads folder.conf; error 8 when it is not a JSON object.
  bool Load() override;
  // Writes every folder in ascending path order.
  bool Save() override;
  std::string GetLockPath() const override;
  std::string GetPath() const override;

  // The record of the folder with exactly this path; error 4 when there is none.
  bool Get(Json::Value& result, const std::string& path);
  // Every folder in ascending path order.
  bool List(std::vector<Folder>& out);
  // The folders of one share (all when share is empty); unresolvable ones are left out.
  bool List(std::vector<Folder>& out, const std::string& share);
  // One sorted page {"total","offset","folder"} with the requested additional fields.
  bool List(Json::Value& result, unsigned long offset, unsigned long limit,
            const std::string& sort_by, const std::string& sort_direction,
            const Json::Value& additional);
  // Inserts or partially updates a folder; result is the flag-change object.
  bool Upsert(Json::Value& result, const Json::Value& folder);
  // Removes a folder; result is {path: flag-change object}.
  bool Delete(Json::Value& result, const std::string& path);

 private:
  std::map<std::string, Folder> m_mapFolders;
};

}  // namespace FILEINDEX
}  // namespace TAVO

#endif
