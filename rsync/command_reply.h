// The parts of the command exchange both ends agree on: the token line that opens the early
// input, the reply directory's two files and their limits (docs/protocol.md).
#ifndef S2S_RSYNC_COMMAND_REPLY_H
#define S2S_RSYNC_COMMAND_REPLY_H

#include <cstddef>
#include <string>

namespace S2S {
namespace command_reply {

// 128 random bits, written as 32 lower-case hex digits.
constexpr size_t kTokenBytes = 16;
// rsync hands at most about 5 KiB of early input to the daemon; the rest is cut silently.
constexpr size_t kMaxCommandFile = 4096;
// The largest output file a handler may leave (and a client accepts).
constexpr size_t kMaxOutput = 1024 * 1024;

// In the reply directory: the result code in decimal with a line break, and the output file.
constexpr const char* kResultFile = "result";
constexpr const char* kOutputFile = "output";

// token="<32 hex digits>" and a line break.
std::string TokenLine(const std::string& token);
// True for 32 lower-case hex digits.
bool ValidToken(const std::string& token);
// The result file's content: decimal 0..65535, optionally followed by one "\n".
bool ParseResult(const std::string& text, int* result);
// Removes a tree without following symbolic links; missing is fine.
void RemoveTree(const std::string& path);

}  // namespace command_reply
}  // namespace S2S

#endif  // S2S_RSYNC_COMMAND_REPLY_H
