// Samba's Spotlight query strings: parsed, scoped to a share and answered by an index,
// as fileindexd does. Every query either is refused with a reason or becomes SQL that the
// index runs; a name matches the glob that spells it out.
#include <query_string.h>
#include <stdlib.h>
#include <store.h>
#include <unistd.h>

#include <cstdio>
#include <cstdlib>
#include <filesystem>
#include <string>

namespace {

std::string g_dir;

void RemoveIndex() { std::filesystem::remove_all(g_dir); }

fileindex_store::IndexReader& Index() {
  static fileindex_store::IndexReader* reader = [] {
    char pattern[] = "/tmp/fuzz-query-string.XXXXXX";
    if (::mkdtemp(pattern) == nullptr) std::abort();
    g_dir = pattern;
    std::atexit(RemoveIndex);
    std::string error;
    auto writer = fileindex_store::IndexWriter::Open(g_dir + "/db", error);
    if (!writer || !writer->Begin()) std::abort();
    for (const char* name : {"beach one.jpg", "Café del Mar.flac", "notes", "a*b?c\\d.txt", "日本.png"}) {
      fileindex_store::Entry entry;
      entry.parent = "sub";
      entry.name = name;
      entry.isDir = std::string(name) == "notes";
      entry.size = 10;
      entry.mtime = 1600000000;
      if (!writer->Put(entry)) std::abort();
    }
    if (!writer->Commit()) std::abort();
    writer.reset();
    return fileindex_store::IndexReader::Open(g_dir + "/db", error).release();
  }();
  return *reader;
}

}  // namespace

extern "C" int LLVMFuzzerTestOneInput(const uint8_t* data, size_t size) {
  const std::string input(reinterpret_cast<const char*>(data), size);
  fileindex_store::Condition condition;
  std::string error;
  if (!fileindexd::ParseQueryString(input, condition, error)) {
    if (error.empty()) std::abort();  // a refusal always says why
  } else {
    fileindexd::ScopeToShare(condition, "/s");
    fileindex_store::IndexReader::SelectOptions options;
    options.size = 3;
    fileindex_store::IndexReader::Selection selection;
    if (!Index().Select(condition, options, selection)) {
      std::fprintf(stderr, "%s\n", Index().LastError().c_str());
      std::abort();
    }
  }
  const std::string folded = fileindex_store::FoldForMatching(input);
  if (!fileindex_store::GlobMatches(fileindex_store::EscapeGlob(folded), folded)) std::abort();
  fileindex_store::GlobMatches(folded, fileindex_store::FoldForMatching(input.substr(size / 2)));
  return 0;
}
