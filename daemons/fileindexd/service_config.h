// What fileindexd serves, as the library says it: the indexed folders grouped by share,
// with each share's directory, queue and database locations.
#ifndef FILEINDEXD_SERVICE_CONFIG_H
#define FILEINDEXD_SERVICE_CONFIG_H

#include <fileindex/folder.h>

#include <map>
#include <string>
#include <vector>

namespace fileindexd {

struct FolderFlags {
  bool document = false, audio = false, video = false, photo = false;
  bool operator==(const FolderFlags& o) const {
    return document == o.document && audio == o.audio && video == o.video && photo == o.photo;
  }
};

struct ShareConfig {
  std::string name;
  std::string directory;  // the share's full path
  std::string queuePath;
  std::string dbDirectory;
  // The share's folders in folder.conf order (which decides the governing folder).
  std::vector<TAVO::FILEINDEX::Folder> folders;
  // Folder path relative to the share directory ("" for the share itself) -> flags.
  std::map<std::string, FolderFlags> flags;
  // Folder share path ("/photo/2019") -> path relative to the share directory.
  std::map<std::string, std::string> relativeByPath;
};

// Reads folder.conf through the library. Shares whose locations cannot be found are left
// out and named in `problems`. False (with error) when folder.conf cannot be read.
bool LoadShareConfigs(std::map<std::string, ShareConfig>& shares, std::vector<std::string>& problems,
                      std::string& error);

// The path of full relative to the share directory; false when full is outside it.
bool RelativeToShare(const std::string& shareDirectory, const std::string& full, std::string& relative);

// Whether the indexing is paused now, and until when (0: until resumed; -1: not paused).
bool ReadPause(bool& paused, long long& resumeTime);

}  // namespace fileindexd

#endif
