// Logger: the process-wide log of the library. The process picks once where lines go (syslog, a
// standard stream, or a file rotated by size) and how verbose they are; every message carries its
// own level tag, source file and line, and ends with its own newline.
#ifndef S2S_LOGGER_H
#define S2S_LOGGER_H

#include <sys/types.h>

#include <string>

#include "s2s_export.h"

namespace S2S {

class S2S_EXPORT Logger {
  public:
    enum Type : int { Syslog = 0, Stdout = 1, Stderr = 2, File = 3 };
    // The syslog priority numbers; a message passes when its level is <= log_level.
    enum Level : int { Error = 3, Warning = 4, Note = 5, Info = 6, Debug = 7 };

    // Chooses the output. For the file kind (any type but 0..2) `count` is the number of rotated
    // file names. Must not run while another thread logs.
    static int Initialize(Type type, int level, const std::string& path, int count);
    // Writes one message; callers pass the source line as the first variadic argument.
    static void LogMsg(Level level, const char* format, ...) __attribute__((format(printf, 2, 3)));
    // Rotates the log file. Takes no lock: LogMsg calls it with the log's lock held.
    static int Rotate();
    // Closes a log file and falls back to standard output (only in file mode).
    static void Destroy();
    // In file mode, opens the log file anew at log_path (after an outside tool moved it away),
    // gives it the permission bits `mode` and starts counting its size from 0. Takes the log's
    // lock, so it may run while other threads log: no line is lost or torn. 0, or -1 (errno set)
    // outside file mode or when the file cannot be opened; the old stream then stays in use.
    static int Reopen(mode_t mode);

    static int log_level;
    static int log_size;
    static int rotate_cnt;
    static int log_type;
    static std::string log_path;
    // The stream written to and the lock around every write and rotation are private to the
    // logger's source; they keep their exported names (log_fp, log_mutex) there, so programs
    // built against the earlier form of this header still link and share the same state.
};

}  // namespace S2S

#endif  // S2S_LOGGER_H
