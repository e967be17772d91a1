// Operations on the set of indexed folders and their consequences.
#ifndef FILEINDEX_INDEX_MGR_H
#define FILEINDEX_INDEX_MGR_H

#include <fileindex/folder.h>
#include <json/json.h>

#include <string>
#include <vector>

namespace TAVO {
namespace FILEINDEX {

class IndexMgr {
 public:
  // Adds or changes folders (an array of records) and applies every side effect.
  static bool Upsert(const Json::Value& folders);
  // Alias of Upsert.
  static bool Set(const Json::Value& folders);
  // Alias of Upsert.
  static bool Add(const Json::Value& folders);
  // Rebuilds the notification daemon's watch list of a share from folder.conf.
  static bool UpsertTAVotifydCfg(const std::string& share);
  // Removes the notification daemon's watch list of a share.
  static bool DeleteTAVotifydCfg(const std::string& share);

  // Removes folders (an array of paths) and cleans up after them.
  static bool Delete(const Json::Value& paths);
  // Queues a reindex event for every path of the array.
  static bool Reindex(const Json::Value& paths);
  // Queues a settings event for one folder.
  static bool Update(const std::string& path, const Json::Value& setting);
  // Removes a share's queue files and index database.
  static bool CleanShareIndexData(const std::string& share);

  // Forgets every folder of a removed share.
  static bool ShareRemove(const std::string& share);
  // Moves the folders of a renamed share to its new name.
  static bool ShareRename(const std::string& old_share, const std::string& new_share);
  // Stops the daemon's worker of a share and drops its watch list.
  static bool SharePause(const std::string& share);
  // Restores the watch list of a share and revives its worker.
  static bool ShareResume(const std::string& share);

  // Whether the share path is an indexed folder or lies below one.
  static bool IsPathIndexed(const std::string& path);
  static bool IsPathIndexed(const std::string& path, const std::vector<Folder>& folders);
  // Whether the full path is an indexed folder or lies below one.
  static bool IsFullPathIndexed(const std::string& full);
  static bool IsFullPathIndexed(const std::string& full, const std::vector<Folder>& folders);
  // Whether an indexed folder is the share path itself or lies below it.
  static bool IsPathContainIndexed(const std::string& path);
  static bool IsPathContainIndexed(const std::string& path, const std::vector<Folder>& folders);
  // Whether any indexed folder belongs to the share.
  static bool IsShareIndexed(const std::string& share);
  // Every indexed folder, from folder.conf.
  static bool List(std::vector<Folder>& folders);
  // One sorted page of folders with additional fields.
  static bool List(Json::Value& result, unsigned long offset, unsigned long limit,
                   const std::string& sort_by, const std::string& sort_direction,
                   const Json::Value& additional);
  // One folder's record, read under the configuration lock.
  static bool Get(Json::Value& result, const std::string& path);
};

}  // namespace FILEINDEX
}  // namespace TAVO

#endif
