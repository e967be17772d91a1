// Pause and resume, per-share flags and status reports.
#ifndef FILEINDEX_STATUS_MGR_H
#define FILEINDEX_STATUS_MGR_H

#include <string>

namespace TAVO {
namespace FILEINDEX {

class StatusMgr {
 public:
  // Pauses indexing for whole hours (0: until resumed) and tells the daemon; error 1 if negative.
  static bool Pause(const int& hours);
  // Ends a pause and tells the daemon.
  static bool Resume();
  // The stored pause time: -1 not paused, 0 no end, otherwise the epoch second it ends.
  static bool GetPauseInfo(long long& resume_time);
  static bool SetUpdated(const std::string& key);
  static bool IsUpdated(const std::string& key);
  static bool ShareSetNeedReindex(const std::string& share, bool need);
  static bool ShareIsNeedReindex(const std::string& share);
  static bool ShareSetNoSpace(const std::string& share, bool no_space);
  static bool ShareIsNoSpace(const std::string& share);
  // Clears a share's no-space flag and revives its worker in the daemon.
  static bool ShareRevive(const std::string& share);
  // "finished", "processing" or "paused" for the whole service.
  static bool GetStatus(std::string& status);
  // "finished", "processing", "paused" or "err_no_space" for one folder; never fails.
  static std::string GetFolderStatus(const std::string& path);
};

}  // namespace FILEINDEX
}  // namespace TAVO

#endif
