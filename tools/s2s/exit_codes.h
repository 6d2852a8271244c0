// What `s2s` tells its caller: one exit code per class of failure (scripts branch on them, so the
// numbers never change), and a readable name for every remote result code the sync can meet.
#ifndef S2S_TOOLS_S2S_EXIT_CODES_H
#define S2S_TOOLS_S2S_EXIT_CODES_H

#include <string>

namespace s2s_cli {

enum ExitCode : int {
    kExitOK = 0,           // everything asked for was done
    kExitInternal = 1,     // a local failure: share facts, client identity, temporary files
    kExitUsage = 2,        // the command line is wrong
    kExitInvalidTask = 3,  // the task file or the task's settings are invalid
    kExitPassword = 4,     // the password could not be read safely
    kExitUnreachable = 5,  // no address of the server answered
    kExitAuth = 6,         // the server refused the user name or password
    kExitConflict = 7,     // a share is already paired with another client
    kExitRefused = 8,      // the server refused a command (pairing, start, finish, status)
    kExitTransfer = 9,     // copying a share failed; the share is not marked complete
    kExitKeySync = 10,     // an encrypted share's key could not be sent
    kExitRegistry = 11,    // the share registry could not be read or changed
    // Asking the sync service s2sd (s2s task ..., s2s pause|resume):
    kExitNoService = 20,   // s2sd is not running (its control socket is missing or refuses)
    kExitNoSuchTask = 21,  // the service keeps no task with that id
    kExitBusy = 22,        // the task is running (cancel it first)
    kExitNotRunning = 23,  // cancel of a task that is not running
    kExitService = 24,     // the service refused the request or failed (see the message)
    // a share's folder was missing, empty or not mounted; it was not synced
    kExitUnsafeSource = 12,
    // a share's run would have deleted more than --max-delete allows; nothing was deleted
    kExitMaxDelete = 13,
    kExitCancelled = 130,  // stopped by Ctrl-C or SIGTERM; nothing marked complete
};

// "ok", "usage", "invalid-task", ...: the stable word used in --json output.
const char* ExitCodeName(ExitCode code);
// One line a person reads: what the class means.
const char* ExitCodeMeaning(ExitCode code);

// A remote result code (rsync's own exit codes, the server's answers, the client's local codes)
// as "name (number)", e.g. "conflict (214)"; unknown codes as "code 77".
std::string ResultName(int code);
// The short description of a result code, or "" when none is known.
const char* ResultMeaning(int code);

}  // namespace s2s_cli

#endif  // S2S_TOOLS_S2S_EXIT_CODES_H
