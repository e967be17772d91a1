// `fileindexctl why PATH`: whether a file is indexed and, if not, what keeps it out: no
// folder, the indexing rules, its kind switched off, a failed extraction, or work pending.
#include <fileindex/index_mgr.h>
#include <fileindex/utils.h>
#include <sys/stat.h>
#include <unistd.h>

#include <memory>

#include "commands.h"
#include "content_view.h"
#include "index_view.h"
#include "output.h"

namespace fileindexctl {

namespace {

namespace FI = TAVO::FILEINDEX;
using fileindex_store::ExtractState;
using fileindex_store::Kind;

struct Answer {
  std::string state;  // see the man page: indexed, pending, failed, kind-off, skipped, ...
  bool indexed = false;
  std::string reason;
  Json::Value content;
};

bool FolderFlag(const Json::Value& record, Kind kind) {
  const char* flag = fileindex_store::KindName(kind);
  return record[flag].isBool() && record[flag].asBool();
}

Answer Explain(const std::string& path) {
  Answer answer;
  std::string full, share;
  if (!FI::GetShareNameByPath(share, path) || !FI::GetFullPath(full, path)) {
    answer.state = "unknown";
    answer.reason = "not a path inside a share";
    return answer;
  }
  std::string shareDir;
  FI::GetFullPath(shareDir, "/" + share);
  struct stat st;
  const bool exists = ::lstat(full.c_str(), &st) == 0;

  std::vector<FI::Folder> folders;
  FI::IndexMgr::List(folders);
  Json::Value folder = FI::GetMostSuitableCfg(folders, full);
  if (!folder.isObject() || !folder["path"].isString()) {
    answer.state = "outside";
    answer.reason = "not inside an indexed folder";
    return answer;
  }
  const std::string folderPath = folder["path"].asString();
  std::string folderFull;
  FI::GetFullPath(folderFull, folderPath);
  // The rules, as the service asks them: for each directory on the way down from the
  // folder, and for the file's name.
  for (std::string::size_type slash = folderFull.size(); exists && slash != std::string::npos;
       slash = full.find('/', slash + 1)) {
    const std::string prefix = full.substr(0, full.find('/', slash + 1));
    if (prefix.size() > folderFull.size() && FI::IsSkipIndex(prefix)) {
      answer.state = "skipped";
      answer.reason = "skipped by the indexing rules (" + prefix + ")";
      return answer;
    }
    if (prefix == full) break;
  }
  const std::string name = full.substr(full.rfind('/') + 1);
  const bool isDir = exists && S_ISDIR(st.st_mode);
  if (exists && !isDir && FI::IsSystemPreservedFileName(name)) {
    answer.state = "skipped";
    answer.reason = "skipped by the indexing rules (a name the system keeps for itself)";
    return answer;
  }
  const Kind kind =
      isDir ? Kind::kOther : fileindex_store::KindOfExtension(fileindex_store::ExtensionOf(name));
  if (exists && kind != Kind::kOther && !FolderFlag(folder, kind)) {
    answer.state = "kind-off";
    answer.reason =
        std::string("its kind (") + fileindex_store::KindName(kind) + ") is switched off in " + folderPath;
    return answer;
  }

  std::string error;
  auto reader = fileindex_store::ContentReader::Open(DatabaseDirectoryOf(share), error);
  fileindex_store::Entry entry;
  fileindex_store::Content content;
  bool found = false, hasContent = false;
  const std::string relative = full == shareDir ? "" : full.substr(shareDir.size() + 1);
  if (!reader || !reader->Lookup(relative, entry, found, content, hasContent)) {
    answer.state = "pending";
    answer.reason = "the share has no readable index yet (" + (reader ? reader->LastError() : error) + ")";
    return answer;
  }
  if (!exists) {
    answer.state = found ? "pending" : "missing";
    answer.reason = found ? "no such file; its removal from the index is pending" : "no such file";
    return answer;
  }
  if (!found) {
    answer.state = "pending";
    answer.reason = "not in the index yet";
    return answer;
  }
  if (!isDir && (entry.size != st.st_size || entry.mtime != static_cast<std::int64_t>(st.st_mtim.tv_sec))) {
    answer.state = "pending";
    answer.reason = "the index holds an older version of it";
    return answer;
  }
  answer.indexed = true;
  if (hasContent) answer.content = ContentJson(content);
  if (isDir) {
    answer.state = "indexed";
    answer.reason = "indexed by its name";
  } else if (!hasContent) {
    answer.state = "content-pending";
    answer.reason = kind == Kind::kOther
                        ? "indexed by its name; its type is still to be told from its content"
                        : "indexed by its name; its contents are still to be extracted";
  } else if (content.state == ExtractState::kSkipped && content.kind == Kind::kOther &&
             entry.kind == Kind::kOther) {
    answer.state = "indexed";
    answer.reason = "indexed by its name (" + content.mime + ")";
  } else if (content.state == ExtractState::kFailed) {
    answer.state = "failed";
    answer.reason = "indexed by its name; extracting its contents failed: " + content.reason;
  } else if (content.state == ExtractState::kSkipped) {
    answer.state = "indexed";
    answer.reason = "indexed by its name; contents not extracted: " + content.reason;
  } else {
    answer.state = "indexed";
    const std::string summary = ContentSummary(content);
    answer.reason =
        "indexed with its contents (" + content.mime + (summary.empty() ? "" : ": " + summary) + ")";
  }
  return answer;
}

int Why(Session& s, const std::string& path) {
  if (::geteuid() != 0) {
    s.Fail("why", "only root may look into the index (file names are private to those who may read them)");
    return s.Finish(Json::Value(), nullptr);
  }
  Answer answer = Explain(path);
  Json::Value result(Json::objectValue);
  result["path"] = path;
  result["indexed"] = answer.indexed;
  result["state"] = answer.state;
  result["reason"] = answer.reason;
  result["content"] = answer.content;
  return s.Finish(
      result, [&]() { std::printf("%s: %s\n", path.c_str(), answer.reason.c_str()); }, !answer.indexed);
}

}  // namespace

void AddWhyCommand(CLI::App& app, Action& action) {
  auto path = std::make_shared<std::string>();
  CLI::App* cmd = app.add_subcommand(
      "why",
      "Whether a file is indexed and, if not, why: no folder, the rules, its kind switched off, a failed "
      "extraction, or work pending (exit 3 when it is not indexed)");
  cmd->add_option("path", *path, "The file, as a share path (/photo/2019/beach.jpg)")->required();
  cmd->callback([&action, path]() { action = [path](Session& s) { return Why(s, *path); }; });
}

}  // namespace fileindexctl
