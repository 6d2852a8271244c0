// The commands of `s2s`, as entries of the command tree (command_line.h). Each command's run
// function gets its parsed options and returns the process exit code (exit_codes.h).
#ifndef S2S_TOOLS_S2S_COMMANDS_H
#define S2S_TOOLS_S2S_COMMANDS_H

#include <string>
#include <vector>

#include "tools/s2s/command_line.h"

namespace s2s_cli {

using Args = std::vector<std::string>;

Command SyncCommand();                       // s2s sync
Command NextRunCommand();                    // s2s next-run
std::string ShareHelp();                     // s2s share --help
std::vector<Command> ShareCommands();        // s2s share add|remove|list
std::string TaskHelp();                      // s2s task --help
std::vector<Command> TaskFileCommands();     // s2s task check FILE
std::vector<Command> TaskServiceCommands();  // s2s task show|add|update|remove|list|run|...
std::vector<Command> ServiceCommands();      // s2s pause|resume

// A task file looked at without running it: validated as a sync would (exit 0 or
// kExitInvalidTask), or printed as the sync model sees it.
int CheckTaskFile(const std::string& path);
int ShowTaskFile(const std::string& path);

// Prints "s2s: <message>" to standard error (and a hint to --help for usage errors); returns
// `code` so callers can write `return Fail(kExitUsage, "...")`.
int Fail(int code, const std::string& message);
// Sets where the library's log lines go and how many: `verbosity` -1 none, 0 errors to the system
// log (not the terminal), 1 informational and 2 debug lines to standard error.
void SetupLogging(int verbosity);

}  // namespace s2s_cli

#endif  // S2S_TOOLS_S2S_COMMANDS_H
