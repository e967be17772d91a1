// fileindexctl: the command-line front end of libfileindex.
#include <fileindex/error.h>

#include <cerrno>
#include <climits>
#include <cstdio>
#include <cstdlib>
#include <cstring>
#include <exception>

#include "commands.h"
#include "syslog_capture.h"

#ifndef FILEINDEXCTL_VERSION
#define FILEINDEXCTL_VERSION "unknown"
#endif

namespace {

const char kGlobalOptions[] =
    "Global options (before or after the command): --sysroot DIR, --json, -v/--verbose, --wait SECONDS,\n"
    "--log-level N, --no-syslog, -h/--help, --version. Exit status: 0 success, 1 failure, 2 usage,\n"
    "3 the answer is \"no\", 4 saved but not fully applied, 75 gave up waiting for the lock.";

// Every command's help names the global options, which apply after the command too.
void AddFooters(CLI::App* app) {
  for (CLI::App* sub : app->get_subcommands({})) {
    sub->footer(kGlobalOptions);
    AddFooters(sub);
  }
}

// `help [COMMAND...]`: the help of the command named, as `COMMAND --help` prints it.
int Help(CLI::App& app, const std::vector<std::string>& words) {
  CLI::App* target = &app;
  for (const std::string& word : words) {
    CLI::App* sub = nullptr;
    try {
      sub = target->get_subcommand(word);
    } catch (const CLI::OptionNotFound&) {
    }
    if (sub == nullptr) {
      std::fprintf(stderr, "fileindexctl: help: no command \"%s\"\n", word.c_str());
      return fileindexctl::kExitUsage;
    }
    target = sub;
  }
  std::printf("%s", target->help().c_str());
  return 0;
}

}  // namespace

int main(int argc, char** argv) {
  fileindexctl::Options options;
  CLI::App app{"Configure and control the file-indexing service through libfileindex.", "fileindexctl"};
  app.require_subcommand(1);
  app.fallthrough();
  app.set_version_flag("--version", "fileindexctl " FILEINDEXCTL_VERSION " (libfileindex.so.6.0)");
  app.add_option("--sysroot", options.sysroot,
                 "System root for every file the library and the platform use (sets FILEINDEX_SYSROOT)")
      ->type_name("DIR");
  app.add_flag(
      "--json", options.json,
      "Print results and failures as JSON: {\"ok\": true, ...} or {\"ok\": false, \"error\": {...}}");
  app.add_flag("-v,--verbose", options.verbose,
               "Also show the library's log lines, API names and platform error codes");
  app.add_option("-w,--wait", options.waitSeconds,
                 "Seconds to wait for a configuration lock held by another process (0: fail at once)")
      ->capture_default_str()
      ->check(CLI::Range(0.0, 86400.0))
      ->type_name("SECONDS");
  app.add_option("--log-level", options.logLevel,
                 "The library's LOG_LEVEL (7 adds the queue writer's debug lines)");
  bool noSyslog = false;
  app.add_flag("--no-syslog", noSyslog, "Do not pass the library's log lines on to the system log");
  app.footer(
      "Exit status: 0 success, 1 failure, 2 usage, 3 the answer is \"no\", 4 saved but not fully applied,\n"
      "75 gave up waiting for the lock. 'fileindexctl help COMMAND' shows a command's options; see "
      "fileindexctl(1).");

  fileindexctl::Action action;
  fileindexctl::AddFolderCommands(app, action);
  fileindexctl::AddStatusCommands(app, action);
  fileindexctl::AddShareCommands(app, action);
  fileindexctl::AddPathCommands(app, action);
  fileindexctl::AddCheckCommands(app, action);
  fileindexctl::AddMiscCommands(app, action);
  fileindexctl::AddSandboxCommands(app, action);
  fileindexctl::AddSearchCommand(app, action);
  fileindexctl::AddWhyCommand(app, action);

  std::vector<std::string> helpWords;
  CLI::App* help = app.add_subcommand("help", "Show the help of a command: help [COMMAND [SUBCOMMAND]]");
  help->add_option("command", helpWords, "Command");
  AddFooters(&app);

  bool json = false;
  for (int i = 1; i < argc; ++i) json = json || std::strcmp(argv[i], "--json") == 0;
  try {
    app.parse(argc, argv);
  } catch (const CLI::CallForHelp& e) {
    return app.exit(e);
  } catch (const CLI::CallForAllHelp& e) {
    return app.exit(e);
  } catch (const CLI::CallForVersion& e) {
    return app.exit(e);
  } catch (const CLI::ParseError& e) {
    if (json) return fileindexctl::ReportEarly(true, e.what(), "USAGE", fileindexctl::kExitUsage);
    app.exit(e);
    return fileindexctl::kExitUsage;
  }
  if (help->parsed()) return Help(app, helpWords);

  // Before any library call: the library and the platform read the root on every call.
  // `sandbox init` creates its root; every other command needs an existing one.
  bool creating = app.get_subcommand("sandbox")->got_subcommand("init");
  if (!options.sysroot.empty() && !creating) {
    char resolved[PATH_MAX];
    if (::realpath(options.sysroot.c_str(), resolved) == nullptr) {
      return fileindexctl::ReportEarly(json, "--sysroot " + options.sysroot + ": " + std::strerror(errno),
                                       "USAGE", fileindexctl::kExitUsage);
    }
    options.sysroot = resolved;
    ::setenv("FILEINDEX_SYSROOT", resolved, 1);
  } else if (const char* root = std::getenv("FILEINDEX_SYSROOT")) {
    options.sysroot = root;
  }
  if (options.logLevel >= 0) TAVO::FILEINDEX::LOG_LEVEL = options.logLevel;
  fileindexctl::SetForwardToSyslog(!noSyslog);

  if (!action) return fileindexctl::kExitUsage;
  fileindexctl::Session session(options);
  // Every library call is guarded in the session; this is the last line for the tool's own code.
  try {
    return action(session);
  } catch (const std::exception& e) {
    return fileindexctl::ReportEarly(json, std::string("internal error: ") + e.what(), "INTERNAL",
                                     fileindexctl::kExitFailed);
  }
}
