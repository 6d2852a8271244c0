// Names and meanings of remote result codes: rsync's own exit codes, the receiving server's
// answers and the client's local codes, for messages a person reads.
#include <cstdio>
#include <string>

#include "s2s_task_run.h"

namespace S2S {

namespace {

struct ResultInfo {
    int code;
    const char* name;
    const char* meaning;
};

// rsync's own exit codes, then the answers of the sync server, then the client's local codes.
// The server's numbers are fixed by the protocol document (docs/protocol.md).
const ResultInfo kResultTable[] = {
    {0, "ok", "accepted"},
    {1, "rsync-usage", "rsync rejected its command line"},
    {2, "protocol-incompatible", "the rsync protocol versions do not match"},
    {3, "file-selection", "rsync could not select the files to send"},
    {4, "not-supported", "the requested action is not supported by the server's rsync"},
    {5, "session-refused", "the server refused the rsync session"},
    {6, "daemon-log", "the server's rsync daemon could not write its log"},
    {10, "socket-io", "the connection to the server failed"},
    {11, "file-io", "reading or writing a file failed"},
    {12, "stream-error", "the rsync data stream broke"},
    {13, "diagnostics", "rsync could not write its diagnostics"},
    {14, "ipc", "rsync's internal pipes failed"},
    {20, "interrupted", "rsync was stopped by a signal"},
    {21, "waitpid", "rsync could not wait for its helper"},
    {22, "out-of-memory", "rsync ran out of memory"},
    {23, "partial", "some files could not be transferred"},
    {24, "vanished", "some source files vanished during the transfer"},
    {25, "max-delete",
     "the deletion limit stopped deletions (more files were gone than the check before the "
     "copy found)"},
    {30, "timeout", "the transfer stalled past its time limit"},
    {35, "connect-timeout", "the server's rsync daemon did not answer in time"},
    {42, "no-address", "no address of the server could be looked up"},
    {43, "unknown-command", "the server does not know the command (an old server)"},
    {44, "no-version", "the server answered, but its protocol version could not be read"},
    {51, "unknown-command", "the server does not know the command (an old server)"},
    {52, "ssh-login",
     "over SSH the login cannot read the receiving server's daemon configuration (it must be "
     "root there)"},
    {53, "hook-failed",
     "the receiving server's command hook could not start or failed (its daemon log says why)"},
    {201, "missing-key", "the server found a required key missing"},
    {202, "attributes-refused", "the server does not accept share attributes"},
    {203, "malformed", "the server could not parse the command"},
    {204, "bad-name", "the server does not allow that share or task name"},
    {205, "store-write", "the server could not write its pairing store"},
    {206, "store-read", "the server could not read its pairing store"},
    {207, "paired-other", "the server is paired with another client"},
    {208, "not-paired", "this client has not paired with the server"},
    {209, "no-share", "the server has no share of that name"},
    {210, "attribute-mismatch", "the share's encryption differs from the server's share"},
    {211, "bad-finish-type", "the server does not know the finish type"},
    {213, "not-tested", "no server address was tested"},
    {214, "conflict", "some shares are paired with another client"},
    {215, "server-internal", "the receiving server failed internally"},
    {216, "store-full",
     "the receiving server's pairing store is full (a size or per-client limit)"},
    {255, "remote-shell", "the remote shell (ssh) failed"},
    {300, "local-key-failure", "the share's key could not be found locally"},
};

}  // namespace

std::string RsyncResultName(int code) {
    for (const ResultInfo& info : kResultTable) {
        if (info.code == code) {
            char text[96];
            std::snprintf(text, sizeof(text), "%s (%d)", info.name, code);
            return text;
        }
    }
    char text[32];
    std::snprintf(text, sizeof(text), "code %d", code);
    return text;
}

const char* RsyncResultMeaning(int code) {
    for (const ResultInfo& info : kResultTable) {
        if (info.code == code) {
            return info.meaning;
        }
    }
    return "";
}

}  // namespace S2S
