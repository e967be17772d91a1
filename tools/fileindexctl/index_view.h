// What the indexing service has made of the configured folders: searches over the
// per-share indexes, and the figures `status` shows (entries indexed, events pending).
#ifndef FILEINDEXCTL_INDEX_VIEW_H
#define FILEINDEXCTL_INDEX_VIEW_H

#include <content.h>
#include <fileindex/folder.h>
#include <json/json.h>
#include <store.h>

#include <cstdint>
#include <map>
#include <string>
#include <vector>

namespace fileindexctl {

struct IndexedShare {
  std::string name;
  std::string directory;                            // full path of the share
  std::map<std::string, std::string> folderByPath;  // folder share path -> path relative to the share
};

// A share's queue file and index directory (empty when the share is unknown).
std::string QueuePathOf(const std::string& share);
std::string DatabaseDirectoryOf(const std::string& share);

// The shares holding configured folders, by name.
std::map<std::string, IndexedShare> IndexedShares(const std::vector<TAVO::FILEINDEX::Folder>& folders);

struct SearchHit {
  std::string share;
  std::string path;  // share path: "/" + share + "/" + path in the share
  fileindex_store::Hit hit;
  bool hasContent = false;  // what is inside the file, once extracted
  fileindex_store::Content content;
  std::string snippet;  // when text was searched: its matching words marked as the store marks them
};

// Searches each share's index (newest first, at most query.names.limit in all); hits in
// folders that are no longer configured are left out. Shares without an index yet are
// named in `unavailable` with the reason.
void SearchShares(const std::map<std::string, IndexedShare>& shares,
                  const fileindex_store::ContentQuery& query, std::vector<SearchHit>& hits,
                  std::map<std::string, std::string>& unavailable);

struct ShareFigures {
  bool indexAvailable = false;
  std::uint64_t indexed = 0;
  std::uint64_t pending = 0;  // events in the queue and its work-in-progress companion
  std::map<std::string, std::uint64_t> indexedByFolder;  // folder share path -> entries
  std::map<std::string, std::uint64_t> pendingByFolder;  // folder share path -> events inside it
};

ShareFigures FiguresOf(const IndexedShare& share);

// The figures of every share with configured folders, for `status`.
struct IndexFigures {
  std::map<std::string, IndexedShare> shares;
  std::map<std::string, ShareFigures> figures;
};
IndexFigures CollectIndexFigures();
// Adds "indexed" and "pending" to a folder's status item (null when the index cannot be read).
void AddFolderFigures(const IndexFigures& figures, const std::string& folder, Json::Value& item);
// {"photo": {"indexed": N or null, "pending": N}, ...}
Json::Value ShareFiguresJson(const IndexFigures& figures);
void PrintShareFigures(const Json::Value& shares);
// A count, or "-" for null.
std::string FigureText(const Json::Value& figure);

}  // namespace fileindexctl

#endif
