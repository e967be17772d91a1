// The indexing status kept in status.conf.
#ifndef FILEINDEX_STATUS_H
#define FILEINDEX_STATUS_H

#include <fileindex/config.h>

#include <string>

namespace TAVO {
namespace FILEINDEX {

class Status : public Config {
 public:
  Status();
  ~Status() override;

  bool Load() override;
  bool Save() override;
  std::string GetLockPath() const override;
  std::string GetPath() const override;

  // Stores "resume_time".
  bool Pause(long long resume_time);
  // Stores "resume_time" -1.
  bool Resume();
  // "resume_time", -1 when absent; false (argument untouched) when it is not a number.
  bool GetPauseInfo(long long& resume_time);
  // Marks key as updated.
  bool SetUpdated(const std::string& key);
  // Whether key is marked as updated.
  bool IsUpdated(const std::string& key);
  // Adds or removes share in "need_reindex".
  bool ShareSetNeedReindex(const std::string& share, bool set);
  // Whether share is a member of "need_reindex".
  bool ShareIsNeedReindex(const std::string& share);
  // Adds or removes share in "no_space"; the first marking notifies the administrators.
  bool ShareSetNoSpace(const std::string& share, bool set);
  // Whether share is a member of "no_space".
  bool ShareIsNoSpace(const std::string& share);
};

}  // namespace FILEINDEX
}  // namespace TAVO

#endif
