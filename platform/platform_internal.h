// Helpers shared by the platform layer's sources: the per-thread last error and small string
// utilities (file access goes through platform/env.h). Nothing here is exported.
#ifndef S2S_PLATFORM_PLATFORM_INTERNAL_H
#define S2S_PLATFORM_PLATFORM_INTERNAL_H

#include <string>

namespace s2s_platform {

// Sets the calling thread's last platform error.
void SetError(int err);
// Sets `err` and returns -1: the usual failure exit of a platform function.
int Fail(int err);
// Sets the last error to 0 and returns `result`.
int Succeed(int result);
// The platform error that matches a system errno (ENOENT, EACCES, ENOMEM, other I/O).
int ErrorFromErrno(int errnum);

// Blanks (space, tab, CR, LF) removed at both ends.
std::string Trim(const std::string& text);
// Copies `value` with its NUL into buf of `size` bytes. Its length, or -1 with
// VLIB_ERR_BUFFER_TOO_SMALL (buf then holds "" when it has room for that) / VLIB_ERR_BAD_PARAMETER.
int CopyOut(const std::string& value, char* buf, int size);

}  // namespace s2s_platform

#endif  // S2S_PLATFORM_PLATFORM_INTERNAL_H
