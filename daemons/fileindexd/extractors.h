// The extraction of one file's metadata and text, run inside the extraction worker only:
// the libraries that read file formats run on whatever the shares hold, so they run in a
// process that may crash, hang or run out of memory without harm to fileindexd.
#ifndef FILEINDEXD_EXTRACTORS_H
#define FILEINDEXD_EXTRACTORS_H

#include <content.h>

#include <string>

namespace fileindexd {

// Limits that guard against files built to exhaust the worker before the process limits do.
struct ExtractLimits {
  std::size_t maxText = fileindex_store::kMaxTextPerFile;
  std::uint64_t maxTagBytes = 16u << 20;       // an audio tag larger than this is refused
  std::uint64_t maxArchiveMember = 64u << 20;  // uncompressed XML read from a document's zip
  std::uint64_t maxCompressionRatio = 200;     // beyond this a member over 8 MiB is a bomb
  int maxPages = 10000;
};

// Loads what the extractors need once per process (libmagic's database, quiet logs).
bool InitExtractors(std::string& error);

// Extracts the file at path (opened without following a final symbolic link). hint is the
// kind its name suggests; the content's type decides. On a failure, content.state is
// kFailed and content.reason says why; text is what the file says, at most maxText bytes.
void ExtractFile(const std::string& path, fileindex_store::Kind hint, const ExtractLimits& limits,
                 fileindex_store::Content& content, std::string& text);

// The kind of a content type; kOther when the type says nothing (then the hint decides).
fileindex_store::Kind KindOfMime(const std::string& mime);

}  // namespace fileindexd

#endif
