// Every public operation of the library as a command.
#include "commands.h"
#include "index_view.h"

#include <fileindex/fileindex.h>
#include <tavo/platform.h>

#include <climits>
#include <cstdio>
#include <ctime>
#include <iostream>
#include <iterator>
#include <memory>

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
  std::string records;
};

std::string LastComponent(const std::string& path) {
  std::string p = path;
  while (p.size() > 1 && p.back() == '/') p.pop_back();
  return p.substr(p.rfind('/') + 1);
}

void AddFieldOptions(CLI::App* cmd, const std::shared_ptr<FolderFields>& fields) {
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
}

// The request array of folder records; a new folder gets its last path component as its
// name and every file type unless told otherwise.
bool BuildRecords(Session& session, const FolderFields& fields, bool adding, Json::Value& out) {
  if (!fields.records.empty()) {
    if (!fields.paths.empty()) {
      session.Fail("folders", "give either paths or --records, not both");
      return false;
    }
    std::string text = fields.records;
    if (text == "-") text.assign(std::istreambuf_iterator<char>(std::cin), std::istreambuf_iterator<char>());
    std::string errors;
    if (!ParseJson(text, out, errors)) {
      session.Fail("folders", "--records is not JSON: " + errors);
      return false;
    }
    return true;  // passed to the library as given, array or not
  }
  if (fields.paths.empty()) {
    session.Fail("folders", "no folder given (paths or --records)");
    return false;
  }
  bool anyType = fields.all;
  for (int value : fields.types) anyType = anyType || value >= 0;
  out = Json::Value(Json::arrayValue);
  for (const std::string& path : fields.paths) {
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

// Adds a subcommand whose action is set when it is chosen.
CLI::App* Command(CLI::App& parent, const std::string& name, const std::string& description, Action& action,
                  Action run) {
  CLI::App* cmd = parent.add_subcommand(name, description);
  cmd->callback([&action, run]() { action = run; });
  return cmd;
}

CLI::App* Group(CLI::App& app, const std::string& name, const std::string& description) {
  CLI::App* group = app.add_subcommand(name, description);
  group->require_subcommand(1);
  return group;
}

// A yes/no answer of the library.
int Answer(Session& session, const std::string& operation, const std::string& subject,
           const std::string& question, const std::function<bool()>& ask) {
  bool answer = session.Ask(operation, ask);
  Json::Value result;
  result["subject"] = subject;
  result[question] = answer;
  return session.Finish(
      result, [&]() { std::printf("%s  %s: %s\n", subject.c_str(), question.c_str(), YesNo(answer)); });
}

}  // namespace

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
        s.Call("IndexMgr::List", [&]() {
          return FI::IndexMgr::List(result, list->offset, list->limit, list->sortBy, list->direction,
                                    additional);
        });
        return s.Finish(result, [&]() {
          PrintFolderTable(result["folder"], list->additional);
          std::printf("(%u shown of %s, offset %s)\n", result["folder"].size(), Cell(result["total"]).c_str(),
                      Cell(result["offset"]).c_str());
        });
      });
  cmd->add_option("--offset", list->offset, "First folder of the page (ascending order only)");
  cmd->add_option("--limit", list->limit, "Folders per page (default: all)");
  cmd->add_option("--sort-by", list->sortBy, "name, path, document, audio, video or photo")
      ->capture_default_str();
  cmd->add_option("--direction", list->direction, "ASC or DESC")->capture_default_str();
  cmd->add_option("-a,--additional", list->additional, "Computed fields: status, is_valid")->delimiter(',');

  auto getPath = std::make_shared<std::string>();
  cmd = Command(*folders, "get", "One folder's record (read under the configuration lock)", action,
                [getPath](Session& s) {
                  Json::Value result;
                  s.Call("IndexMgr::Get", [&]() { return FI::IndexMgr::Get(result, *getPath); });
                  return s.Finish(result, [&]() { PrintRecord(result); });
                });
  cmd->add_option("path", *getPath, "Folder path (/share/directory)")->required();

  for (bool adding : {true, false}) {
    auto fields = std::make_shared<FolderFields>();
    const char* name = adding ? "add" : "set";
    const char* description = adding ? "Add folders (every file type unless flags say otherwise)"
                                     : "Change folders: only the fields given change";
    cmd = Command(*folders, name, description, action, [fields, adding](Session& s) {
      Json::Value records;
      if (!BuildRecords(s, *fields, adding, records)) return s.Finish(Json::Value(), nullptr);
      const char* operation = adding ? "IndexMgr::Add" : "IndexMgr::Set";
      if (!s.Call(operation,
                  [&]() { return adding ? FI::IndexMgr::Add(records) : FI::IndexMgr::Set(records); }))
        return s.Finish(Json::Value(), nullptr);
      Json::Value result(Json::objectValue);
      result["folder"] = Json::Value(Json::arrayValue);
      for (const Json::Value& record : records) {
        Json::Value stored;
        if (s.Call("IndexMgr::Get", [&]() { return FI::IndexMgr::Get(stored, record["path"].asString()); }))
          result["folder"].append(stored);
      }
      return s.Finish(result, [&]() {
        for (const Json::Value& record : result["folder"]) PrintRecord(record);
      });
    });
    AddFieldOptions(cmd, fields);
  }

  auto removePaths = std::make_shared<std::vector<std::string>>();
  cmd = Command(*folders, "remove", "Remove folders and clean up after them", action,
                [removePaths](Session& s) {
                  Json::Value paths = StringArray(*removePaths);
                  s.Call("IndexMgr::Delete", [&]() { return FI::IndexMgr::Delete(paths); });
                  Json::Value result;
                  result["removed"] = paths;
                  return s.Finish(result, [&]() {
                    for (const std::string& path : *removePaths) std::printf("removed %s\n", path.c_str());
                  });
                });
  cmd->add_option("paths", *removePaths, "Folder paths")->required();

  auto reindexPaths = std::make_shared<std::vector<std::string>>();
  cmd = Command(app, "reindex", "Queue a reindex event for folders", action, [reindexPaths](Session& s) {
    Json::Value paths = StringArray(*reindexPaths);
    s.Call("IndexMgr::Reindex", [&]() { return FI::IndexMgr::Reindex(paths); });
    Json::Value result;
    result["reindex"] = paths;
    return s.Finish(result, [&]() {
      for (const std::string& path : *reindexPaths) std::printf("reindex queued for %s\n", path.c_str());
    });
  });
  cmd->add_option("paths", *reindexPaths, "Folder paths (/share/directory)")->required();
}

