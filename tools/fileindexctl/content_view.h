// How `search` and `why` show what is inside a file: its fields as JSON and as one line.
#ifndef FILEINDEXCTL_CONTENT_VIEW_H
#define FILEINDEXCTL_CONTENT_VIEW_H

#include <content.h>
#include <json/json.h>

#include <string>

namespace fileindexctl {

// {"state": "extracted", "mime": ..., "kind": ..., then the fields the file has}.
Json::Value ContentJson(const fileindex_store::Content& content);
// The main fields in a few words ("Kestrel K-100, taken 2019-07-14 10:11:12, 32x24"), or
// why there are none ("failed: ...").
std::string ContentSummary(const fileindex_store::Content& content);
// "3:05" or "1:02:03".
std::string Duration(std::int64_t milliseconds);

}  // namespace fileindexctl

#endif
