// The sync service's control protocol, shared by s2sd and its front ends: the socket, the command
// words, the keys of requests and replies, and the status codes (docs/service.md). One connection
// carries one request map and its reply map.
#ifndef S2S_CONTROL_H
#define S2S_CONTROL_H

namespace S2S {
namespace Control {

// Fixed paths; pass them through S2SPath() before use.
constexpr char kSocketPath[] = "/run/s2s/s2sd.sock";
constexpr char kDatabasePath[] = "/var/lib/s2s/s2s.db";
constexpr char kPasswordDir[] = "/var/lib/s2s/passwords";
constexpr char kLogPath[] = "/var/log/s2s/s2sd.log";

// Command words (the request's "command").
constexpr char kAdd[] = "add";
constexpr char kUpdate[] = "update";
constexpr char kRemove[] = "remove";
constexpr char kList[] = "list";
constexpr char kShow[] = "show";
constexpr char kRun[] = "run";
constexpr char kCancel[] = "cancel";
constexpr char kStatus[] = "status";
constexpr char kHistory[] = "history";
constexpr char kPause[] = "pause";
constexpr char kResume[] = "resume";

// Keys.
constexpr char kKeyCommand[] = "command";
constexpr char kKeyStatus[] = "status";
constexpr char kKeyMessage[] = "message";
constexpr char kKeyTask[] = "task";
constexpr char kKeyTaskId[] = "task_id";
constexpr char kKeyPassword[] = "password";
constexpr char kKeyTasks[] = "tasks";
constexpr char kKeyRuns[] = "runs";
constexpr char kKeyCount[] = "count";
constexpr char kKeyNextRun[] = "next_run";
constexpr char kKeyState[] = "state";
constexpr char kKeyName[] = "name";
constexpr char kKeyShare[] = "share";
constexpr char kKeyShares[] = "shares";
constexpr char kKeyBytesDone[] = "bytes_done";
constexpr char kKeyBytesTotal[] = "bytes_total";
constexpr char kKeyLastResult[] = "last_result";
constexpr char kKeyStart[] = "start";
constexpr char kKeyEnd[] = "end";
constexpr char kKeyResult[] = "result";
constexpr char kKeyFiles[] = "files";
constexpr char kKeyBytes[] = "bytes";
constexpr char kKeyReadBytes[] = "read_bytes";
constexpr char kKeyLastMessage[] = "last_message";
constexpr char kKeyGuard[] = "guard";
constexpr char kKeyWouldDelete[] = "would_delete";
// A task's guard options, beside the sync model's keys in a task map (as in task files).
constexpr char kKeyAllowEmptySource[] = "allow_empty_source";
constexpr char kKeyMaxDelete[] = "max_delete";

// Task states.
constexpr char kStateIdle[] = "idle";
constexpr char kStateQueued[] = "queued";
constexpr char kStateRunning[] = "running";
constexpr char kStatePaused[] = "paused";

enum Status {
    kOk = 0,
    kBadRequest = 1,
    kInvalidTask = 2,
    kNoSuchTask = 3,
    kBusy = 4,
    kNotRunning = 5,
    kInternal = 6,
    kTooLarge = 7,
};

}  // namespace Control
}  // namespace S2S

#endif  // S2S_CONTROL_H
