// The receiving end over a stock rsync daemon: its configuration (command module, share modules,
// key module), starting and stopping it, and the handler of the command files that clients send
// through the command module. The program s2s-receiver is a thin front over these functions; the
// command exchange and every answer are described in docs/protocol.md.
//
// Every path lives below $S2S_ROOT when it is set (S2SPath), so a test runs a whole receiver in
// a temporary directory:
//   S2S_ROOT=/tmp/x s2s-receiver configure --port 8730 --address 127.0.0.1 --user u <<< "secret"
//   S2S_ROOT=/tmp/x s2s-receiver start
// and a client wrapper reaches it with setPort(8730) and setDestPath("127.0.0.1", "u", "secret",
// "<share>", "").
#ifndef S2S_RECEIVER_H
#define S2S_RECEIVER_H

#include <string>
#include <vector>

#include "s2s_export.h"

namespace S2S {

// Fixed paths of the receiver (each passed through S2SPath).
#define S2S_PATH_RSYNCD_CONF "/usr/vurn/etc/s2s_rsyncd.conf"        // the daemon's configuration
#define S2S_PATH_RSYNCD_SECRETS "/usr/vurn/etc/s2s_rsyncd.secrets"  // user:password, mode 0600
#define S2S_PATH_RSYNCD_LOG "/var/log/s2s_rsyncd.log"               // the daemon's log
#define S2S_PATH_RSYNCD_LOCK "/var/run/s2s_rsyncd.lock"             // the daemon's lock file
#define S2S_PATH_RECEIVER_LOCK "/var/run/s2s_receiver.lock"         // configure/start/stop lock
#define S2S_PATH_COMMAND_SPOOL "/var/spool/s2s"                     // replies of commands

// Daemon module names. Share names starting with '@' are not served: that prefix is reserved
// for these modules and for encrypted shares ("@" + name + "@").
#define S2S_COMMAND_MODULE "@s2s-cmd"
#define S2S_KEY_MODULE "@s2s-key"

// The protocol version a current receiver reports to "S2S_GetProtocolVer".
#define S2S_RECEIVER_PROTOCOL_VERSION 1

// Result codes of the receiver's answers (see docs/protocol.md); 200-206 and 214 agree with the
// pairing store's codes.
enum ReceiverResult : int {
    kReceiverOK = 0,
    kReceiverUnknownCommand = 43,  // the command is not known (also an old server's answer)
    kReceiverMissingKey = 201,     // a required key is missing or empty
    kReceiverUnknownKey = 202,     // a key the command does not take (old server: attributes)
    kReceiverMalformed = 203,      // not a well-formed command file, or a malformed value
    kReceiverBadName = 204,        // a share or task name that is not allowed
    kReceiverStoreWrite = 205,     // the pairing store could not be written
    kReceiverStoreRead = 206,      // the pairing store could not be read
    kReceiverPairedOther = 207,    // single-client pairing: another client is paired
    kReceiverNotPaired = 208,      // the client has not paired with this server
    kReceiverNoShare = 209,        // the server has no such share
    kReceiverAttrMismatch = 210,   // the share's encryption differs from the server's share
    kReceiverBadFinishType = 211,  // an unknown "finishType"
    kReceiverShareConflict = 214,  // shares bound to another client
    kReceiverInternal = 215,       // the receiver failed (out of memory, file system)
    kReceiverStoreFull = 216,      // the pairing store takes no more (size, clients, tasks)
};

struct S2S_EXPORT ReceiverSettings {
    int port = 873;
    std::string address;   // listen address; empty: every address
    std::string user;      // the one rsync account clients authenticate as
    std::string password;  // written to the secrets file only (mode 0600)
    // Answers like a server from before multi-source support: no "S2S_GetProtocolVer" or
    // "S2S_PairingMultiSrc", no attribute keys in "S2S_SyncStart", single-client pairing.
    bool oldServer = false;
    // The program the daemon runs for commands (this program: s2s-receiver).
    std::string handlerPath;
    // Connections each module serves at once; more are told to try later.
    int maxConnections = 16;
};

// Configure, start, stop and the refresh of the share modules take one lock
// (S2S_PATH_RECEIVER_LOCK) for their whole run: they never overlap.

// Writes the daemon configuration and the secrets file from `settings` and the share registry.
// Refuses a registry with two shares the daemon would serve as one module (VURNShareModuleKey).
// Shares that cannot be modules are skipped, each with a line in `*notes` (when given). The key
// directory is made private again (0700, files 0600). 0, or -1 with an ERROR line (and `*error`
// set when given).
S2S_EXPORT int ReceiverConfigure(const ReceiverSettings& settings, std::string* error,
                                 std::vector<std::string>* notes = nullptr);

// Marks the service switched on in the pairing store, then starts the rsync daemon with the
// written configuration and waits until it accepts connections. 0, or -1 (`*error`) with no
// daemon left running: also when the pairing store cannot be written.
S2S_EXPORT int ReceiverStart(std::string* error);
// Stops the daemon (and the transfers it runs) and marks the service switched off. 0, also when
// it was not running; 1 when it stopped but the pairing store could not record that (`*error`
// says so); -1 when it would not stop.
S2S_EXPORT int ReceiverStop(std::string* error);
// True while the daemon of the pid file is alive.
S2S_EXPORT bool ReceiverRunning();

// One command file as it reached the command module (the early input: a token line, then the
// command lines). Runs the command; `*token` is the reply token ("" when the input has none,
// then no reply can be given), `*output` the output file's content (may stay empty).
struct S2S_EXPORT ReceiverAnswer {
    std::string token;
    int result = kReceiverInternal;
    bool hasOutput = false;
    std::string output;
};
S2S_EXPORT ReceiverAnswer ReceiverRunCommand(const std::string& input, bool oldServer);

// Whether the receiver takes `name` as a task name (the task's heartbeat): not empty, at most a
// share name's length, no control characters, quotes, brackets, slashes, backslashes or "..", no
// outer blanks, no leading '@'. Senders check it before a run sends anything.
S2S_EXPORT bool ReceiverTaskNameValid(const std::string& name);
// The rule above, for a person.
extern S2S_EXPORT const char kReceiverTaskNameRule[];

// The daemon's hooks for the command module (environment as rsync sets it for them):
// early exec: reads the command file from `in_fd`, answers into the spool. The process exit
// status: 0 when a reply was left.
S2S_EXPORT int ReceiverHookEarly(int in_fd, bool oldServer);
// The pre- and post-transfer hooks of configurations written by earlier versions (a fresh
// `configure` needs only the early one): pre-xfer exec answers 0 when the requested reply belongs
// to this connection; post-xfer exec removes this connection's reply.
S2S_EXPORT int ReceiverHookPre();
S2S_EXPORT int ReceiverHookPost();
// pre-xfer exec of the key module: 0 when the connection writes into the key directory of one
// registered encrypted share ("@s2s-key/<share>"), else 1 with the reason on standard output
// (shown to the client).
S2S_EXPORT int ReceiverHookKey();

// What `s2s-receiver status` shows.
struct S2S_EXPORT ReceiverShareState {
    std::string name;
    std::string state;  // "free", "running" or "completed"
    std::string owner;  // the bound client ("" when free)
    std::string completeID;
    long lastStart = 0;      // when a client last started a sync of it (seconds; 0: never)
    std::string lastResult;  // how the last finished sync ended: "complete", "abort", "unpair"
    long lastTime = 0;       // when it ended (0: no sync has finished)
};
struct S2S_EXPORT ReceiverClient {
    std::string clientID;
    std::string serverName;
};
struct S2S_EXPORT ReceiverStatus {
    bool running = false;        // the daemon is alive (read from the process, not from the store)
    int transfers = 0;           // connections inside a share or key module right now
    bool busy = false;           // some task sent a heartbeat in the last 120 seconds
    std::string storeError;      // why the pairing store could not be read ("" when it could)
    std::string pairedClientID;  // "PairedClientInfo" (single client, or the multi marker)
    std::string pairedServerName;
    std::vector<ReceiverClient> clients;
    std::vector<ReceiverShareState> shares;
};
// 0, or -1 when the pairing store cannot be read (`running` and `transfers` are still true).
S2S_EXPORT int ReceiverGetStatus(ReceiverStatus* status);

}  // namespace S2S

#endif  // S2S_RECEIVER_H
