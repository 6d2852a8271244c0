// Pieces of the receiver shared by its configuration, its hooks and its command handlers.
#ifndef S2S_RSYNC_RECEIVER_INTERNAL_H
#define S2S_RSYNC_RECEIVER_INTERNAL_H

#include <map>
#include <string>

namespace S2S {
namespace receiver_internal {

// Reads a command file: the token line, then command="...", clientID="..." and the command's
// keys, each key once. The token is set whenever the first line is a valid token line, even when
// the rest is refused. 0, or 203 (malformed).
int ParseCommandFile(const std::string& input, std::string* token,
                     std::map<std::string, std::string>* pairs);

// Removes the replies (and records) of connections that have ended: the command module's early
// hook does it before it answers, a stop once the daemon's processes are gone.
void RemoveFinishedReplies();

// Brings the share modules of the written daemon configuration up to date with the share
// registry (the daemon reads its configuration for every connection, so a share registered after
// `configure` is served at once). 0 when they are (rewritten or already so), -1 with `*error`.
int RefreshShareModules(std::string* error);

// Writes all of `content` to `fd` (EINTR retried); false on the first failed write.
bool WriteAll(int fd, const std::string& content);

// 1 when the share registry has the share (`*encrypted` set), 0 when not, -1 on failure.
int ShareEncrypted(const std::string& name, bool* encrypted);

}  // namespace receiver_internal
}  // namespace S2S

#endif  // S2S_RSYNC_RECEIVER_INTERNAL_H
