#include "index_view.h"

#include <fileindex/fileindex_c.h>
#include <fileindex/index_mgr.h>
#include <fileindex/utils.h>
#include <queue_events.h>

#include <algorithm>
#include <fstream>

namespace fileindexctl {

namespace FI = TAVO::FILEINDEX;

namespace {

bool IsInside(const std::string& path, const std::string& dir) {
  return path == dir ||
         (path.size() > dir.size() && path.compare(0, dir.size(), dir) == 0 && path[dir.size()] == '/');
}

}  // namespace

std::string QueuePathOf(const std::string& share) {
  char buffer[4096] = {0};
  return FILEIDXQueuePathGet(share.c_str(), buffer, sizeof(buffer)) < 0 ? "" : buffer;
}

std::string DatabaseDirectoryOf(const std::string& share) {
  char buffer[4096] = {0};
  return FILEIDXDBPathGet(share.c_str(), buffer, sizeof(buffer)) < 0 ? "" : buffer;
}

std::map<std::string, IndexedShare> IndexedShares(const std::vector<FI::Folder>& folders) {
  std::map<std::string, IndexedShare> shares;
  for (const FI::Folder& folder : folders) {
    std::string name;
    if (!FI::GetShareNameByPath(name, folder.GetPath())) continue;
    IndexedShare& share = shares[name];
    if (share.name.empty()) {
      share.name = name;
      FI::GetFullPath(share.directory, "/" + name);
    }
    const std::string full = folder.GetFullPath();
    if (full == share.directory) {
      share.folderByPath[folder.GetPath()] = "";
    } else if (IsInside(full, share.directory)) {
      share.folderByPath[folder.GetPath()] = full.substr(share.directory.size() + 1);
    }
  }
  return shares;
}

void SearchShares(const std::map<std::string, IndexedShare>& shares,
                  const fileindex_store::ContentQuery& query, std::vector<SearchHit>& hits,
                  std::map<std::string, std::string>& unavailable) {
  for (const auto& entry : shares) {
    const IndexedShare& share = entry.second;
    std::string error;
    auto reader = fileindex_store::ContentReader::Open(DatabaseDirectoryOf(share.name), error);
    std::vector<fileindex_store::ContentHit> found;
    if (!reader || !reader->Search(query, found)) {
      unavailable[share.name] = reader ? reader->LastError() : error;
      continue;
    }
    std::vector<std::string> folders;
    for (const auto& folder : share.folderByPath) folders.push_back(folder.second);
    for (fileindex_store::ContentHit& item : found) {
      fileindex_store::Hit& hit = item.hit;
      if (std::find(folders.begin(), folders.end(), hit.folder) == folders.end()) continue;
      SearchHit result;
      result.share = share.name;
      result.path = "/" + share.name + (hit.path.empty() ? "" : "/" + hit.path);
      result.hit = std::move(hit);
      result.hasContent = item.hasContent;
      result.content = std::move(item.content);
      result.snippet = std::move(item.snippet);
      hits.push_back(std::move(result));
    }
  }
  std::stable_sort(hits.begin(), hits.end(), [](const SearchHit& a, const SearchHit& b) {
    return a.hit.mtime != b.hit.mtime ? a.hit.mtime > b.hit.mtime : a.path < b.path;
  });
  if (hits.size() > query.names.limit) hits.resize(query.names.limit);
}

ShareFigures FiguresOf(const IndexedShare& share) {
  ShareFigures figures;
  std::string error;
  auto reader = fileindex_store::IndexReader::Open(DatabaseDirectoryOf(share.name), error);
  std::map<std::string, std::uint64_t> byFolder;
  if (reader && reader->CountByFolder(byFolder)) {
    figures.indexAvailable = true;
    for (const auto& folder : share.folderByPath) {
      auto it = byFolder.find(folder.second);
      std::uint64_t count = it == byFolder.end() ? 0 : it->second;
      figures.indexedByFolder[folder.first] = count;
      figures.indexed += count;
    }
  }
  const std::string queue = QueuePathOf(share.name);
  for (const std::string& file : {queue, fileindex_queue::TmpCompanion(queue)}) {
    std::ifstream in(file);
    for (std::string line; std::getline(in, line);) {
      fileindex_queue::QueueEvent event;
      if (!fileindex_queue::ParseQueueLine(line.data(), line.size(), event)) continue;
      ++figures.pending;
      for (const auto& folder : share.folderByPath) {
        const std::string full =
            folder.second.empty() ? share.directory : share.directory + "/" + folder.second;
        if (IsInside(event.path, full) || (!event.pathOld.empty() && IsInside(event.pathOld, full)))
          ++figures.pendingByFolder[folder.first];
      }
    }
  }
  return figures;
}

IndexFigures CollectIndexFigures() {
  IndexFigures result;
  std::vector<FI::Folder> folders;
  if (!FI::IndexMgr::List(folders)) return result;  // the status lines report it
  result.shares = IndexedShares(folders);
  for (const auto& share : result.shares) result.figures[share.first] = FiguresOf(share.second);
  return result;
}

void AddFolderFigures(const IndexFigures& figures, const std::string& folder, Json::Value& item) {
  item["indexed"] = Json::Value();
  item["pending"] = Json::Value();
  std::string share;
  if (!FI::GetShareNameByPath(share, folder)) return;
  auto it = figures.figures.find(share);
  if (it == figures.figures.end()) return;
  auto pending = it->second.pendingByFolder.find(folder);
  item["pending"] =
      static_cast<Json::UInt64>(pending == it->second.pendingByFolder.end() ? 0 : pending->second);
  auto indexed = it->second.indexedByFolder.find(folder);
  if (it->second.indexAvailable && indexed != it->second.indexedByFolder.end())
    item["indexed"] = static_cast<Json::UInt64>(indexed->second);
}

Json::Value ShareFiguresJson(const IndexFigures& figures) {
  Json::Value shares(Json::objectValue);
  for (const auto& entry : figures.figures) {
    Json::Value& share = shares[entry.first];
    share["indexed"] = entry.second.indexAvailable
                           ? Json::Value(static_cast<Json::UInt64>(entry.second.indexed))
                           : Json::Value();
    share["pending"] = static_cast<Json::UInt64>(entry.second.pending);
  }
  return shares;
}

void PrintShareFigures(const Json::Value& shares) {
  for (const std::string& name : shares.getMemberNames()) {
    const Json::Value& share = shares[name];
    std::printf("share %s: %s entries indexed, %s events pending\n", name.c_str(),
                share["indexed"].isNull() ? "no index readable," : FigureText(share["indexed"]).c_str(),
                FigureText(share["pending"]).c_str());
  }
}

std::string FigureText(const Json::Value& figure) {
  return figure.isNull() ? "-" : std::to_string(figure.asUInt64());
}

}  // namespace fileindexctl
