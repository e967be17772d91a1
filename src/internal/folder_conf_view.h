// A fast reading of folder.conf: one strict pass over the text that lists the records
// without building a JSON document or the folders.
// Texts it cannot decide with certainty are left to Folders::Load, which remains the
// authority on what folder.conf holds.
#ifndef FILEINDEX_INTERNAL_FOLDER_CONF_VIEW_H
#define FILEINDEX_INTERNAL_FOLDER_CONF_VIEW_H

#include <cstddef>
#include <vector>

namespace TAVO {
namespace FILEINDEX {
namespace internal {

// A member name: a span of the text itself.
struct FolderConfName {
  const char* data;
  size_t size;
};

// One member of the top-level object: a folder's path and what its record holds of the
// members a folder is loaded from.
struct FolderConfRecord {
  FolderConfName path;
  // "name" when the record is an object whose "name" is a string, else null.
  const char* name;
  size_t nameSize;
  // "document", "audio", "video", "photo": 1 or 0 when the record holds the member as
  // a boolean, else -1.
  signed char flags[4];
};

// True when the text is certainly one that the strict JSON parse reads as an object,
// and records then holds its members in the order the parsed object lists them, with
// the values the parsed records give. False means "not decided here", never
// "malformed": member names with escapes or out of ascending byte order (a repeated
// name among them), a record that repeats one of the members above or holds "name"
// with escapes, numbers other than short plain integers, raw control characters in
// strings, deep nesting, a value that is not an object and every malformed text answer
// false, and the caller must parse the text.
bool ViewFolderConf(const char* data, size_t size, std::vector<FolderConfRecord>& records);

}  // namespace internal
}  // namespace FILEINDEX
}  // namespace TAVO

#endif
