// The daemon's own file operations: directories it owns, and a file replaced whole (written to a
// temporary name, synced, renamed over the old one, the directory synced) so that a crash leaves
// the old or the new content, never a mix.
#ifndef S2S_SERVICE_FILES_H
#define S2S_SERVICE_FILES_H

#include <sys/types.h>

#include <string>

namespace s2sd {

// Creates `dir` and its missing parents with `mode`; an existing directory is left as it is.
// 0, or -1 with `error` set.
int MakeDirs(const std::string& dir, mode_t mode, std::string& error);
// Replaces `path` with `content`, created with `mode` (not subject to the umask).
int ReplaceFile(const std::string& path, const std::string& content, mode_t mode,
                std::string& error);
// The whole file; false when it cannot be read.
bool ReadFile(const std::string& path, std::string& content);

}  // namespace s2sd

#endif  // S2S_SERVICE_FILES_H
