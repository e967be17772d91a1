// The host platform's share table.
#ifndef TAVO_HOST_SHARES_H
#define TAVO_HOST_SHARES_H

#include <cstdint>
#include <string>
#include <vector>

namespace tavo_host __attribute__((visibility("hidden"))) {

  struct ShareInfo {
    std::string name;
    std::string path;  // rooted, without a trailing slash
    bool readOnly = false;
    bool encrypted = false;
    bool encryption = false;
    bool recycleBin = false;
    int64_t freeBytes = -1;  // the share's quota of free space; -1 for none
  };

  std::string ShareTablePath();
  // The table, re-read only when the file changed. Sets the error channel on failure.
  bool LoadShares(std::vector<ShareInfo> & out);
  bool FindShare(const std::string& name, ShareInfo& out);
  // The share whose directory is the longest whole-component prefix of full.
  bool FindShareOfPath(const std::string& full, ShareInfo& out);
  // Whether full is dir itself or lies below it, on whole components.
  bool IsUnder(const std::string& full, const std::string& dir);
  // The library makes full paths from a share's volume and its name, so the directory's
  // last component must be the share's name.
  bool NameMatchesDirectory(const ShareInfo& share);

}  // namespace )

#endif
