// fileindexctl: the command-line front end of libfileindex.
#include <fileindex/error.h>

#include <climits>
#include <cstdio>
#include <cstdlib>

#include "commands.h"
#include "syslog_capture.h"

int main(int argc, char** argv) {
  fileindexctl::Options options;
  CLI::App app{"Configure and control the file-indexing service through libfileindex.", "fileindexctl"};
  app.require_subcommand(1);
  app.fallthrough();
  app.add_option("--sysroot", options.sysroot,
                 "System root for every file the library and the platform use (sets FILEINDEX_SYSROOT)");
  app.add_flag("--json", options.json, "Print results (and failures) as JSON");
  app.add_flag("-v,--verbose", options.verbose, "Also show the library's log lines of calls that succeed");
  app.add_option("--log-level", options.logLevel,
                 "The library's LOG_LEVEL (7 adds the queue writer's debug lines)");
  bool noSyslog = false;
  app.add_flag("--no-syslog", noSyslog, "Do not pass the library's log lines on to the system log");

  fileindexctl::Action action;
  fileindexctl::AddFolderCommands(app, action);
  fileindexctl::AddStatusCommands(app, action);
  fileindexctl::AddShareCommands(app, action);
  fileindexctl::AddPathCommands(app, action);
  fileindexctl::AddMiscCommands(app, action);
  fileindexctl::AddSandboxCommands(app, action);
  fileindexctl::AddSearchCommand(app, action);

  try {
    app.parse(argc, argv);
  } catch (const CLI::ParseError& e) {
    return app.exit(e) == 0 ? 0 : 2;
  }

  // Before any library call: the library and the platform read the root on every call.
  // `sandbox init` creates its root; every other command needs an existing one.
  bool creating = app.get_subcommand("sandbox")->got_subcommand("init");
  if (!options.sysroot.empty() && !creating) {
    char resolved[PATH_MAX];
    if (::realpath(options.sysroot.c_str(), resolved) == nullptr) {
      std::fprintf(stderr, "fileindexctl: --sysroot %s: no such directory\n", options.sysroot.c_str());
      return 2;
    }
    options.sysroot = resolved;
    ::setenv("FILEINDEX_SYSROOT", resolved, 1);
  } else if (const char* root = std::getenv("FILEINDEX_SYSROOT")) {
    options.sysroot = root;
  }
  if (options.logLevel >= 0) TAVO::FILEINDEX::LOG_LEVEL = options.logLevel;
  fileindexctl::SetForwardToSyslog(!noSyslog);

  if (!action) return 2;
  fileindexctl::Session session(options);
  return action(session);
}
