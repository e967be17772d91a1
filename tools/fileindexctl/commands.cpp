// Every public operation of the library as a command.
#include "commands.h"

#include <arpa/inet.h>
#include <fileindex/fileindex.h>
#include <netinet/in.h>
#include <sys/socket.h>
#include <tavo/platform.h>
#include <unistd.h>

#include <algorithm>
#include <climits>
#include <cstdio>
#include <ctime>
#include <fstream>
#include <iostream>
#include <iterator>
#include <map>
#include <memory>
#include <sstream>

#include "diagnose.h"
#include "index_view.h"
#include "input.h"
#include "output.h"

namespace fileindexctl {

namespace FI = TAVO::FILEINDEX;

namespace {

const char* const kTypes[] = {"document", "audio", "video", "photo"};

// The record fields of `folders add` and `folders set`.
struct FolderFields {
  std::vector<std::string> paths;
  std::string name;
  int types[4] = {-1, -1, -1, -1};  // -1: not given
  bool all = false;
  bool force = false;
  std::string records;
};

std::string LastComponent(const std::string& path) { return path.substr(path.rfind('/') + 1); }

void AddFieldOptions(CLI::App* cmd, const std::shared_ptr<FolderFields>& fields, bool adding) {
  cmd->add_option("paths", fields->paths, "Folder paths: /share/directory...");
  cmd->add_option("--name", fields->name, "Display name");
  for (int i = 0; i < 4; ++i) {
    std::string type = kTypes[i];
    cmd->add_flag_function(
        "--" + type + ",!--no-" + type,
        [fields, i](std::int64_t count) { fields->types[i] = count > 0 ? 1 : 0; },
        "Index " + type + " files (or not)");
  }
  cmd->add_flag("--all", fields->all, "Index every file type");
  cmd->add_option("--records", fields->records,
                  "A JSON array of folder records instead of paths and flags ('-' reads standard input)");
  if (adding)
    cmd->add_flag("--force", fields->force, "Add a folder even though a rule says it may not be indexed");
}

// Checks one folder record of --records: an object whose path is a share path and whose
// fields have their types. The path is normalised in place.
bool CheckRecord(Session& session, Json::Value& record) {
  if (!record.isObject()) {
    session.Fail("--records", "each element must be a folder record (a JSON object)", "INVALID_INPUT");
    return false;
  }
  static const char* const kKnown[] = {"path", "name", "document", "audio", "video", "photo"};
  for (const std::string& member : record.getMemberNames()) {
    if (std::find(std::begin(kKnown), std::end(kKnown), member) == std::end(kKnown)) {
      session.Fail("--records",
                   "unknown field \"" + member + "\" (known: path, name, document, audio, video, photo)",
                   "INVALID_INPUT");
      return false;
    }
  }
  if (!record["path"].isString() || (record.isMember("name") && !record["name"].isString())) {
    session.Fail("--records", "\"path\" and \"name\" must be strings", "INVALID_INPUT");
    return false;
  }
  for (const char* type : kTypes) {
    if (record.isMember(type) && !record[type].isBool()) {
      session.Fail("--records", std::string("\"") + type + "\" must be true or false", "INVALID_INPUT");
      return false;
    }
  }
  std::string normal, why;
  if (!NormaliseSharePath(record["path"].asString(), normal, why)) {
    session.Fail(Printable(record["path"].asString()), why, "INVALID_PATH");
    return false;
  }
  record["path"] = normal;
  return true;
}

// The request array of folder records; a new folder gets its last path component as its
// name and every file type unless told otherwise.
bool BuildRecords(Session& session, const FolderFields& fields, bool adding, Json::Value& out) {
  if (!fields.records.empty()) {
    if (!fields.paths.empty()) {
      session.Usage("give either paths or --records, not both");
      return false;
    }
    std::string text = fields.records;
    if (text == "-") text.assign(std::istreambuf_iterator<char>(std::cin), std::istreambuf_iterator<char>());
    std::string errors;
    if (!ParseJson(text, out, errors)) {
      session.Fail("--records", "not JSON: " + errors.substr(0, errors.find('\n')), "INVALID_INPUT");
      return false;
    }
    if (!out.isArray() || out.empty()) {
      session.Fail("--records", "expected a non-empty JSON array of folder records", "INVALID_INPUT");
      return false;
    }
    for (Json::Value& record : out) {
      if (!CheckRecord(session, record)) return false;
      if (adding && !record.isMember("name")) record["name"] = LastComponent(record["path"].asString());
    }
    return true;
  }
  if (fields.paths.empty()) {
    session.Usage("no folder given (paths or --records)");
    return false;
  }
  bool anyType = fields.all;
  for (int value : fields.types) anyType = anyType || value >= 0;
  out = Json::Value(Json::arrayValue);
  for (const std::string& given : fields.paths) {
    std::string path, why;
    if (!NormaliseSharePath(given, path, why)) {
      session.Fail(Printable(given), why, "INVALID_PATH");
      return false;
    }
    Json::Value record(Json::objectValue);
    record["path"] = path;
    if (!fields.name.empty()) {
      record["name"] = fields.name;
    } else if (adding) {
      record["name"] = LastComponent(path);
    }
    for (int i = 0; i < 4; ++i) {
      if (fields.types[i] >= 0) {
        record[kTypes[i]] = fields.types[i] == 1;
      } else if (fields.all || (adding && !anyType)) {
        record[kTypes[i]] = true;
      }
    }
    out.append(record);
  }
  return true;
}

// folder.conf as the library reads it, without taking the lock (the file is replaced
// atomically, so a reader never sees a torn one): path to record.
bool ReadFolders(std::map<std::string, Json::Value>& out) {
  std::vector<FI::Folder> list;
  try {
    if (!FI::IndexMgr::List(list)) return false;
  } catch (const std::exception&) {
    return false;
  }
  out.clear();
  for (const FI::Folder& folder : list) out[folder.GetPath()] = folder.asJson();
  return true;
}

std::string Join(const std::vector<std::string>& items) {
  std::string text;
  for (const std::string& item : items) text += (text.empty() ? "" : " ") + item;
  return text;
}

// Refuses paths that are (or are not) configured folders.
bool CheckConfigured(Session& session, const std::vector<std::string>& paths, bool wanted) {
  std::map<std::string, Json::Value> folders;
  if (!session.Call(
          "IndexMgr::List", [&]() { return ReadFolders(folders); }, "read folder.conf"))
    return false;
  for (const std::string& path : paths) {
    bool configured = folders.count(path) > 0;
    if (configured == wanted) continue;
    if (wanted) {
      session.Fail(path, "not a configured folder (see 'fileindexctl folders list')", "NO_SUCH_FOLDER");
    } else {
      session.Fail(path, "already configured (use 'fileindexctl folders set' to change it)", "FOLDER_EXISTS");
    }
    return false;
  }
  return true;
}

// Normalised share paths of the arguments, or a failure naming the first bad one.
bool NormalisePaths(Session& session, const std::vector<std::string>& given, std::vector<std::string>& out) {
  out.clear();
  for (const std::string& path : given) {
    std::string normal, why;
    if (!NormaliseSharePath(path, normal, why)) {
      session.Fail(Printable(path), why, "INVALID_PATH");
      return false;
    }
    out.push_back(normal);
  }
  return true;
}

Json::Value StringArray(const std::vector<std::string>& items) {
  Json::Value array(Json::arrayValue);
  for (const std::string& item : items) array.append(item);
  return array;
}

std::string Cell(const Json::Value& value) {
  if (value.isString()) return value.asString();
  if (value.isBool()) return value.asBool() ? "yes" : "no";
  if (value.isNull()) return "?";
  return CompactJson(value);
}

std::string Upper(std::string text) {
  for (char& c : text) c = static_cast<char>(std::toupper(static_cast<unsigned char>(c)));
  return text;
}

void PrintFolderTable(const Json::Value& folders, const std::vector<std::string>& additional) {
  std::vector<std::string> headers{"PATH", "NAME", "DOC", "AUDIO", "VIDEO", "PHOTO"};
  for (const std::string& name : additional) headers.push_back(Upper(name));
  Table table(headers);
  for (const Json::Value& folder : folders) {
    std::vector<std::string> row{folder["path"].asString(), folder["name"].asString()};
    for (const char* type : kTypes) row.push_back(folder[type].asBool() ? "yes" : "-");
    for (const std::string& name : additional) row.push_back(Cell(folder["additional"][name]));
    table.AddRow(row);
  }
  table.Print(stdout);
}

void PrintRecord(const Json::Value& record) {
  std::printf("%s\n", record["path"].asString().c_str());
  std::printf("  name: %s\n", record["name"].asString().c_str());
  std::string types;
  for (const char* type : kTypes) {
    if (record[type].asBool()) types += types.empty() ? type : std::string(", ") + type;
  }
  std::printf("  indexes: %s\n", types.empty() ? "nothing" : types.c_str());
}

CLI::App* Group(CLI::App& app, const std::string& name, const std::string& description) {
  CLI::App* group = app.add_subcommand(name, description);
  group->require_subcommand(1);
  return group;
}

// A yes/no answer of the library; "no" exits 3.
// Where Samba's Elasticsearch backend looks by default, and fileindexd answers.
const int kSpotlightPort = 9200;

bool AcceptsConnections(const char* address, int port) {
  int fd = ::socket(AF_INET, SOCK_STREAM | SOCK_CLOEXEC, 0);
  if (fd < 0) return false;
  sockaddr_in to{};
  to.sin_family = AF_INET;
  to.sin_port = htons(static_cast<uint16_t>(port));
  ::inet_pton(AF_INET, address, &to.sin_addr);
  const bool accepted = ::connect(fd, reinterpret_cast<sockaddr*>(&to), sizeof(to)) == 0;
  ::close(fd);
  return accepted;
}

int Answer(Session& session, const std::string& operation, const std::string& subject,
           const std::string& question, const std::function<bool()>& ask) {
  bool answer = session.Ask(operation, ask);
  Json::Value result;
  result["subject"] = subject;
  result[question] = answer;
  return session.Finish(
      result, [&]() { std::printf("%s  %s: %s\n", subject.c_str(), question.c_str(), YesNo(answer)); },
      !answer);
}

}  // namespace

CLI::App* Command(CLI::App& parent, const std::string& name, const std::string& description, Action& action,
                  Action run) {
  CLI::App* cmd = parent.add_subcommand(name, description);
  cmd->callback([&action, run]() { action = run; });
  return cmd;
}

void AddFolderCommands(CLI::App& app, Action& action) {
  CLI::App* folders = Group(app, "folders", "List, show, add, change and remove indexed folders");

  struct ListArgs {
    unsigned long offset = 0;
    unsigned long limit = ULONG_MAX;
    std::string sortBy = "path";
    std::string direction = "ASC";
    std::vector<std::string> additional;
  };
  auto list = std::make_shared<ListArgs>();
  CLI::App* cmd =
      Command(*folders, "list", "One sorted page of the indexed folders", action, [list](Session& s) {
        Json::Value result;
        Json::Value additional = StringArray(list->additional);
        const std::string direction = Upper(list->direction);
        s.Call(
            "IndexMgr::List",
            [&]() {
              return FI::IndexMgr::List(result, list->offset, list->limit, list->sortBy, direction,
                                        additional);
            },
            "list folders");
        return s.Finish(result, [&]() {
          PrintFolderTable(result["folder"], list->additional);
          std::printf("(%u shown of %s, offset %s)\n", result["folder"].size(), Cell(result["total"]).c_str(),
                      Cell(result["offset"]).c_str());
        });
      });
  cmd->add_option("--offset", list->offset, "First folder of the page (ascending order only)");
  cmd->add_option("--limit", list->limit, "Folders per page (default: all)");
  cmd->add_option("--sort-by", list->sortBy, "name, path, document, audio, video or photo")
      ->capture_default_str()
      ->check(CLI::IsMember({"name", "path", "document", "audio", "video", "photo"}));
  cmd->add_option("--direction", list->direction, "ASC or DESC (any case)")
      ->capture_default_str()
      ->check(CLI::IsMember({"ASC", "DESC"}, CLI::ignore_case));
  cmd->add_option("-a,--additional", list->additional, "Computed fields: status, is_valid")
      ->delimiter(',')
      ->check(CLI::IsMember({"status", "is_valid"}));

  auto getPath = std::make_shared<std::string>();
  cmd = Command(*folders, "get", "One folder's record", action, [getPath](Session& s) {
    Json::Value result;
    std::string path, why;
    if (!NormaliseSharePath(*getPath, path, why)) {
      s.Fail(Printable(*getPath), why, "INVALID_PATH");
    } else {
      s.Call(
          "IndexMgr::Get", [&]() { return FI::IndexMgr::Get(result, path); }, path);
    }
    return s.Finish(result, [&]() { PrintRecord(result); });
  });
  cmd->add_option("path", *getPath, "Folder path (/share/directory)")->required();

  for (bool adding : {true, false}) {
    auto fields = std::make_shared<FolderFields>();
    const char* name = adding ? "add" : "set";
    const char* description = adding ? "Add folders (every file type unless flags say otherwise)"
                                     : "Change configured folders: only the fields given change";
    cmd = Command(*folders, name, description, action, [fields, adding](Session& s) {
      Json::Value records;
      if (!BuildRecords(s, *fields, adding, records)) return s.Finish(Json::Value(), nullptr);
      std::vector<std::string> paths;
      for (const Json::Value& record : records) paths.push_back(record["path"].asString());
      if (!CheckConfigured(s, paths, !adding)) return s.Finish(Json::Value(), nullptr);
      for (const std::string& path : paths) {
        // A folder of a share that does not exist cannot be added, forced or not.
        if (!ShareExists(ShareOf(path))) {
          s.Fail(path, "no such share \"" + ShareOf(path) + "\"", "NO_SUCH_SHARE");
          return s.Finish(Json::Value(), nullptr);
        }
        std::string rule = adding && !fields->force ? IndexRule(path) : "";
        if (rule.empty()) continue;
        s.Fail(path, "may not be indexed: " + rule + " (--force adds it anyway)", "NOT_INDEXABLE");
        return s.Finish(Json::Value(), nullptr);
      }
      // Saved means every record is in folder.conf with the fields asked for.
      std::map<std::string, Json::Value> stored;
      auto saved = [&]() {
        if (!ReadFolders(stored)) return false;
        for (const Json::Value& record : records) {
          auto found = stored.find(record["path"].asString());
          if (found == stored.end()) return false;
          for (const std::string& member : record.getMemberNames()) {
            if (found->second[member] != record[member]) return false;
          }
        }
        return true;
      };
      const char* operation = adding ? "IndexMgr::Add" : "IndexMgr::Set";
      bool ok = s.Call(
          operation, [&]() { return adding ? FI::IndexMgr::Add(records) : FI::IndexMgr::Set(records); },
          std::string(adding ? "add " : "set ") + Join(paths), saved);
      if (!ok) return s.Finish(Json::Value(), nullptr);
      // The result is read back without the lock: another writer may hold it by now, and
      // the change is made whether or not this read succeeds.
      Json::Value result(Json::objectValue);
      result["folder"] = Json::Value(Json::arrayValue);
      if (ReadFolders(stored)) {
        for (const std::string& path : paths) {
          if (stored.count(path) > 0) result["folder"].append(stored[path]);
        }
      }
      return s.Finish(result, [&]() {
        for (const Json::Value& record : result["folder"]) PrintRecord(record);
      });
    });
    AddFieldOptions(cmd, fields, adding);
  }

  auto removePaths = std::make_shared<std::vector<std::string>>();
  cmd = Command(
      *folders, "remove", "Remove folders and clean up after them", action, [removePaths](Session& s) {
        std::vector<std::string> paths;
        if (!NormalisePaths(s, *removePaths, paths) || !CheckConfigured(s, paths, true))
          return s.Finish(Json::Value(), nullptr);
        Json::Value array = StringArray(paths);
        auto gone = [&]() {
          std::map<std::string, Json::Value> stored;
          if (!ReadFolders(stored)) return false;
          for (const std::string& path : paths) {
            if (stored.count(path) > 0) return false;
          }
          return true;
        };
        s.Call(
            "IndexMgr::Delete", [&]() { return FI::IndexMgr::Delete(array); }, "remove " + Join(paths), gone);
        Json::Value result;
        result["removed"] = array;
        return s.Finish(result, [&]() {
          for (const std::string& path : paths) std::printf("removed %s\n", path.c_str());
        });
      });
  cmd->add_option("paths", *removePaths, "Folder paths")->required();

  auto reindexPaths = std::make_shared<std::vector<std::string>>();
  cmd = Command(app, "reindex", "Queue a reindex event for folders", action, [reindexPaths](Session& s) {
    std::vector<std::string> paths;
    if (NormalisePaths(s, *reindexPaths, paths)) {
      for (const std::string& path : paths) {
        if (!FI::IndexMgr::IsPathIndexed(path)) {
          s.Fail(path, "not in an indexed folder (see 'fileindexctl folders list')", "NO_SUCH_FOLDER");
          break;
        }
      }
    }
    if (s.failed()) return s.Finish(Json::Value(), nullptr);
    Json::Value array = StringArray(paths);
    s.Call(
        "IndexMgr::Reindex", [&]() { return FI::IndexMgr::Reindex(array); }, "reindex " + Join(paths));
    Json::Value result;
    result["reindex"] = array;
    return s.Finish(result, [&]() {
      for (const std::string& path : paths) std::printf("reindex queued for %s\n", path.c_str());
    });
  });
  cmd->add_option("paths", *reindexPaths, "Folder paths (/share/directory)")->required();
}

namespace {

// Share names flagged in status.conf under one member, read without the lock.
std::vector<std::string> FlaggedShares(const char* member) {
  std::vector<std::string> shares;
  std::ifstream in(FI::Status().GetPath());
  std::stringstream text;
  text << in.rdbuf();
  Json::Value status;
  std::string errors;
  if (!ParseJson(text.str(), status, errors) || !status.isObject() || !status[member].isObject())
    return shares;
  return status[member].getMemberNames();
}

}  // namespace

void AddStatusCommands(CLI::App& app, Action& action) {
  auto paths = std::make_shared<std::vector<std::string>>();
  CLI::App* cmd = Command(
      app, "status", "What needs attention, the pause state and each folder's status", action,
      [paths](Session& s) {
        Json::Value result(Json::objectValue);
        std::string status;
        if (s.Call(
                "StatusMgr::GetStatus", [&]() { return FI::StatusMgr::GetStatus(status); }, "status"))
          result["status"] = status;
        long long resume = -1;
        long long now = static_cast<long long>(std::time(nullptr));
        if (s.Call(
                "StatusMgr::GetPauseInfo", [&]() { return FI::StatusMgr::GetPauseInfo(resume); }, "status")) {
          result["resume_time"] = static_cast<Json::Int64>(resume);
          result["paused"] = resume == 0 || now < resume;
          if (resume > 0) result["resume_at"] = LocalTime(resume);
          if (resume > now) result["resume_in"] = InDuration(resume - now);
        }
        // What needs the administrator first: shares stopped for lack of space, and shares
        // waiting for a full reindex.
        result["no_space"] = Json::Value(Json::arrayValue);
        result["need_reindex"] = Json::Value(Json::arrayValue);
        result["config_problems"] = Json::Value(Json::arrayValue);
        for (const std::string& problem : ConfigProblems()) result["config_problems"].append(problem);
        for (const std::string& share : FlaggedShares("no_space")) {
          if (s.Ask("StatusMgr::ShareIsNoSpace", [&]() { return FI::StatusMgr::ShareIsNoSpace(share); }))
            result["no_space"].append(share);
        }
        for (const std::string& share : FlaggedShares("need_reindex")) {
          if (s.Ask("StatusMgr::ShareIsNeedReindex",
                    [&]() { return FI::StatusMgr::ShareIsNeedReindex(share); }))
            result["need_reindex"].append(share);
        }
        std::vector<std::string> folders;
        if (!NormalisePaths(s, *paths, folders)) return s.Finish(Json::Value(), nullptr);
        if (folders.empty()) {
          std::vector<FI::Folder> list;
          if (s.Call(
                  "IndexMgr::List", [&]() { return FI::IndexMgr::List(list); }, "status")) {
            for (const FI::Folder& folder : list) folders.push_back(folder.GetPath());
          }
        }
        result["folders"] = Json::Value(Json::arrayValue);
        const IndexFigures figures = CollectIndexFigures();
        for (const std::string& path : folders) {
          Json::Value item;
          item["path"] = path;
          s.Ask("StatusMgr::GetFolderStatus", [&]() {
            item["status"] = FI::StatusMgr::GetFolderStatus(path);
            return true;
          });
          AddFolderFigures(figures, path, item);
          std::string rule = IndexRule(path);
          item["indexable"] = rule.empty();
          if (!rule.empty()) item["rule"] = rule;
          result["folders"].append(item);
        }
        result["shares"] = ShareFiguresJson(figures);
        return s.Finish(result, [&]() {
          for (const Json::Value& problem : result["config_problems"])
            std::printf("attention: %s (see 'fileindexctl check')\n", problem.asCString());
          for (const Json::Value& share : result["no_space"])
            std::printf(
                "attention: share %s is out of space; indexing it is stopped (then: fileindexctl share "
                "revive %s)\n",
                share.asCString(), share.asCString());
          for (const Json::Value& share : result["need_reindex"])
            std::printf("attention: share %s waits for a full reindex\n", share.asCString());
          std::printf("indexing: %s\n", result["status"].asString().c_str());
          std::printf("pause:    %s\n", DescribePause(resume, now).c_str());
          if (result["folders"].size() == 0) return;
          PrintShareFigures(result["shares"]);
          Table table({"FOLDER", "STATUS", "INDEXED", "PENDING"});
          for (const Json::Value& item : result["folders"]) {
            std::string state = item["status"].asString();
            if (!item["indexable"].asBool())
              state += " (may not be indexed: " + item["rule"].asString() + ")";
            table.AddRow(
                {item["path"].asString(), state, FigureText(item["indexed"]), FigureText(item["pending"])});
          }
          std::printf("\n");
          table.Print(stdout);
        });
      });
  cmd->add_option("paths", *paths, "Only these folders (default: every indexed folder)");

  struct PauseArgs {
    std::string duration = "0";
    std::string until;
  };
  auto pause = std::make_shared<PauseArgs>();
  cmd = Command(
      app, "pause", "Pause indexing for hours, days or until a time (0 or nothing: until resumed)", action,
      [pause](Session& s) {
        long long now = static_cast<long long>(std::time(nullptr));
        int hours = 0;
        std::string why;
        if (!pause->until.empty() ? !ParseUntil(pause->until, now, hours, why)
                                  : !ParsePauseHours(pause->duration, now, hours, why)) {
          s.Fail(pause->until.empty() ? "pause " + pause->duration : "pause --until " + pause->until, why,
                 "INVALID_INPUT", kExitUsage);
          return s.Finish(Json::Value(), nullptr);
        }
        long long resume = -1;
        auto saved = [&]() {
          long long stored = -1;
          return FI::StatusMgr::GetPauseInfo(stored) &&
                 (hours == 0 ? stored == 0 : stored >= now + 3600LL * hours);
        };
        if (s.Call(
                "StatusMgr::Pause", [&]() { return FI::StatusMgr::Pause(hours); }, "pause", saved))
          s.Call(
              "StatusMgr::GetPauseInfo", [&]() { return FI::StatusMgr::GetPauseInfo(resume); }, "pause");
        Json::Value result;
        result["resume_time"] = static_cast<Json::Int64>(resume);
        if (resume > 0) result["resume_at"] = LocalTime(resume);
        return s.Finish(result, [&]() {
          std::printf("%s\n", DescribePause(resume, static_cast<long long>(std::time(nullptr))).c_str());
        });
      });
  cmd->add_option("duration", pause->duration, "5 or 5h hours, 3d days, 1w weeks; 0 pauses until resumed")
      ->capture_default_str();
  cmd->add_option("--until", pause->until,
                  "Pause until a local date-time \"YYYY-MM-DD HH:MM\" (whole hours from now, rounded up)")
      ->excludes(cmd->get_option("duration"));

  Command(app, "resume", "End a pause", action, [](Session& s) {
    auto saved = []() {
      long long stored = 0;
      return FI::StatusMgr::GetPauseInfo(stored) && stored == -1;
    };
    s.Call(
        "StatusMgr::Resume", []() { return FI::StatusMgr::Resume(); }, "resume", saved);
    Json::Value result;
    result["resumed"] = true;
    return s.Finish(result, []() { std::printf("resumed\n"); });
  });
}

namespace {

// Refuses a share the share table does not know, unless forced; `orIndexed` also accepts a
// share that configured folders still name.
bool CheckShare(Session& session, const std::string& name, bool force, bool orIndexed) {
  if (force || ShareExists(name) || (orIndexed && FI::IndexMgr::IsShareIndexed(name))) return true;
  session.Fail("share " + name, "no such share (--force goes on anyway)", "NO_SUCH_SHARE");
  return false;
}

}  // namespace

void AddShareCommands(CLI::App& app, Action& action) {
  CLI::App* share = Group(app, "share", "Share hooks, flags and checks");

  struct ShareArgs {
    std::string name;
    std::string other;
    bool remove = false;
    std::string needReindex;
    std::string noSpace;
    bool force = false;
  };
  auto AddForce = [](CLI::App* cmd, const std::shared_ptr<ShareArgs>& args) {
    cmd->add_flag("--force", args->force, "Go on even though the share table does not know the share");
  };

  // Hooks that take one share name and report success. `remove` also takes a share that is
  // gone from the share table as long as folders of it are configured (it is called after
  // the share was deleted).
  struct Hook {
    const char* command;
    const char* description;
    const char* operation;
    bool (*call)(const std::string&);
    const char* done;
    bool acceptIndexed;
    bool (*applied)(const std::string&);
  };
  static const Hook kHooks[] = {
      {"remove", "Forget every folder of a removed share", "IndexMgr::ShareRemove",
       &FI::IndexMgr::ShareRemove, "folders of share %s forgotten", true,
       [](const std::string& name) { return !FI::IndexMgr::IsShareIndexed(name); }},
      {"pause", "Stop the daemon's worker of a share and drop its watch list", "IndexMgr::SharePause",
       &FI::IndexMgr::SharePause, "share %s paused", false, nullptr},
      {"resume", "Restore a share's watch list and revive its worker", "IndexMgr::ShareResume",
       &FI::IndexMgr::ShareResume, "share %s resumed", false, nullptr},
      {"revive", "Clear a share's no-space flag and revive its worker", "StatusMgr::ShareRevive",
       &FI::StatusMgr::ShareRevive, "share %s revived", false,
       [](const std::string& name) { return !FI::StatusMgr::ShareIsNoSpace(name); }},
      {"clean", "Remove a share's queue files and index database", "IndexMgr::CleanShareIndexData",
       &FI::IndexMgr::CleanShareIndexData, "index data of share %s removed", true, nullptr},
  };
  for (const Hook& hook : kHooks) {
    auto args = std::make_shared<ShareArgs>();
    CLI::App* cmd = Command(*share, hook.command, hook.description, action, [args, &hook](Session& s) {
      if (CheckShare(s, args->name, args->force, hook.acceptIndexed)) {
        std::function<bool()> applied;
        if (hook.applied != nullptr) applied = [&]() { return hook.applied(args->name); };
        s.Call(
            hook.operation, [&]() { return hook.call(args->name); },
            std::string(hook.command) + " share " + args->name, applied);
      }
      Json::Value result;
      result["share"] = args->name;
      return s.Finish(result, [&]() {
        std::printf(hook.done, args->name.c_str());
        std::printf("\n");
      });
    });
    cmd->add_option("share", args->name, "Share name")->required();
    AddForce(cmd, args);
  }

  auto rename = std::make_shared<ShareArgs>();
  CLI::App* cmd = Command(
      *share, "rename", "Move the folders of a renamed share to its new name", action, [rename](Session& s) {
        if (CheckShare(s, rename->name, rename->force, true) &&
            CheckShare(s, rename->other, rename->force, false)) {
          auto moved = [&]() { return !FI::IndexMgr::IsShareIndexed(rename->name); };
          s.Call(
              "IndexMgr::ShareRename",
              [&]() { return FI::IndexMgr::ShareRename(rename->name, rename->other); },
              "rename share " + rename->name + " to " + rename->other, moved);
        }
        Json::Value result;
        result["old"] = rename->name;
        result["new"] = rename->other;
        return s.Finish(result, [&]() {
          std::printf("folders of share %s moved to share %s\n", rename->name.c_str(), rename->other.c_str());
        });
      });
  cmd->add_option("old", rename->name, "Old share name")->required();
  cmd->add_option("new", rename->other, "New share name")->required();
  AddForce(cmd, rename);

  auto watch = std::make_shared<ShareArgs>();
  cmd = Command(*share, "watch", "Rebuild (or --delete) a share's watch list from folder.conf", action,
                [watch](Session& s) {
                  if (!CheckShare(s, watch->name, watch->force, true))
                    return s.Finish(Json::Value(), nullptr);
                  if (watch->remove) {
                    s.Call("IndexMgr::DeleteTAVotifydCfg",
                           [&]() { return FI::IndexMgr::DeleteTAVotifydCfg(watch->name); });
                  } else {
                    s.Call("IndexMgr::UpsertTAVotifydCfg",
                           [&]() { return FI::IndexMgr::UpsertTAVotifydCfg(watch->name); });
                  }
                  Json::Value result;
                  result["share"] = watch->name;
                  result["watched"] = !watch->remove;
                  return s.Finish(result, [&]() {
                    std::printf("watch list of share %s %s\n", watch->name.c_str(),
                                watch->remove ? "deleted" : "rebuilt");
                  });
                });
  cmd->add_option("share", watch->name, "Share name")->required();
  cmd->add_flag("--delete", watch->remove, "Delete the watch list instead");
  AddForce(cmd, watch);

  auto flags = std::make_shared<ShareArgs>();
  cmd = Command(*share, "flags", "Show, set or clear a share's need-reindex and no-space flags", action,
                [flags](Session& s) {
                  const std::string& name = flags->name;
                  bool changing = !flags->needReindex.empty() || !flags->noSpace.empty();
                  if (changing && !CheckShare(s, name, flags->force, true))
                    return s.Finish(Json::Value(), nullptr);
                  if (!flags->needReindex.empty()) {
                    bool set = flags->needReindex == "set";
                    s.Call(
                        "StatusMgr::ShareSetNeedReindex",
                        [&]() { return FI::StatusMgr::ShareSetNeedReindex(name, set); },
                        "share " + name + " --need-reindex " + flags->needReindex,
                        [&]() { return FI::StatusMgr::ShareIsNeedReindex(name) == set; });
                  }
                  if (!flags->noSpace.empty() && !s.failed()) {
                    bool set = flags->noSpace == "set";
                    s.Call(
                        "StatusMgr::ShareSetNoSpace",
                        [&]() { return FI::StatusMgr::ShareSetNoSpace(name, set); },
                        "share " + name + " --no-space " + flags->noSpace,
                        [&]() { return FI::StatusMgr::ShareIsNoSpace(name) == set; });
                  }
                  Json::Value result;
                  result["share"] = name;
                  if (!s.failed()) {
                    bool needReindex = false, noSpace = false;
                    s.Call(
                        "StatusMgr::ShareIsNeedReindex",
                        [&]() {
                          needReindex = FI::StatusMgr::ShareIsNeedReindex(name);
                          noSpace = FI::StatusMgr::ShareIsNoSpace(name);
                          return true;
                        },
                        "share " + name);
                    result["need_reindex"] = needReindex;
                    result["no_space"] = noSpace;
                  }
                  return s.Finish(result, [&]() {
                    std::printf("share %s  need-reindex: %s  no-space: %s\n", name.c_str(),
                                YesNo(result["need_reindex"].asBool()), YesNo(result["no_space"].asBool()));
                  });
                });
  cmd->add_option("share", flags->name, "Share name")->required();
  cmd->add_option("--need-reindex", flags->needReindex, "set or clear")
      ->check(CLI::IsMember({"set", "clear"}));
  cmd->add_option("--no-space", flags->noSpace, "set or clear (setting notifies the administrators once)")
      ->check(CLI::IsMember({"set", "clear"}));
  AddForce(cmd, flags);

  auto space = std::make_shared<ShareArgs>();
  cmd = Command(*share, "space", "Whether 10 MiB more fit on the share", action, [space](Session& s) {
    return Answer(s, "IsShareSpaceEnough", space->name, "enough space",
                  [&]() { return FI::IsShareSpaceEnough(space->name); });
  });
  cmd->add_option("share", space->name, "Share name")->required();

  auto indexed = std::make_shared<ShareArgs>();
  cmd =
      Command(*share, "indexed", "Whether the share holds an indexed folder", action, [indexed](Session& s) {
        return Answer(s, "IndexMgr::IsShareIndexed", indexed->name, "indexed",
                      [&]() { return FI::IndexMgr::IsShareIndexed(indexed->name); });
      });
  cmd->add_option("share", indexed->name, "Share name")->required();

  // Spotlight is one switch for every share: Samba's, set by the library when the first
  // folder is indexed. Finder's searches need the indexing daemon's endpoint too.
  auto spotlight = std::make_shared<int>(kSpotlightPort);
  cmd = Command(*share, "spotlight", "Whether Samba's Spotlight is on and its searches are answered", action,
                [spotlight](Session& s) {
                  bool on =
                      s.Ask("TAVOSMBIsEnableSpotlight", []() { return TAVOSMBIsEnableSpotlight() == 1; });
                  const std::string endpoint = "127.0.0.1:" + std::to_string(*spotlight);
                  const bool answering = AcceptsConnections("127.0.0.1", *spotlight);
                  Json::Value result;
                  result["spotlight"] = on;
                  result["endpoint"] = endpoint;
                  result["answering"] = answering;
                  return s.Finish(
                      result,
                      [&]() {
                        std::printf("spotlight: %s (smb.conf)\nendpoint %s: %s\n", on ? "on" : "off",
                                    endpoint.c_str(), answering ? "answering" : "not answering");
                      },
                      !(on && answering));
                });
  cmd->add_option("--port", *spotlight, "The endpoint's port (fileindexd --spotlight-port)")
      ->capture_default_str()
      ->check(CLI::Range(1, 65535));

  auto canIndex = std::make_shared<ShareArgs>();
  cmd = Command(
      *share, "can-index", "Whether folders of the share may be indexed", action, [canIndex](Session& s) {
        PTAVOSHARE record = nullptr;
        if (!s.Call("TAVOShareGet", [&]() { return TAVOShareGet(canIndex->name.c_str(), &record) >= 0; }))
          return s.Finish(Json::Value(), nullptr);
        std::unique_ptr<TAVOSHARE, void (*)(PTAVOSHARE)> owned(record, &TAVOShareFree);
        return Answer(s, "CanShareBeIndexed", canIndex->name, "can be indexed",
                      [&]() { return FI::CanShareBeIndexed(owned.get()); });
      });
  cmd->add_option("share", canIndex->name, "Share name")->required();
}

void AddPathCommands(CLI::App& app, Action& action) {
  CLI::App* path = Group(app, "path", "Path checks and per-share locations");

  struct PathArgs {
    std::string path;
    bool full = false;
  };

  auto indexed = std::make_shared<PathArgs>();
  CLI::App* cmd = Command(*path, "indexed", "Whether a path is an indexed folder or lies in one", action,
                          [indexed](Session& s) {
                            if (indexed->full)
                              return Answer(s, "IndexMgr::IsFullPathIndexed", indexed->path, "indexed",
                                            [&]() { return FI::IndexMgr::IsFullPathIndexed(indexed->path); });
                            return Answer(s, "IndexMgr::IsPathIndexed", indexed->path, "indexed",
                                          [&]() { return FI::IndexMgr::IsPathIndexed(indexed->path); });
                          });
  cmd->add_option("path", indexed->path, "Share path (/share/dir), or a full path with --full")->required();
  cmd->add_flag("--full", indexed->full, "The path is a full file-system path");

  auto contains = std::make_shared<PathArgs>();
  cmd = Command(*path, "contains-indexed", "Whether an indexed folder is the path or lies below it", action,
                [contains](Session& s) {
                  return Answer(s, "IndexMgr::IsPathContainIndexed", contains->path, "contains indexed",
                                [&]() { return FI::IndexMgr::IsPathContainIndexed(contains->path); });
                });
  cmd->add_option("path", contains->path, "Share path")->required();

  auto can = std::make_shared<PathArgs>();
  cmd = Command(*path, "can-index", "Whether a path may be configured for indexing, and the rule if not",
                action, [can](Session& s) {
                  if (can->full)
                    return Answer(s, "CanFullPathBeIndexed", can->path, "can be indexed",
                                  [&]() { return FI::CanFullPathBeIndexed(can->path); });
                  std::string normal, why;
                  if (!NormaliseSharePath(can->path, normal, why)) {
                    s.Fail(Printable(can->path), why, "INVALID_PATH");
                    return s.Finish(Json::Value(), nullptr);
                  }
                  std::string rule;
                  s.Ask("CanPathBeIndexed", [&]() {
                    rule = IndexRule(normal);
                    return rule.empty();
                  });
                  Json::Value result;
                  result["subject"] = normal;
                  result["can be indexed"] = rule.empty();
                  if (!rule.empty()) result["rule"] = rule;
                  return s.Finish(
                      result,
                      [&]() {
                        std::printf("%s  can be indexed: %s\n", normal.c_str(),
                                    rule.empty() ? "yes" : ("no (" + rule + ")").c_str());
                      },
                      !rule.empty());
                });
  cmd->add_option("path", can->path, "Share path, or a full path with --full")->required();
  cmd->add_flag("--full", can->full, "The path is a full file-system path");

  auto skip = std::make_shared<PathArgs>();
  cmd = Command(*path, "skip", "Whether the indexing daemon skips a full path", action, [skip](Session& s) {
    return Answer(s, "IsSkipIndex", skip->path, "skipped", [&]() { return FI::IsSkipIndex(skip->path); });
  });
  cmd->add_option("full-path", skip->path, "Full file-system path")->required();

  auto governing = std::make_shared<PathArgs>();
  cmd = Command(*path, "governing", "The folder whose settings apply to a full path", action,
                [governing](Session& s) {
                  std::vector<FI::Folder> folders;
                  Json::Value result;
                  if (s.Call("IndexMgr::List", [&]() { return FI::IndexMgr::List(folders); }))
                    result = FI::GetMostSuitableCfg(folders, governing->path);
                  return s.Finish(result, [&]() {
                    if (result.isMember("path")) {
                      PrintRecord(result);
                    } else {
                      std::printf("no indexed folder governs %s\n", governing->path.c_str());
                    }
                  });
                });
  cmd->add_option("full-path", governing->path, "Full file-system path")->required();

  auto full = std::make_shared<PathArgs>();
  cmd = Command(*path, "full", "The full path of a share path", action, [full](Session& s) {
    std::string resolved;
    s.Call("GetFullPath", [&]() { return FI::GetFullPath(resolved, full->path); });
    Json::Value result;
    result["path"] = full->path;
    result["full_path"] = resolved;
    return s.Finish(result, [&]() { std::printf("%s\n", resolved.c_str()); });
  });
  cmd->add_option("path", full->path, "Share path")->required();

  auto owner = std::make_shared<PathArgs>();
  cmd = Command(
      *path, "share", "The share holding a full path, and its directory", action, [owner](Session& s) {
        std::string name, directory;
        s.Call("GetShareNamePathByFullPath",
               [&]() { return FI::GetShareNamePathByFullPath(name, directory, owner->path); });
        Json::Value result;
        result["share"] = name;
        result["directory"] = directory;
        return s.Finish(result, [&]() { std::printf("%s  %s\n", name.c_str(), directory.c_str()); });
      });
  cmd->add_option("full-path", owner->path, "Full file-system path")->required();

  for (bool queue : {true, false}) {
    auto share = std::make_shared<PathArgs>();
    const char* name = queue ? "queue" : "db";
    const char* description =
        queue ? "A share's event queue file" : "A share's index database directory (made)";
    cmd = Command(*path, name, description, action, [share, queue](Session& s) {
      char buffer[4096] = {0};
      s.Call(queue ? "FILEIDXQueuePathGet" : "FILEIDXDBPathGet", [&]() {
        int n = queue ? FILEIDXQueuePathGet(share->path.c_str(), buffer, sizeof(buffer))
                      : FILEIDXDBPathGet(share->path.c_str(), buffer, sizeof(buffer));
        return n >= 0;
      });
      Json::Value result;
      result["share"] = share->path;
      result[queue ? "queue" : "db"] = buffer;
      return s.Finish(result, [&]() { std::printf("%s\n", buffer); });
    });
    cmd->add_option("share", share->path, "Share name")->required();
  }
}

void AddMiscCommands(CLI::App& app, Action& action) {
  Command(app, "migrate",
          "Bring services, watch lists and queues into line with folder.conf (once, after an upgrade)",
          action, [](Session& s) {
            s.Call("Updater_vem60_beta2", []() { return FI::Updater_vem60_beta2(); });
            Json::Value result;
            result["migrated"] = true;
            return s.Finish(result, []() { std::printf("migrated\n"); });
          });

  CLI::App* mark = Group(app, "mark", "Updated marks kept in status.conf");
  auto key = std::make_shared<std::string>();
  Command(*mark, "set", "Mark a key as updated", action,
          [key](Session& s) {
            s.Call("StatusMgr::SetUpdated", [&]() { return FI::StatusMgr::SetUpdated(*key); });
            Json::Value result;
            result["key"] = *key;
            return s.Finish(result, [&]() { std::printf("%s marked as updated\n", key->c_str()); });
          })
      ->add_option("key", *key, "Key")
      ->required();
  auto showKey = std::make_shared<std::string>();
  Command(*mark, "show", "Whether a key is marked as updated", action,
          [showKey](Session& s) {
            return Answer(s, "StatusMgr::IsUpdated", *showKey, "updated",
                          [&]() { return FI::StatusMgr::IsUpdated(*showKey); });
          })
      ->add_option("key", *showKey, "Key")
      ->required();

  CLI::App* event = Group(app, "event", "Custom events in a share's queue");
  struct EventArgs {
    int code = 0;
    std::string path;
    std::string data = "null";
  };
  auto add = std::make_shared<EventArgs>();
  CLI::App* cmd =
      Command(*event, "add", "Append an event for a full path (absorbed by a pending reindex)", action,
              [add](Session& s) {
                Json::Value data;
                std::string errors;
                if (!ParseJson(add->data, data, errors)) {
                  s.Fail("event add", "--data is not JSON: " + errors);
                } else {
                  s.Call("AddCustomEvent", [&]() { return FI::AddCustomEvent(add->code, add->path, data); });
                }
                Json::Value result;
                result["event"] = add->code;
                result["path"] = add->path;
                return s.Finish(
                    result, [&]() { std::printf("event %d queued for %s\n", add->code, add->path.c_str()); });
              });
  cmd->add_option("code", add->code, "Event code (65536 reindex, 131072 settings changed)")->required();
  cmd->add_option("full-path", add->path, "Full file-system path")->required();
  cmd->add_option("--data", add->data, "JSON payload")->capture_default_str();

  auto update = std::make_shared<EventArgs>();
  cmd = Command(*event, "update", "Queue a settings event for a folder", action, [update](Session& s) {
    Json::Value setting;
    std::string errors;
    if (!ParseJson(update->data, setting, errors)) {
      s.Fail("event update", "the setting is not JSON: " + errors);
    } else {
      s.Call("IndexMgr::Update", [&]() { return FI::IndexMgr::Update(update->path, setting); });
    }
    Json::Value result;
    result["path"] = update->path;
    return s.Finish(result, [&]() { std::printf("settings event queued for %s\n", update->path.c_str()); });
  });
  cmd->add_option("path", update->path, "Folder path (/share/directory)")->required();
  cmd->add_option("setting", update->data, "JSON settings record")->required();

  struct SendArgs {
    std::string type;
    std::string data = "{}";
  };
  auto send = std::make_shared<SendArgs>();
  cmd = Command(app, "send", "Send one command to the indexing daemon", action, [send](Session& s) {
    Json::Value data;
    std::string errors;
    if (!ParseJson(send->data, data, errors)) {
      s.Fail("send", "the data is not JSON: " + errors);
    } else {
      s.Call("SendCammandToDaemon", [&]() { return FI::SendCammandToDaemon(send->type, data); });
    }
    Json::Value result;
    result["sent"] = send->type;
    return s.Finish(result, [&]() { std::printf("sent %s\n", send->type.c_str()); });
  });
  cmd->add_option("type", send->type, "Command name")->required();
  cmd->add_option("data", send->data, "JSON data")->capture_default_str();
  cmd->group("Advanced");
  event->group("Advanced");
  mark->group("Advanced");

  cmd = Command(app, "notify-no-space", "Raise the administrators' out-of-space notification", action,
                [](Session& s) {
                  s.Call("NotifyNoSpace", []() { return FI::NotifyNoSpace(); });
                  Json::Value result;
                  result["notified"] = true;
                  return s.Finish(result, []() { std::printf("notified\n"); });
                });
  cmd->group("Advanced");
}

}  // namespace fileindexctl
