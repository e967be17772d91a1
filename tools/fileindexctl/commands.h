// The commands of fileindexctl.
#ifndef FILEINDEXCTL_COMMANDS_H
#define FILEINDEXCTL_COMMANDS_H

#include <CLI/CLI.hpp>
#include <functional>

#include "session.h"

namespace fileindexctl {

// The command chosen on the command line, run once the global options are applied.
using Action = std::function<int(Session&)>;

void AddFolderCommands(CLI::App& app, Action& action);
void AddStatusCommands(CLI::App& app, Action& action);
void AddShareCommands(CLI::App& app, Action& action);
void AddPathCommands(CLI::App& app, Action& action);
void AddMiscCommands(CLI::App& app, Action& action);
void AddSandboxCommands(CLI::App& app, Action& action);
void AddSearchCommand(CLI::App& app, Action& action);

}  // namespace fileindexctl

#endif
