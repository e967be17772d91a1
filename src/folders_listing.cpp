// One sorted page of the folder collection, with the requested additional fields.
#include <fileindex/folders.h>
#include <tavo/platform.h>

#include <algorithm>
#include <vector>

#include "internal/listing_pass.h"

namespace TAVO {
namespace FILEINDEX {

namespace {

enum class SortKey { kName, kDocument, kAudio, kVideo, kPhoto, kPath };

// Key names match exactly; anything else, the empty name included, sorts by path.
SortKey SortKeyOf(const std::string& sortBy) {
  if (sortBy == "name") return SortKey::kName;
  if (sortBy == "document") return SortKey::kDocument;
  if (sortBy == "audio") return SortKey::kAudio;
  if (sortBy == "video") return SortKey::kVideo;
  if (sortBy == "photo") return SortKey::kPhoto;
  return SortKey::kPath;
}

bool FlagOf(const Folder& folder, SortKey key) {
  switch (key) {
    case SortKey::kDocument:
      return folder.IsDocument();
    case SortKey::kAudio:
      return folder.IsAudio();
    case SortKey::kVideo:
      return folder.IsVideo();
    default:
      return folder.IsPhoto();
  }
}

// Whether a comes before b. Names and paths compare without regard to letter case;
// for a flag, folders without it come first.
bool Before(const Folder& a, const Folder& b, SortKey key) {
  switch (key) {
    case SortKey::kName:
      return VLIBCUnicodeUTF8StrCaseCmp(a.GetName().c_str(), b.GetName().c_str()) < 0;
    case SortKey::kPath:
      return VLIBCUnicodeUTF8StrCaseCmp(a.GetPath().c_str(), b.GetPath().c_str()) < 0;
    default:
      return !FlagOf(a, key) && FlagOf(b, key);
  }
}

}  // namespace

bool Folders::List(Json::Value& result, unsigned long offset, unsigned long limit, const std::string& sort_by,
                   const std::string& sort_direction, const Json::Value& additional) {
  // The folders are sorted by reference: the collection is not copied, and the order of
  // equal folders is free anyway.
  std::vector<const Folder*> sorted;
  sorted.reserve(m_mapFolders.size());
  for (const auto& entry : m_mapFolders) sorted.push_back(&entry.second);

  const unsigned long total = sorted.size();
  result = Json::Value(Json::objectValue);
  result["total"] = static_cast<Json::UInt64>(total);
  result["offset"] = static_cast<Json::UInt64>(offset);

  const SortKey key = SortKeyOf(sort_by);
  std::sort(sorted.begin(), sorted.end(),
            [key](const Folder* a, const Folder* b) { return Before(*a, *b, key); });

  Json::Value page(Json::arrayValue);
  // An offset beyond the total would make total - offset wrap and the page run past the
  // end of the list; such a page is empty instead, in either direction.
  if (offset <= total) {
    const unsigned long n = std::min(total - offset, limit);
    const bool descending = sort_direction == "DESC";
    // The page's fields share one read of status.conf and of each queue file.
    std::vector<std::string> paths;
    paths.reserve(n);
    for (unsigned long i = 0; i < n; ++i) paths.push_back(sorted[descending ? i : offset + i]->GetPath());
    internal::ListingPass pass(std::move(paths));
    if (descending) {
      // A descending page is the first n folders of the ascending order, reversed: the
      // offset does not apply here.
      for (unsigned long i = n; i > 0; --i) page.append(sorted[i - 1]->asJson(additional));
    } else {
      for (unsigned long i = offset; i < offset + n; ++i) page.append(sorted[i]->asJson(additional));
    }
  }
  result["folder"] = page;
  return true;
}

}  // namespace FILEINDEX
}  // namespace TAVO
