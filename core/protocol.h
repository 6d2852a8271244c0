// The command exchange as both ends speak it (docs/protocol.md): command names, keys and their
// values, the token line that opens a command file, the reply directory's files, every result
// code with its number, and the one rule for share names on the wire and in the receiving
// daemon's configuration. Pure definitions: the sender's builders, the receiver's handlers, the
// platform's share registry and the public result constants are all defined from this header,
// so a name or number changed here changes on both ends at once.
#ifndef S2S_CORE_PROTOCOL_H
#define S2S_CORE_PROTOCOL_H

#include <cstddef>
#include <string>

namespace S2S {
namespace protocol {

// --- commands --------------------------------------------------------------------------------
constexpr const char* kGetProtocolVer = "S2S_GetProtocolVer";
constexpr const char* kPairing = "S2S_Pairing";
constexpr const char* kPairingMultiSrc = "S2S_PairingMultiSrc";
constexpr const char* kSyncStart = "S2S_SyncStart";
constexpr const char* kSyncFinish = "S2S_SyncFinish";
constexpr const char* kUpdateTaskStatus = "S2S_UpdateTaskStatus";

// --- keys --------------------------------------------------------------------------------------
// Every command file opens with the token line, then these two, in this order.
constexpr const char* kKeyToken = "token";
constexpr const char* kKeyCommand = "command";
constexpr const char* kKeyClientID = "clientID";
// The client's local path for the output file; the receiver answers into its spool instead.
constexpr const char* kKeyOutfile = "outfile";
constexpr const char* kKeyDryRun = "dryRun";
constexpr const char* kKeyServerName = "serverName";
constexpr const char* kKeySyncShares = "syncShares";
constexpr const char* kKeyVolumeName = "volumeName";
constexpr const char* kKeyShareName = "shareName";
// The share attributes of "S2S_SyncStart": none or all of them.
constexpr const char* kKeyIsEncrypt = "isEncrypt";
constexpr const char* kKeyIsAutomount = "isAutomount";
constexpr const char* kKeyIsEnableACL = "isEnableACL";
constexpr const char* kKeyIsWinShare = "isWinShare";
constexpr const char* kKeyLenEncKey = "lenEncKey";
constexpr const char* kKeyFinishType = "finishType";
constexpr const char* kKeyName = "name";  // the share of "S2S_SyncFinish"
constexpr const char* kKeyTaskName = "taskName";

// --- values ------------------------------------------------------------------------------------
// Pairing commands speak "yes"/"no", the attributes of "S2S_SyncStart" "1"/"0": servers expect
// both forms.
constexpr const char* kYes = "yes";
constexpr const char* kNo = "no";
constexpr const char* kOne = "1";
constexpr const char* kZero = "0";
// "syncShares" and the conflict list of the output file join share names with this.
constexpr char kShareSeparator = ':';
// The finish types of "S2S_SyncFinish".
constexpr const char* kFinishComplete = "complete";
constexpr const char* kFinishAbort = "abort";
constexpr const char* kFinishUnpair = "unpair";

// One command line as the sender hands it to the wrapper: key="value", no line break. Values go
// in verbatim; the receiver reads each line strictly and refuses what it cannot take.
std::string Line(const std::string& key, const std::string& value);

// --- the token line and the reply --------------------------------------------------------------
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
// The token of a token line given without its line break; "" when `line` is none.
std::string TokenOfLine(const std::string& line);
// True for 32 lower-case hex digits.
bool ValidToken(const std::string& token);
// The result file's content: decimal 0..65535, optionally followed by one "\n".
bool ParseResult(const std::string& text, int* result);
// Removes a tree without following symbolic links; missing is fine.
void RemoveTree(const std::string& path);

// --- result codes ------------------------------------------------------------------------------
// Every code of the exchange, whichever end gives it: the receiver's answers, the pairing store's
// results (which the receiver passes on), and the codes the sender makes of an exchange. Where
// the ends read one number differently, the comment says so. The public constants
// (kReceiver*, kRsyncResult*, S2S_SVR_*) are tied to these by the compiler.
enum Result : int {
    kOK = 0,
    kNoAddress = 42,        // sender: no address of the server could be looked up
    kUnknownCommand = 43,   // the command is not known (an old server's answer)
    kNoVersion = 44,        // sender: the server answered, its version query failed
    kNoCommandModule = 51,  // the server has no command module: an old server, second form
    kStoreAlloc = 200,      // store: a key/value table could not be allocated
    kMissingKey = 201,      // a required key (store: argument) is missing or empty
    // A key the command does not take. An old server's answer to the share attributes of
    // "S2S_SyncStart": the sender retries without them. Store: a key missing from a table.
    kUnknownKey = 202,
    kMalformed = 203,  // not a well-formed command file, or a malformed value
    kBadName = 204,    // a share or task name that is not allowed
    kStoreWrite = 205,
    kStoreRead = 206,
    // Single-client pairing: another client is paired. A dry run answering it still proves the
    // connection.
    kPairedOther = 207,
    kNotPaired = 208,      // the client has not paired with this server
    kNoShare = 209,        // the server has no such share
    kAttrMismatch = 210,   // "isEncrypt" differs from the server's share
    kBadFinishType = 211,  // an unknown "finishType"
    kNotTested = 213,      // sender: no address of the server was tested
    kShareConflict = 214,  // shares bound to another client
    kInternal = 215,       // the receiver failed (out of memory, file system)
    kStoreFull = 216,      // the pairing store takes no more (size, clients, tasks)
    kLocalFailure = 300,   // sender: an encrypted share's key failed before its transfer
};

// True when a public constant carries the number of `code`. The installed headers keep their own
// names and numbers (they cannot include this header); a static_assert on this, next to the code
// of each end, ties every one of them to the list above.
constexpr bool Is(int constant, Result code) {
    return constant == static_cast<int>(code);
}

// --- share names -------------------------------------------------------------------------------
// A share is served as the rsync daemon module of its name, and the daemon's configuration reader
// folds module names: ASCII letter case and blanks do not count when it matches a section against
// the ones before it, and it turns a run of blanks into one (the daemon runs with LC_ALL=C, so
// other letters never fold). Every place that asks whether a share name may be used asks here.
constexpr size_t kShareNameMax = 255;

// A name the share registry can hold: valid UTF-8, 1..kShareNameMax bytes, no control
// characters, none of / \ [ ], not "." or "..", no leading or trailing blank.
bool ShareNameValid(const std::string& name);
// A share that can be served and synced: a valid name without quotes, backquotes, '%', ".." or
// ':' (the separator of "syncShares" and of the conflict list), not starting with '@' (the
// service's own modules and encrypted shares' "@name@"), without a run of blanks, and not "global"
// in any folding. Such a name is also a literal value of the daemon's configuration: no line break,
// no %VAR% expansion, no quote, no backslash, no outer blank.
bool ShareNameSyncable(const std::string& name);
// A task name a receiver takes: 1..kShareNameMax bytes, no control characters, quotes,
// brackets, slashes, backslashes or "..", no leading '@', no leading or trailing blank.
bool TaskNameValid(const std::string& name);
// Why a task name is refused, in words an administrator can act on (a macro as well, so that
// the receiver's exported copy of the text is an array of its own).
#define S2S_TASK_NAME_RULE                                                                      \
    "the task's name is not one a receiver takes: at most 255 bytes, not empty, no control "    \
    "characters, quotes, brackets, slashes, backslashes or \"..\", no leading '@', no leading " \
    "or trailing blank"
constexpr char kTaskNameRule[] = S2S_TASK_NAME_RULE;
// True when `text` holds a control character (below 0x20, or 0x7f): never part of a name, a
// value of a command file or a word of the daemon's configuration.
bool HasControl(const std::string& text);
// The module the daemon makes of `name`: ASCII lower case, blanks removed. Two shares with one
// key would be one module.
std::string ShareModuleKey(const std::string& name);

}  // namespace protocol
}  // namespace S2S

#endif  // S2S_CORE_PROTOCOL_H
