// The sync password: read from a file (or standard input) or from the environment, never from
// the command line, where every user of the machine could see it in the process list.
#ifndef S2S_TOOLS_S2S_PASSWORD_H
#define S2S_TOOLS_S2S_PASSWORD_H

#include <string>

namespace s2s_cli {

// The environment variable that may carry the password; it is removed from the environment once
// read, so no child process inherits it.
extern const char kPasswordEnv[];

// Reads the first line of `path` ("-" for standard input) into `password`. The file must be a
// regular file that neither the group nor other users can read, and at most 4 KiB long.
bool ReadPasswordFile(const std::string& path, std::string& password, std::string& error);

// True when the file at `path` can be read by users other than its owner (or cannot be checked).
bool IsReadableByOthers(const std::string& path);

// The password from `file` when given, else from the environment; `found` tells whether either
// source was present (a task file may still supply one).
bool LoadPassword(const std::string& file, std::string& password, bool& found, std::string& error);

}  // namespace s2s_cli

#endif  // S2S_TOOLS_S2S_PASSWORD_H
