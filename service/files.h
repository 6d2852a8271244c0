// The daemon's own file operations: directories it owns, a file replaced whole (written to a
// temporary name, synced, renamed over the old one, the directory synced) so that a crash leaves
// the old or the new content, never a mix, and the lock that keeps one daemon per root.
#ifndef S2S_SERVICE_FILES_H
#define S2S_SERVICE_FILES_H

#include <sys/types.h>

#include <string>

namespace s2sd {

// Creates `dir` and its missing parents with `mode`; an existing directory is left as it is.
// 0, or -1 with `error` set.
int MakeDirs(const std::string& dir, mode_t mode, std::string& error);
// Replaces `path` with `content`, created with `mode` (not subject to the umask), through the
// platform's atomic replacement (S2SFileReplace).
int ReplaceFile(const std::string& path, const std::string& content, mode_t mode,
                std::string& error);
// The whole file; false when it cannot be read.
bool ReadFile(const std::string& path, std::string& content);

// Takes the exclusive lock on `path` (created 0600 with its missing directories) without waiting
// and returns its descriptor, to be held open for the life of the process. The lock belongs to
// the open file, so a child made by fork() holds it after its parent exits; the descriptor is
// close-on-exec, so programs the daemon starts never hold it. -2 when another process holds it
// (`error` says so, `holder` is the pid it wrote into the file, 0 when not known yet); -1 with
// `error` set when the file cannot be opened or locked.
int LockInstance(const std::string& path, long& holder, std::string& error);
// Writes this process's pid into the lock file held as `fd` (done again after a fork).
int WriteLockPid(int fd, std::string& error);

}  // namespace s2sd

#endif  // S2S_SERVICE_FILES_H
