// Free functions: paths and shares, indexability rules, daemon I/O, events,
// space checks, migration and the governing folder of a path.
#ifndef FILEINDEX_UTILS_H
#define FILEINDEX_UTILS_H

#include <fileindex/folder.h>
#include <json/json.h>

#include <string>
#include <vector>

struct _tag_TAVOSHARE;

namespace TAVO {
namespace FILEINDEX {

// --- share and path resolution ---
// The share component of a share path (the first character is skipped unexamined).
bool GetShareNameByPath(std::string& share, const std::string& path);
// Share path to full path: the volume of the share's directory followed by the share path.
bool GetFullPath(std::string& full, const std::string& path);
// The share holding a full path and its directory; error 2 when none does.
bool GetShareNamePathByFullPath(std::string& share, std::string& sharePath, const std::string& full);
// The path with its share component replaced.
std::string ReplaceShareName(const std::string& path, const std::string& share);
// Byte-wise prefix test.
bool StringStartWith(const std::string& s, const std::string& prefix);
// Whether the path itself (links not followed) is a directory.
bool IsDirExist(const std::string& path);
// Whether the path itself (links not followed) is a regular file.
bool IsFileExist(const std::string& path);
// obj[key] when obj is an object holding a string there.
bool RetrieveStringFromJsonObj(std::string& out, const std::string& key, const Json::Value& obj);
// obj[key] when obj is an object holding a bool there.
bool RetrieveBoolFromJsonObj(bool& out, const std::string& key, const Json::Value& obj);

// --- indexability rules ---
// Whether a file name is a platform hidden directory or one of the library's own names.
bool IsSystemPreservedFileName(const std::string& name);
// Whether the indexing daemon must skip this full path.
bool IsSkipIndex(const std::string& full);
// Whether folders of this share may be indexed.
bool CanShareBeIndexed(_tag_TAVOSHARE* share);
// Whether this full path may be configured for indexing.
bool CanFullPathBeIndexed(const std::string& full);
// Whether this share path may be configured for indexing.
bool CanPathBeIndexed(const std::string& path);

// --- daemon channel, events, space, migration ---
// Sends {"type": command, "data": data} to the indexing daemon; true when fully written.
bool SendCammandToDaemon(const std::string& command, const Json::Value& data);
// Appends an event to the share's queue unless a pending reindex of the path absorbs it.
bool AddCustomEvent(const int& event, const std::string& full, const Json::Value& data);
// Whether 10 MiB more fit on the share.
bool IsShareSpaceEnough(const std::string& share);
// Raises the administrators' out-of-space notification.
bool NotifyNoSpace();
// Brings services, watch lists and queues into line with an existing folder.conf.
bool Updater_vem60_beta2();
// The record of the folder governing a full path (the last match wins); {} when none.
Json::Value GetMostSuitableCfg(std::vector<Folder> folders, const std::string& path);

}  // namespace FILEINDEX
}  // namespace TAVO

#endif
