// The commands of fileindexctl. Each group of commands registers itself on the parser
// with one Add*Commands function; a new command lives in its own file and adds one line
// to the list in main.cpp.
#ifndef FILEINDEXCTL_COMMANDS_H
#define FILEINDEXCTL_COMMANDS_H

#include <CLI/CLI.hpp>
#include <functional>

#include "session.h"

namespace fileindexctl {

// The command chosen on the command line, run once the global options are applied.
using Action = std::function<int(Session&)>;

// Adds a subcommand whose action is set when it is chosen.
CLI::App* Command(CLI::App& parent, const std::string& name, const std::string& description, Action& action,
                  Action run);

void AddFolderCommands(CLI::App& app, Action& action);
void AddStatusCommands(CLI::App& app, Action& action);
void AddShareCommands(CLI::App& app, Action& action);
void AddPathCommands(CLI::App& app, Action& action);
void AddMiscCommands(CLI::App& app, Action& action);
void AddCheckCommands(CLI::App& app, Action& action);
void AddSandboxCommands(CLI::App& app, Action& action);
void AddSearchCommand(CLI::App& app, Action& action);
void AddWhyCommand(CLI::App& app, Action& action);

}  // namespace fileindexctl

#endif
