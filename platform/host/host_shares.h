// The host platform's share table.
#ifndef TAVO_HOST_SHARES_H
#define TAVO_HOST_SHARES_H

#include <json/json.h>

#include <string>
#include <vector>

namespace tavo_host {

struct ShareInfo {
  std::string name;
  std::string path;  // rooted
  bool readOnly = false;
  bool encrypted = false;
  bool encryption = false;
  bool recycleBin = false;
};

std::string ShareTablePath();
bool LoadShares(std::vector<ShareInfo>& out);
bool FindShare(const std::string& name, ShareInfo& out);
// The share whose directory is the longest whole-component prefix of full.
bool FindShareOfPath(const std::string& full, ShareInfo& out);
bool NameMatchesDirectory(const ShareInfo& share);

}  // namespace tavo_host

#endif
