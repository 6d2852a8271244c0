// Pieces of the receiver shared by its configuration, its hooks and its command handlers.
#ifndef S2S_RSYNC_RECEIVER_INTERNAL_H
#define S2S_RSYNC_RECEIVER_INTERNAL_H

#include <map>
#include <string>

namespace S2S {
namespace receiver_internal {

// A share name a client may use: what the share registry accepts, without quotes, "..", or a
// leading '@' (reserved for the service modules and encrypted shares' modules).
bool ValidShareName(const std::string& name);
// A task name: no control characters, quotes, brackets or backslashes, no outer blanks.
bool ValidTaskName(const std::string& name);

// Reads a command file: the token line, then command="...", clientID="..." and the command's
// keys, each key once. The token is set whenever the first line is a valid token line, even when
// the rest is refused. 0, or 203 (malformed).
int ParseCommandFile(const std::string& input, std::string* token,
                     std::map<std::string, std::string>* pairs);

// Removes the replies (and records) of connections that have ended: the command module's early
// hook does it before it answers, a stop once the daemon's processes are gone.
void RemoveFinishedReplies();

// Writes all of `content` to `fd` (EINTR retried); false on the first failed write.
bool WriteAll(int fd, const std::string& content);

// 1 when the share registry has the share (`*encrypted` set), 0 when not, -1 on failure.
int ShareEncrypted(const std::string& name, bool* encrypted);

}  // namespace receiver_internal
}  // namespace S2S

#endif  // S2S_RSYNC_RECEIVER_INTERNAL_H
