// The commands of `s2s`. Each takes its own arguments (after the command word) and returns the
// process exit code (exit_codes.h); each answers --help.
#ifndef S2S_TOOLS_S2S_COMMANDS_H
#define S2S_TOOLS_S2S_COMMANDS_H

#include <string>
#include <vector>

namespace s2s_cli {

using Args = std::vector<std::string>;

int RunShareCommand(const Args& args);    // s2s share add|remove|list
int RunSyncCommand(const Args& args);     // s2s sync
int RunNextRunCommand(const Args& args);  // s2s next-run
int RunTaskCommand(const Args& args);     // s2s task check|show

// Prints "s2s: <message>" to standard error (and a hint to --help for usage errors); returns
// `code` so callers can write `return Fail(kExitUsage, "...")`.
int Fail(int code, const std::string& message);
// Sets where the library's log lines go and how many: `verbosity` -1 none, 0 errors to the system
// log (not the terminal), 1 informational and 2 debug lines to standard error.
void SetupLogging(int verbosity);

}  // namespace s2s_cli

#endif  // S2S_TOOLS_S2S_COMMANDS_H
