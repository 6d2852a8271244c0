// The names and meanings of the exit codes of `s2s`, and the readable names of remote result codes
// in its output. One table row per exit code; the numbers themselves live in exit_codes.h.
#include "tools/s2s/exit_codes.h"

#include "s2s_task_run.h"

namespace s2s_cli {

namespace {

struct ExitInfo {
    ExitCode code;
    const char* name;
    const char* meaning;
};

const ExitInfo kExitTable[] = {
    {kExitOK, "ok", "everything asked for was done"},
    {kExitInternal, "internal", "a local failure (share facts, client identity, temporary files)"},
    {kExitUsage, "usage", "the command line is wrong"},
    {kExitInvalidTask, "invalid-task", "the task file or the task's settings are invalid"},
    {kExitPassword, "password", "the password could not be read safely"},
    {kExitUnreachable, "unreachable", "no address of the server answered"},
    {kExitAuth, "auth", "the server refused the user name or password"},
    {kExitConflict, "conflict", "a share is already paired with another client"},
    {kExitRefused, "refused", "the server refused a command"},
    {kExitTransfer, "transfer", "copying a share failed; it is not marked complete"},
    {kExitKeySync, "key-sync", "an encrypted share's key could not be sent"},
    {kExitRegistry, "registry", "the share registry could not be read or changed"},
    {kExitUnsafeSource, "unsafe-source",
     "a share's folder is missing, empty or not mounted; it was not synced"},
    {kExitMaxDelete, "max-delete", "a share's run would have deleted more than allowed"},
    {kExitNoService, "no-service", "the sync service s2sd is not running"},
    {kExitNoSuchTask, "no-such-task", "the sync service keeps no task with that id"},
    {kExitBusy, "busy", "the task is running (cancel it first)"},
    {kExitNotRunning, "not-running", "the task is not running"},
    {kExitService, "service", "the sync service refused the request or failed"},
    {kExitCancelled, "cancelled", "stopped by a signal; nothing was marked complete"},
};

}  // namespace

const char* ExitCodeName(ExitCode code) {
    for (const ExitInfo& info : kExitTable) {
        if (info.code == code) {
            return info.name;
        }
    }
    return "unknown";
}

const char* ExitCodeMeaning(ExitCode code) {
    for (const ExitInfo& info : kExitTable) {
        if (info.code == code) {
            return info.meaning;
        }
    }
    return "";
}

std::string ResultName(int code) {
    return S2S::RsyncResultName(code);
}

const char* ResultMeaning(int code) {
    return S2S::RsyncResultMeaning(code);
}

}  // namespace s2s_cli
