// `fileindexctl sandbox`: a ready system root for the library and the host platform.
#include <sys/stat.h>
#include <tavo/platform.h>
#include <unistd.h>

#include <climits>
#include <cstdlib>
#include <fstream>
#include <memory>
#include <sstream>

#include "commands.h"
#include "output.h"

namespace fileindexctl {

namespace {

struct ShareLayout {
  const char* name;
  const char* volume;
  bool readOnly;
  bool encrypted;
  bool recycleBin;
  std::vector<const char*> files;  // relative to the share directory
};

// Two volumes; docs is read-only and vault encrypted (and locked), so neither may be indexed.
const ShareLayout kShares[] = {
    {"photo",
     "/volume1",
     false,
     false,
     true,
     {"2019/beach.jpg", "2019/mountain.jpg", "2020/city.jpg", "#recycle/deleted.jpg",
      "#snapshot/daily/beach.jpg"}},
    {"video", "/volume1", false, false, true, {"movies/holiday.mkv", "series/pilot.mp4"}},
    {"docs", "/volume1", true, false, false, {"manuals/router.pdf"}},
    {"music", "/volume2", false, false, false, {"albums/live.flac"}},
    {"vault", "/volume2", false, true, false, {"secret.txt"}},
};

std::string Quote(const std::string& text) {
  std::string quoted = "'";
  for (char c : text) quoted += c == '\'' ? std::string("'\\''") : std::string(1, c);
  return quoted + "'";
}

bool MakeDirs(const std::string& path) {
  if (path.empty()) return true;
  struct stat st;
  if (::stat(path.c_str(), &st) == 0) return S_ISDIR(st.st_mode);
  std::string::size_type slash = path.rfind('/');
  if (slash != std::string::npos && slash > 0 && !MakeDirs(path.substr(0, slash))) return false;
  return ::mkdir(path.c_str(), 0755) == 0 || errno == EEXIST;
}

bool WriteFile(const std::string& path, const std::string& text, mode_t mode = 0644) {
  std::string::size_type slash = path.rfind('/');
  if (!MakeDirs(path.substr(0, slash))) return false;
  std::ofstream out(path, std::ios::trunc);
  out << text;
  out.close();
  return out && ::chmod(path.c_str(), mode) == 0;
}

bool IsExecutable(const std::string& path) {
  struct stat st;
  return !path.empty() && ::stat(path.c_str(), &st) == 0 && S_ISREG(st.st_mode) &&
         ::access(path.c_str(), X_OK) == 0;
}

std::string Canonical(const std::string& path) {
  char resolved[PATH_MAX];
  return ::realpath(path.c_str(), resolved) != nullptr ? resolved : "";
}

// A program of this project: the one this build made, else one beside this program (or
// in the build tree's sibling folder), else on PATH.
std::string FindProgram(const std::string& name, const char* built, const std::string& buildFolder) {
  std::vector<std::string> candidates;
  if (built != nullptr && *built != '\0') candidates.push_back(built);
  std::string self = Canonical("/proc/self/exe");
  std::string dir = self.substr(0, self.rfind('/'));
  candidates.push_back(dir + "/" + name);
  candidates.push_back(dir + "/../" + buildFolder + "/" + name);
  candidates.push_back(dir + "/../../" + buildFolder + "/" + name);
  for (const char* sbin : {"/usr/sbin/", "/usr/local/sbin/"}) candidates.push_back(sbin + name);
  if (const char* path = std::getenv("PATH")) {
    std::stringstream entries(path);
    std::string entry;
    while (std::getline(entries, entry, ':')) {
      if (!entry.empty()) candidates.push_back(entry + "/" + name);
    }
  }
  for (const std::string& candidate : candidates) {
    if (IsExecutable(candidate)) return Canonical(candidate);
  }
  return "";
}

#ifndef FILEINDEXCTL_PROBE
#define FILEINDEXCTL_PROBE ""
#endif
#ifndef FILEINDEXCTL_FILEINDEXD
#define FILEINDEXCTL_FILEINDEXD ""
#endif
#ifndef FILEINDEXCTL_TAVOTIFYD
#define FILEINDEXCTL_TAVOTIFYD ""
#endif

Json::Value ShareTable() {
  Json::Value table;
  table["shares"] = Json::Value(Json::arrayValue);
  for (const ShareLayout& layout : kShares) {
    Json::Value share;
    share["name"] = layout.name;
    share["path"] = std::string(layout.volume) + "/" + layout.name;
    share["readonly"] = layout.readOnly;
    share["encrypted"] = layout.encrypted;
    share["encryption"] = layout.encrypted;
    share["recycle_bin"] = layout.recycleBin;
    table["shares"].append(share);
  }
  return table;
}

std::string SambaConf() {
  std::string text =
      "# Samba configuration of the sandbox appliance.\n"
      "# The indexing service switches Spotlight with the \"spotlight\" parameter of [global];\n"
      "# these comments, the other parameters and the share sections stay as they are.\n"
      "\n"
      "[global]\n"
      "\tworkgroup = WORKGROUP\n"
      "\tserver string = Sandbox NAS\n"
      "\t; log level = 3\n"
      "\tlog level = 1\n";
  for (const ShareLayout& layout : kShares) {
    text += std::string("\n[") + layout.name + "]\n\tpath = " + layout.volume + "/" + layout.name +
            "\n\tread only = " + (layout.readOnly ? "yes" : "no") + "\n";
  }
  return text;
}

// The service hook of one of the sandbox's daemons, run by the host platform with status,
// start, stop or restart. The daemon records its own process id (it holds an instance lock
// on the pid file); `before` runs first on start, `after` on stop.
struct DaemonService {
  std::string name;
  std::string command;     // the whole command line, quoted
  std::string readyPath;   // start waits until this exists (empty: until the pid file does)
  std::string before;      // shell commands run before a start
  std::string after;       // shell commands run after a stop
  bool recordPid = false;  // the program does not record its process id: the hook does
  std::string logName;     // its standard output and error go to var/log/<logName>
};

std::string ServiceHook(const std::string& root, const DaemonService& service) {
  const std::string readyTest =
      service.readyPath.empty() ? "[ -s \"$pidfile\" ]" : "[ -S " + Quote(service.readyPath) + " ]";
  return "#!/bin/sh\n"
         "# Service hook of the sandbox's \"" +
         service.name +
         "\", run by the host platform with\n"
         "# status, start, stop or restart.\n"
         "root=" +
         Quote(root) +
         "\n"
         "pidfile=\"$root/var/run/" +
         service.name +
         ".pid\"\n"
         "log=\"$root/var/log/" +
         (service.logName.empty() ? service.name + ".log" : service.logName) +
         "\"\n"
         "\n"
         "# Running: the recorded process exists and is not a zombie left for its reaper.\n"
         "running() {\n"
         "  [ -s \"$pidfile\" ] || return 1\n"
         "  pid=$(cat \"$pidfile\")\n"
         "  kill -0 \"$pid\" 2>/dev/null && ! grep -q '^State:[[:space:]]*Z' \"/proc/$pid/status\" "
         "2>/dev/null\n"
         "}\n"
         "note() { echo \"$(date '+%Y-%m-%d %H:%M:%S') " +
         service.name +
         " $*\" >> \"$root/var/log/services.log\"; }\n"
         "\n"
         "case \"$1\" in\n"
         "  status) running ;;\n"
         "  start)\n"
         "    running && exit 0\n" +
         (service.before.empty() ? "" : "    " + service.before + "\n") +
         "    rm -f \"$pidfile\"\n"
         "    " +
         service.command +
         " </dev/null >>\"$log\" 2>&1 &\n"
         "    child=$!\n" +
         (service.recordPid ? "    echo \"$child\" > \"$pidfile\"\n" : "") +
         "    # Commands follow the start at once: wait until it is ready.\n"
         "    tries=0\n"
         "    until " +
         readyTest +
         " && running; do\n"
         "      tries=$((tries + 1))\n"
         "      if [ \"$tries\" -gt 500 ] || ! kill -0 \"$child\" 2>/dev/null; then note \"failed to "
         "start\"; exit 1; fi\n"
         "      sleep 0.01\n"
         "    done\n"
         "    note \"started (pid $(cat \"$pidfile\"))\" ;;\n"
         "  stop)\n"
         "    if running; then\n"
         "      kill \"$pid\"\n"
         "      # A clean stop commits the work in hand: give it time.\n"
         "      tries=0\n"
         "      while running && [ \"$tries\" -lt 1000 ]; do tries=$((tries + 1)); sleep 0.01; done\n"
         "      running && kill -9 \"$pid\"\n"
         "      note \"stopped (pid $pid)\"\n"
         "    fi\n" +
         (service.after.empty() ? "" : "    " + service.after + "\n") +
         "    exit 0 ;;\n"
         "  restart) \"$0\" stop && \"$0\" start ;;\n"
         "  *) echo \"usage: $0 status|start|stop|restart\" >&2; exit 2 ;;\n"
         "esac\n";
}

std::string SambaHook(const std::string& root) {
  return "#!/bin/sh\n"
         "# Service hook of the sandbox's Samba: there is no Samba here, so it only notes the call.\n"
         "root=" +
         Quote(root) +
         "\n"
         "[ \"$1\" = status ] && exit 0\n"
         "echo \"$(date '+%Y-%m-%d %H:%M:%S') samba $1\" >> \"$root/var/log/services.log\"\n";
}

std::string Notifier(const std::string& root) {
  return "#!/bin/sh\n"
         "# Stand-in for the appliance's desktop notifier: one line per notification.\n"
         "root=" +
         Quote(root) +
         "\n"
         "{ printf '%s' \"$(date '+%Y-%m-%d %H:%M:%S')\"; for arg in \"$@\"; do printf ' [%s]' \"$arg\"; "
         "done; echo; }"
         " >> \"$root/var/log/notify.log\"\n";
}

int Init(Session& s, const std::string& dir, bool useProbe, bool force, int spotlightPort) {
  if (!MakeDirs(dir)) {
    s.Fail("sandbox init", "cannot create " + dir + ": " + std::strerror(errno));
    return s.Finish(Json::Value(), nullptr);
  }
  // The library compares realpath() with the paths it builds, so the root must be canonical.
  const std::string root = Canonical(dir);
  if (!force && ::access((root + "/etc/tavo/shares.json").c_str(), F_OK) == 0) {
    s.Fail("sandbox init", root + " already holds a sandbox (--force to write it again)");
    return s.Finish(Json::Value(), nullptr);
  }
  // The indexing daemon and the notification daemon, or the probe standing in for both.
  std::vector<DaemonService> daemons;
  std::string daemonProgram;
  const std::string socket = root + "/var/run/fileindexd.sock";
  if (useProbe) {
    daemonProgram = FindProgram("fileindex-probe", FILEINDEXCTL_PROBE, "probe");
    daemons.push_back(
        {"fileindexd",
         Quote(daemonProgram) + " --sysroot \"$root\" --output \"$root/var/log/fileindexd.log\"", socket, "",
         "", true, "fileindexd.err"});
  } else {
    daemonProgram = FindProgram("fileindexd", FILEINDEXCTL_FILEINDEXD, "daemons/fileindexd");
    const std::string notifier = FindProgram("tavotifyd", FILEINDEXCTL_TAVOTIFYD, "daemons/tavotifyd");
    if (notifier.empty()) {
      s.Fail("sandbox init", "tavotifyd not found; build it (or use --probe)");
      return s.Finish(Json::Value(), nullptr);
    }
    daemons.push_back(
        {"tavotifyd", Quote(notifier) + " --sysroot \"$root\" --foreground", "", "", "", false, ""});
    // The notification daemon comes with the indexing daemon, as a dependency would.
    const std::string hooks = root + "/etc/tavo/services/";
    daemons.push_back({"fileindexd",
                       Quote(daemonProgram) + " --sysroot \"$root\" --spotlight-port " +
                           std::to_string(spotlightPort) + " --log-stderr",
                       socket, Quote(hooks + "tavotifyd") + " start || exit 1", "", false, ""});
  }
  if (!IsExecutable(daemonProgram)) {
    s.Fail("sandbox init", useProbe ? "fileindex-probe not found; build it"
                                    : "fileindexd not found; build it (or use --probe)");
    return s.Finish(Json::Value(), nullptr);
  }

  bool ok = true;
  for (const char* sub : {"/usr/tavo/etc/fileindex", "/tmp", "/var/run", "/var/log", "/run/tavo/service",
                          "/run/tavotifyd", "/etc/tavo/services"}) {
    ok = ok && MakeDirs(root + sub);
  }
  for (const ShareLayout& layout : kShares) {
    const std::string share = root + layout.volume + "/" + layout.name;
    ok = ok && MakeDirs(share);
    for (const char* file : layout.files) ok = ok && WriteFile(share + "/" + file, std::string(file) + "\n");
  }
  // A link inside a share: the indexing rules refuse paths through it.
  const std::string link = root + "/volume1/photo/latest";
  if (::access(link.c_str(), F_OK) != 0) ok = ok && ::symlink("2020", link.c_str()) == 0;

  Json::StreamWriterBuilder builder;
  builder["indentation"] = "  ";
  ok = ok && WriteFile(root + "/etc/tavo/shares.json", Json::writeString(builder, ShareTable()) + "\n");
  ok = ok && WriteFile(root + "/etc/samba/smb.conf", SambaConf());
  for (const DaemonService& daemon : daemons)
    ok = ok && WriteFile(root + "/etc/tavo/services/" + daemon.name, ServiceHook(root, daemon), 0755);
  ok = ok && WriteFile(root + "/etc/tavo/services/samba", SambaHook(root), 0755);
  ok = ok && WriteFile(root + "/usr/tavo/bin/tavovemnotify", Notifier(root), 0755);
  if (!ok) {
    s.Fail("sandbox init", std::string("cannot write the sandbox: ") + std::strerror(errno));
    return s.Finish(Json::Value(), nullptr);
  }

  Json::Value result;
  result["root"] = root;
  result["daemon"] = daemonProgram;
  result["probe"] = useProbe;
  result["shares"] = ShareTable()["shares"];
  return s.Finish(result, [&]() {
    std::printf("sandbox ready in %s\n", root.c_str());
    Table table({"SHARE", "DIRECTORY", "READ-ONLY", "ENCRYPTED", "RECYCLE BIN"});
    for (const ShareLayout& layout : kShares) {
      table.AddRow({layout.name, root + layout.volume + "/" + layout.name, YesNo(layout.readOnly),
                    YesNo(layout.encrypted), YesNo(layout.recycleBin)});
    }
    table.Print(stdout);
    std::printf("%s: %s (started as the service fileindexd)\n", useProbe ? "daemon probe" : "indexing daemon",
                daemonProgram.c_str());
    std::printf("use it with:  fileindexctl --sysroot %s ...   or   export FILEINDEX_SYSROOT=%s\n",
                root.c_str(), root.c_str());
  });
}

// Renames a share in the sandbox's share table together with its directory, as the
// appliance does before it calls the library's rename hook.
int RenameShare(Session& s, const std::string& from, const std::string& to) {
  const std::string root = Canonical(s.options().sysroot);
  const std::string tablePath = root + "/etc/tavo/shares.json";
  std::ifstream in(tablePath);
  std::stringstream text;
  text << in.rdbuf();
  Json::Value table;
  std::string errors;
  if (root.empty() || !in || !ParseJson(text.str(), table, errors) || !table["shares"].isArray()) {
    s.Fail("sandbox rename-share", "no share table in " + tablePath);
    return s.Finish(Json::Value(), nullptr);
  }
  for (Json::Value& share : table["shares"]) {
    if (share["name"].asString() != from) continue;
    std::string dir = share["path"].asString();
    std::string renamed = dir.substr(0, dir.rfind('/') + 1) + to;
    if (::rename((root + dir).c_str(), (root + renamed).c_str()) != 0) {
      s.Fail("sandbox rename-share", "cannot rename " + root + dir + ": " + std::strerror(errno));
      return s.Finish(Json::Value(), nullptr);
    }
    share["name"] = to;
    share["path"] = renamed;
    Json::StreamWriterBuilder builder;
    builder["indentation"] = "  ";
    if (!WriteFile(tablePath, Json::writeString(builder, table) + "\n")) {
      s.Fail("sandbox rename-share", "cannot write " + tablePath);
      return s.Finish(Json::Value(), nullptr);
    }
    Json::Value result;
    result["old"] = from;
    result["new"] = to;
    result["directory"] = root + renamed;
    return s.Finish(result, [&]() {
      std::printf("share %s is now %s in %s\n", from.c_str(), to.c_str(), (root + renamed).c_str());
    });
  }
  s.Fail("sandbox rename-share", "no share named " + from);
  return s.Finish(Json::Value(), nullptr);
}

}  // namespace

void AddSandboxCommands(CLI::App& app, Action& action) {
  CLI::App* sandbox = app.add_subcommand("sandbox", "A system root for trying the library on this machine");
  sandbox->require_subcommand(1);

  struct InitArgs {
    std::string dir;
    bool probe = false;
    bool force = false;
    int spotlightPort = 9200;
  };
  auto init = std::make_shared<InitArgs>();
  CLI::App* cmd = sandbox->add_subcommand(
      "init", "Create a system root: shares on two volumes, share table, Samba configuration, service hooks");
  cmd->add_option("dir", init->dir, "Directory of the new system root")->required();
  cmd->add_flag(
      "--probe", init->probe,
      "Let the daemon probe stand in for the daemons: it logs each command to var/log/fileindexd.log");
  cmd->add_flag("--force", init->force, "Write over an existing sandbox");
  cmd->add_option("--spotlight-port", init->spotlightPort,
                  "Port of the indexing daemon's Spotlight endpoint on 127.0.0.1 (0: none)")
      ->capture_default_str()
      ->check(CLI::Range(0, 65535));
  cmd->callback([&action, init]() {
    action = [init](Session& s) { return Init(s, init->dir, init->probe, init->force, init->spotlightPort); };
  });

  auto names = std::make_shared<std::pair<std::string, std::string>>();
  cmd = sandbox->add_subcommand("rename-share",
                                "Rename a share and its directory in the sandbox (needs --sysroot)");
  cmd->add_option("old", names->first, "Share name")->required();
  cmd->add_option("new", names->second, "New share name")->required();
  cmd->callback([&action, names]() {
    action = [names](Session& s) { return RenameShare(s, names->first, names->second); };
  });

  cmd = sandbox->add_subcommand("stop", "Stop the sandbox's daemons (the fileindexd and tavotifyd services)");
  cmd->callback([&action]() {
    action = [](Session& s) {
      s.Call("VLIBServiceStop", []() { return VLIBServiceStop("fileindexd", 1) >= 0; });
      const std::string notifierHook = Canonical(s.options().sysroot) + "/etc/tavo/services/tavotifyd";
      if (::access(notifierHook.c_str(), F_OK) == 0)
        s.Call("VLIBServiceStop", []() { return VLIBServiceStop("tavotifyd", 1) >= 0; });
      Json::Value result;
      result["stopped"] = "fileindexd";
      return s.Finish(result, []() { std::printf("fileindexd stopped\n"); });
    };
  });
}

}  // namespace fileindexctl
