// A fast reading of folder.conf for the path queries: one strict pass over the text that
// lists the records' member names without building a JSON document or the folders.
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

// True when the text is certainly one that the strict JSON parse reads as an object,
// and names then holds its member names in the order the parsed object lists them.
// False means "not decided here", never "malformed": member names with escapes or out
// of ascending byte order (a repeated name among them), numbers other than short plain
// integers, raw control characters in strings, deep nesting, a value that is not an
// object and every malformed text answer false, and the caller must parse the text.
bool ViewFolderConf(const char* data, size_t size, std::vector<FolderConfName>& names);

}  // namespace internal
}  // namespace FILEINDEX
}  // namespace TAVO

#endif