void AddStatusCommands(CLI::App& app, Action& action) {
  auto paths = std::make_shared<std::vector<std::string>>();
  CLI::App* cmd = Command(
      app, "status", "Overall indexing status, pause state and each folder's status", action,
      [paths](Session& s) {
        Json::Value result(Json::objectValue);
        std::string status;
        if (s.Call("StatusMgr::GetStatus", [&]() { return FI::StatusMgr::GetStatus(status); }))
          result["status"] = status;
        long long resume = -1;
        long long now = static_cast<long long>(std::time(nullptr));
        if (s.Call("StatusMgr::GetPauseInfo", [&]() { return FI::StatusMgr::GetPauseInfo(resume); })) {
          result["resume_time"] = static_cast<Json::Int64>(resume);
          result["paused"] = resume == 0 || now < resume;
          if (resume > 0) result["resume_at"] = LocalTime(resume);
        }
        std::vector<std::string> folders = *paths;
        if (folders.empty()) {
          std::vector<FI::Folder> list;
          if (s.Call("IndexMgr::List", [&]() { return FI::IndexMgr::List(list); })) {
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
          result["folders"].append(item);
        }
        result["shares"] = ShareFiguresJson(figures);
        return s.Finish(result, [&]() {
          std::printf("indexing: %s\n", result["status"].asString().c_str());
          std::printf("pause:    %s\n", DescribePause(resume, now).c_str());
          if (result["folders"].size() == 0) return;
          PrintShareFigures(result["shares"]);
          Table table({"FOLDER", "STATUS", "INDEXED", "PENDING"});
          for (const Json::Value& item : result["folders"])
            table.AddRow({item["path"].asString(), item["status"].asString(), FigureText(item["indexed"]),
                          FigureText(item["pending"])});
          std::printf("\n");
          table.Print(stdout);
        });
      });
  cmd->add_option("paths", *paths, "Only these folders (default: every indexed folder)");

  auto hours = std::make_shared<int>(0);
  cmd = Command(
      app, "pause", "Pause indexing for whole hours (0 or none: until resumed)", action, [hours](Session& s) {
        s.Call("StatusMgr::Pause", [&]() { return FI::StatusMgr::Pause(*hours); });
        long long resume = -1;
        if (!s.failed())
          s.Call("StatusMgr::GetPauseInfo", [&]() { return FI::StatusMgr::GetPauseInfo(resume); });
        Json::Value result;
        result["resume_time"] = static_cast<Json::Int64>(resume);
        if (resume > 0) result["resume_at"] = LocalTime(resume);
        return s.Finish(result, [&]() {
          std::printf("%s\n", DescribePause(resume, static_cast<long long>(std::time(nullptr))).c_str());
        });
      });
  cmd->add_option("hours", *hours, "Hours to pause; 0 pauses until resumed")->capture_default_str();

  Command(app, "resume", "End a pause", action, [](Session& s) {
    s.Call("StatusMgr::Resume", []() { return FI::StatusMgr::Resume(); });
    Json::Value result;
    result["resumed"] = true;
    return s.Finish(result, []() { std::printf("resumed\n"); });
  });
}

void AddShareCommands(CLI::App& app, Action& action) {
  CLI::App* share = Group(app, "share", "Share hooks, flags and checks");

  struct ShareArgs {
    std::string name;
    std::string other;
    bool remove = false;
    std::string needReindex;
    std::string noSpace;
  };

  // Hooks that take one share name and report success.
  struct Hook {
    const char* command;
    const char* description;
    const char* operation;
    bool (*call)(const std::string&);
    const char* done;
  };
  static const Hook kHooks[] = {
      {"remove", "Forget every folder of a removed share", "IndexMgr::ShareRemove",
       &FI::IndexMgr::ShareRemove, "folders of share %s forgotten"},
      {"pause", "Stop the daemon's worker of a share and drop its watch list", "IndexMgr::SharePause",
       &FI::IndexMgr::SharePause, "share %s paused"},
      {"resume", "Restore a share's watch list and revive its worker", "IndexMgr::ShareResume",
       &FI::IndexMgr::ShareResume, "share %s resumed"},
      {"revive", "Clear a share's no-space flag and revive its worker", "StatusMgr::ShareRevive",
       &FI::StatusMgr::ShareRevive, "share %s revived"},
      {"clean", "Remove a share's queue files and index database", "IndexMgr::CleanShareIndexData",
       &FI::IndexMgr::CleanShareIndexData, "index data of share %s removed"},
  };
  for (const Hook& hook : kHooks) {
    auto args = std::make_shared<ShareArgs>();
    CLI::App* cmd = Command(*share, hook.command, hook.description, action, [args, &hook](Session& s) {
      s.Call(hook.operation, [&]() { return hook.call(args->name); });
      Json::Value result;
      result["share"] = args->name;
      return s.Finish(result, [&]() {
        std::printf(hook.done, args->name.c_str());
        std::printf("\n");
      });
    });
    cmd->add_option("share", args->name, "Share name")->required();
  }

  auto rename = std::make_shared<ShareArgs>();
  CLI::App* cmd = Command(
      *share, "rename", "Move the folders of a renamed share to its new name", action, [rename](Session& s) {
        s.Call("IndexMgr::ShareRename",
               [&]() { return FI::IndexMgr::ShareRename(rename->name, rename->other); });
        Json::Value result;
        result["old"] = rename->name;
        result["new"] = rename->other;
        return s.Finish(result, [&]() {
          std::printf("folders of share %s moved to share %s\n", rename->name.c_str(), rename->other.c_str());
        });
      });
  cmd->add_option("old", rename->name, "Old share name")->required();
  cmd->add_option("new", rename->other, "New share name")->required();

  auto watch = std::make_shared<ShareArgs>();
  cmd = Command(*share, "watch", "Rebuild (or --delete) a share's watch list from folder.conf", action,
                [watch](Session& s) {
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

  auto flags = std::make_shared<ShareArgs>();
  cmd = Command(*share, "flags", "Show, set or clear a share's need-reindex and no-space flags", action,
                [flags](Session& s) {
                  if (!flags->needReindex.empty()) {
                    bool set = flags->needReindex == "set";
                    s.Call("StatusMgr::ShareSetNeedReindex",
                           [&]() { return FI::StatusMgr::ShareSetNeedReindex(flags->name, set); });
                  }
                  if (!flags->noSpace.empty()) {
                    bool set = flags->noSpace == "set";
                    s.Call("StatusMgr::ShareSetNoSpace",
                           [&]() { return FI::StatusMgr::ShareSetNoSpace(flags->name, set); });
                  }
                  Json::Value result;
                  result["share"] = flags->name;
                  result["need_reindex"] = FI::StatusMgr::ShareIsNeedReindex(flags->name);
                  result["no_space"] = FI::StatusMgr::ShareIsNoSpace(flags->name);
                  return s.Finish(result, [&]() {
                    std::printf("share %s  need-reindex: %s  no-space: %s\n", flags->name.c_str(),
                                YesNo(result["need_reindex"].asBool()), YesNo(result["no_space"].asBool()));
                  });
                });
  cmd->add_option("share", flags->name, "Share name")->required();
  cmd->add_option("--need-reindex", flags->needReindex, "set or clear")
      ->check(CLI::IsMember({"set", "clear"}));
  cmd->add_option("--no-space", flags->noSpace, "set or clear (setting notifies the administrators once)")
      ->check(CLI::IsMember({"set", "clear"}));

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
  cmd =
      Command(*path, "can-index", "Whether a path may be configured for indexing", action, [can](Session& s) {
        if (can->full)
          return Answer(s, "CanFullPathBeIndexed", can->path, "can be indexed",
                        [&]() { return FI::CanFullPathBeIndexed(can->path); });
        return Answer(s, "CanPathBeIndexed", can->path, "can be indexed",
                      [&]() { return FI::CanPathBeIndexed(can->path); });
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
