// `fileindexctl check [--repair]`: the configuration and the files derived from it, checked
// the way a file-system check does, and repaired where that is safe.
#include <dirent.h>
#include <fileindex/fileindex.h>
#include <sys/stat.h>
#include <tavo/platform.h>
#include <unistd.h>

#include <cerrno>
#include <cstring>
#include <ctime>
#include <fstream>
#include <functional>
#include <map>
#include <set>
#include <sstream>

#include "commands.h"
#include "diagnose.h"
#include "index_view.h"
#include "input.h"
#include "output.h"

namespace fileindexctl {

namespace FI = TAVO::FILEINDEX;

namespace {

// A temporary file younger than this may belong to a writer at work.
const time_t kStrayAge = 10;

struct Finding {
  std::string kind;  // config, share, watch, queue, stray
  std::string text;
  bool repaired = false;
  std::string action;
};

std::string Rooted(const std::string& path) {
  const char* root = std::getenv("FILEINDEX_SYSROOT");
  return (root != nullptr ? std::string(root) : std::string()) + path;
}

std::string Unrooted(const std::string& path) {
  const std::string root = Rooted("");
  return !root.empty() && path.compare(0, root.size(), root) == 0 ? path.substr(root.size()) : path;
}

bool ReadText(const std::string& path, std::string& text) {
  std::ifstream in(path, std::ios::binary);
  if (!in) return false;
  std::stringstream buffer;
  buffer << in.rdbuf();
  text = buffer.str();
  return true;
}

// "name.XXXXXX": the named temporary files of an atomic write, left by a crash.
bool IsTemporaryOf(const std::string& name, const std::string& base) {
  if (name.size() != base.size() + 7 || name.compare(0, base.size() + 1, base + ".") != 0) return false;
  for (size_t i = base.size() + 1; i < name.size(); ++i) {
    if (!std::isalnum(static_cast<unsigned char>(name[i]))) return false;
  }
  return true;
}

// Calls visit(path, name, st) for every entry but a directory in dir, and in the
// directories below it when recursive.
void ForEachFile(
    const std::string& dir, bool recursive,
    const std::function<void(const std::string&, const std::string&, const struct stat&)>& visit) {
  DIR* d = ::opendir(dir.c_str());
  if (d == nullptr) return;
  std::vector<std::string> names;
  while (dirent* entry = ::readdir(d)) names.push_back(entry->d_name);
  ::closedir(d);
  for (const std::string& name : names) {
    if (name == "." || name == "..") continue;
    const std::string path = dir + "/" + name;
    struct stat st;
    if (::lstat(path.c_str(), &st) != 0) continue;
    if (!S_ISDIR(st.st_mode)) {
      visit(path, name, st);
    } else if (recursive) {
      ForEachFile(path, true, visit);
    }
  }
}

// Files in dir (recursively when asked) that are left-over temporary files.
void FindStrays(const std::string& dir, bool recursive, std::vector<std::string>& out) {
  ForEachFile(dir, recursive, [&](const std::string& path, const std::string& name, const struct stat& st) {
    std::string::size_type dot = name.rfind('.');
    if (!S_ISREG(st.st_mode) || dot == std::string::npos || !IsTemporaryOf(name, name.substr(0, dot))) return;
    if (std::time(nullptr) - st.st_mtime < kStrayAge) return;
    out.push_back(path);
  });
}

void FindWatchLists(const std::string& dir, std::vector<std::string>& out) {
  ForEachFile(dir, true, [&](const std::string& path, const std::string& name, const struct stat&) {
    if (name.size() > 5 && name.compare(name.size() - 5, 5, ".json") == 0) out.push_back(path);
  });
}

const std::string kWatchRoot = "/run/tavotifyd/fileindex";

int Check(Session& s, bool repair) {
  std::vector<Finding> findings;
  auto add = [&](const std::string& kind, const std::string& text) {
    findings.push_back({kind, text, false, ""});
    return &findings.back();
  };

  // 1. The two configuration files parse and hold what the library expects.
  const std::vector<std::string> configProblems = ConfigProblems();
  for (const std::string& problem : configProblems)
    add("config", problem + " (not repaired: fix it by hand)");

  // 2. Every folder's share exists.
  std::vector<FI::Folder> folders;
  bool listed = configProblems.empty() &&
                s.Call(
                    "IndexMgr::List", [&]() { return FI::IndexMgr::List(folders); }, "read folder.conf");
  std::map<std::string, std::set<std::string>> byShare;  // share -> full paths of its folders
  for (const FI::Folder& folder : folders) {
    const std::string share = ShareOf(folder.GetPath());
    if (!ShareExists(share)) {
      add("share", folder.GetPath() + ": no such share \"" + share +
                       "\" (not repaired: 'fileindexctl share remove " + share + "' forgets its folders)");
      continue;
    }
    std::string full;
    FI::GetFullPath(full, folder.GetPath());
    byShare[share].insert(full);
  }

  // 3. Watch lists match folder.conf: one per share with folders, listing exactly them.
  std::set<std::string> expectedFiles;
  std::set<std::string> staleShares;
  for (const auto& entry : byShare) {
    const std::string queue = QueuePathOf(entry.first);
    if (queue.empty()) continue;
    const std::string file = Rooted(kWatchRoot) + Unrooted(queue) + ".json";
    expectedFiles.insert(file);
    std::string text, errors;
    Json::Value watch;
    std::set<std::string> watched;
    if (ReadText(file, text) && ParseJson(text, watch, errors) && watch["config"].isArray()) {
      for (const Json::Value& item : watch["config"]) watched.insert(item["path"].asString());
    }
    if (text.empty()) {
      add("watch", "share " + entry.first + ": watch list " + file + " is missing");
      staleShares.insert(entry.first);
    } else if (watched != entry.second) {
      add("watch", "share " + entry.first + ": watch list " + file + " does not match folder.conf");
      staleShares.insert(entry.first);
    }
  }
  std::vector<std::string> watchFiles;
  if (listed) FindWatchLists(Rooted(kWatchRoot), watchFiles);
  std::vector<std::string> strayWatchLists;
  for (const std::string& file : watchFiles) {
    if (expectedFiles.count(file) > 0) continue;
    add("watch", file + ": watch list of a share without indexed folders");
    strayWatchLists.push_back(file);
  }

  // 4. Queue files hold only whole lines (a torn last line is what a crash mid-append leaves).
  for (const auto& entry : byShare) {
    const std::string queue = QueuePathOf(entry.first);
    for (const std::string& file : {queue, queue + ".tmp"}) {
      std::string text;
      if (queue.empty() || !ReadText(file, text) || text.empty()) continue;
      if (text.back() != '\n') add("queue", file + ": the last line is not whole (not repaired)");
    }
  }

  // 5. No temporary files left behind by a writer that died.
  std::vector<std::string> strays;
  FindStrays(FI::Folders().GetPath().substr(0, FI::Folders().GetPath().rfind('/')), false, strays);
  FindStrays(Rooted("/run/tavotifyd"), true, strays);
  FindStrays(Rooted("/run/tavo/service"), false, strays);
  for (const std::string& stray : strays) add("stray", stray + ": temporary file left behind");

  if (repair) {
    if (!staleShares.empty()) {
      // Rebuilt under folder.conf's lock, as the library's own writers do.
      FI::Folders lock;
      if (s.Call(
              "Folders::Lock", [&]() { return lock.Lock(true); }, "check --repair")) {
        for (Finding& finding : findings) {
          if (finding.kind != "watch") continue;
          for (const std::string& share : staleShares) {
            if (finding.text.compare(0, 6 + share.size() + 1, "share " + share + ":") != 0) continue;
            finding.repaired = s.Call(
                "IndexMgr::UpsertTAVotifydCfg", [&]() { return FI::IndexMgr::UpsertTAVotifydCfg(share); },
                "rebuild the watch list of share " + share);
            finding.action = "rebuilt the watch list of share " + share;
          }
        }
        lock.Unlock();
      }
    }
    for (Finding& finding : findings) {
      bool strayWatch =
          finding.kind == "watch" && finding.text.find("without indexed folders") != std::string::npos;
      if (finding.kind != "stray" && !strayWatch) continue;
      const std::string file = finding.text.substr(0, finding.text.find(": "));
      if (::unlink(file.c_str()) == 0 || errno == ENOENT) {
        finding.repaired = true;
        finding.action = "removed " + file;
      } else {
        finding.action = std::string("cannot remove ") + file + ": " + std::strerror(errno);
      }
    }
  }

  Json::Value result(Json::objectValue);
  result["problems"] = Json::Value(Json::arrayValue);
  size_t left = 0;
  for (const Finding& finding : findings) {
    Json::Value item;
    item["kind"] = finding.kind;
    item["problem"] = finding.text;
    item["repaired"] = finding.repaired;
    if (!finding.action.empty()) item["action"] = finding.action;
    result["problems"].append(item);
    if (!finding.repaired) ++left;
  }
  result["clean"] = left == 0;
  if (left > 0) {
    s.Fail("check",
           std::to_string(left) + " problem(s) " + (repair ? "left" : "found") +
               (repair ? "" : "; 'fileindexctl check --repair' repairs what it can"),
           "CHECK_FAILED");
  }
  // The findings are printed whether or not problems are left; the summary goes with the exit status.
  if (!s.options().json) {
    for (const Finding& finding : findings) {
      std::printf("%s: %s\n", finding.kind.c_str(), finding.text.c_str());
      if (!finding.action.empty())
        std::printf("  %s%s\n", finding.repaired ? "repaired: " : "", finding.action.c_str());
    }
  }
  return s.Finish(
      result, [&]() { std::printf(findings.empty() ? "no problems found\n" : "every problem repaired\n"); });
}

}  // namespace

void AddCheckCommands(CLI::App& app, Action& action) {
  auto repair = std::make_shared<bool>(false);
  CLI::App* cmd = Command(
      app, "check", "Check folder.conf, status.conf, shares, watch lists, queue files and temporary files",
      action, [repair](Session& s) { return Check(s, *repair); });
  cmd->add_flag("--repair", *repair, "Rebuild watch lists through the library and remove left-over files");
}

}  // namespace fileindexctl
