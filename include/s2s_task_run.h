// TaskRun: one run of one sync task, end to end, in the order the receiving server expects: find
// a reachable address and the server's protocol version, pair the shares, then per share announce
// it, copy it, send an encrypted share's key and finish it, and last report the task's status.
// A share that failed, or a run that was cancelled, is never finished: the server keeps it marked
// as not complete.
//
// The run talks to its caller only through a TaskRunObserver (lines a person reads, errors,
// progress of a share's copy, cancellation) and leaves its outcome in the object: the class of
// the first failure, its message and one ShareOutcome per share. It runs on the caller's thread
// and blocks it; several TaskRuns may run at once on different threads.
#ifndef S2S_TASK_RUN_H
#define S2S_TASK_RUN_H

#include <chrono>
#include <cstdint>
#include <list>
#include <map>
#include <memory>
#include <string>
#include <vector>

#include "s2s_export.h"
#include "s2s_rsyncer.h"
#include "s2s_source_guard.h"
#include "s2s_sync_obj.h"

namespace S2S {

// Why a run fell short; kNone when everything asked for was done. Front ends map each class to
// their own codes (the command line's exit codes, the service's history).
enum class RunFailure : int {
    kNone = 0,
    kLocal,         // share facts, client identity, temporary files, a command not sent
    kUnreachable,   // no address of the server answered
    kAuth,          // the server refused the user name or password
    kConflict,      // a share is already paired with another client
    kRefused,       // the server refused a command (pairing, start, finish, status)
    kTransfer,      // copying a share failed
    kKeySync,       // an encrypted share's key could not be sent
    kCancelled,     // stopped through the observer
    kUnsafeSource,  // a share's folder was missing, not mounted, or empty over a full copy
    kMaxDelete,     // a share's run would have deleted more than the deletion limit allows
};

enum class ShareState : int { kNotRun, kSynced, kFailed, kCancelled, kRefused };
// "not-run", "synced", "failed", "cancelled", "refused".
S2S_EXPORT const char* ShareStateName(ShareState state);

// What happened to one share.
struct ShareOutcome {
    std::string name;
    bool encrypted = false;
    uint64_t files = 0;       // regular files in the share when its copy began
    uint64_t bytes = 0;       // their total size
    uint64_t read_bytes = 0;  // what rsync read to send it (unchanged files are not read)
    double seconds = 0.0;
    double start_seconds = 0.0;
    double copy_seconds = 0.0;
    double key_seconds = 0.0;
    double finish_seconds = 0.0;
    size_t changed_paths = 0;  // the copy was limited to this many changed paths; 0: whole share
    ShareState state = ShareState::kNotRun;
    int result = 0;       // the remote result code of the failed step
    std::string step;     // the step that failed: pairing, source-check, start, copy, key, finish
    std::string message;  // why, for a person
    std::string rsync_errors;     // what rsync itself said about a failed copy or key step
    std::string guard;            // why the source check refused the share (SourceGuardResultName)
    long long would_delete = -1;  // what a refused run would have deleted on the receiver
};

// The server a run settled on and the shares it paired, for the next run of the same task a
// moment later (TaskRun::SetKnownServer). An empty address means none.
struct KnownServer {
    std::string address;
    int version = -1;
    std::list<std::string> paired;
};

// The caller's side of a run. Every call comes from the thread that runs the TaskRun.
class S2S_EXPORT TaskRunObserver {
  public:
    virtual ~TaskRunObserver();
    // A line telling how the run goes ("paired 2 shares"), without line end.
    virtual void OnMessage(const std::string& line);
    // A failure, as it happens (the run goes on where it can); without line end.
    virtual void OnError(const std::string& message);
    // A share's copy begins (its size is known) and ends; between the two, OnCopyProgress reports
    // the bytes done several times a second.
    virtual void OnCopyStart(const ShareOutcome& share);
    virtual void OnCopyProgress(const ShareOutcome& share, uint64_t done_bytes);
    virtual void OnCopyEnd(const ShareOutcome& share);
    // A share's turn ended, whatever its state.
    virtual void OnShareEnd(const ShareOutcome& share);
    // Polled often while the run goes on (at least every 200 ms during a transfer): true stops it
    // cleanly at once, no rsync left running and no unfinished share marked complete.
    virtual bool IsCancelled();
    // Who stopped the run, for its message: "stopped by <reason>; ...".
    virtual std::string CancelReason() const;
    // True asks rsync for its overall progress (which costs it some work); without it the bytes
    // done come from what rsync has read.
    virtual bool WantsProgress() const;
};

class S2S_EXPORT TaskRun {
  public:
    using Clock = std::chrono::steady_clock;

    // `observer` stays owned by the caller and must outlive Run; null means a silent run that is
    // never cancelled.
    explicit TaskRun(TaskRunObserver* observer);
    ~TaskRun();
    TaskRun(const TaskRun&) = delete;
    TaskRun& operator=(const TaskRun&) = delete;

    // rsync exclude patterns for every share's copy.
    void SetExcludes(const std::list<std::string>& excludes) { excludes_ = excludes; }
    // The checks made on each share's source before it is announced (an empty or unmounted
    // folder never wipes the receiver's copy; the deletion limit). Checked by default.
    void SetGuardOptions(const SourceGuardOptions& options) { guard_ = options; }

    // Limits the copy of the shares named here to the paths of each that changed (relative to
    // the share's folder): what a real-time run sends. The share is still announced and finished
    // as always, and synced whole when the changes cannot be checked on their own (see
    // CheckChangedPaths).
    void SetChangedPaths(const std::map<std::string, std::vector<std::string>>& paths) {
        changed_ = paths;
    }
    // Skips the server test and version query, and the pairing when `server` paired every share
    // of the task, taking them from the task's previous run. The server still checks the pairing
    // when each share starts; a share it refuses then is retried once after a full server test
    // and pairing.
    void SetKnownServer(const KnownServer& server) { known_ = server; }

    // Runs `task` once. The task must have passed TaskInfo::Validate. The result is Failure().
    RunFailure Run(const SyncTask& task);

    // --- the outcome ---------------------------------------------------------------------------
    RunFailure Failure() const { return failure_; }
    // The first failure's message; empty when there was none.
    const std::string& Message() const { return message_; }
    const std::vector<ShareOutcome>& Shares() const { return shares_; }
    const SyncTask& Task() const { return task_; }
    // The address the task names (its server IP, else its server name) and the address the run
    // settled on after trying the server's addresses (empty until one answered).
    const std::string& GivenAddress() const { return given_address_; }
    const std::string& SettledAddress() const { return settled_address_; }
    int ServerVersion() const { return server_version_; }
    // The server's answer to the task's status report; -1 when none was received.
    int BeaconResult() const { return beacon_result_; }
    // What the next run of the task may take as known (SetKnownServer): empty unless this run
    // reached the server, paired, and no share was refused or failed to reach it.
    KnownServer LearntServer() const;
    double Seconds() const;
    double ConnectSeconds() const { return connect_seconds_; }
    double PairSeconds() const { return pair_seconds_; }
    double BeaconSeconds() const { return beacon_seconds_; }

  private:
    bool Connect();
    bool Pair();
    bool StartShare(ShareOutcome& share, int& result);
    int Copy(ShareOutcome& share, const std::vector<std::string>* paths, int& result);
    void SyncShare(ShareOutcome& share);
    bool GuardSource(ShareOutcome& share);
    bool Judge(ShareOutcome& share, const SourceGuardReport& guard);
    bool PrepareWhole(ShareOutcome& share, const std::string& folder);
    void StartCheckAhead();
    void Fail(RunFailure failure, const std::string& message);
    void Say(const std::string& line);
    bool Cancelled();
    static bool PollCurrent();
    void PollCopy();

    struct CopyWatch;
    class CheckAhead;

    TaskRunObserver* observer_;
    TaskRunObserver silent_;
    std::list<std::string> excludes_;
    SourceGuardOptions guard_;
    SyncTask task_;
    Rsyncer rsyncer_;
    std::vector<ShareOutcome> shares_;
    Clock::time_point started_ = Clock::now();
    RunFailure failure_ = RunFailure::kNone;
    std::string message_;
    std::string given_address_;
    std::string settled_address_;
    int server_version_ = -1;
    int beacon_result_ = -1;
    bool cancelled_ = false;
    double connect_seconds_ = 0.0;
    double pair_seconds_ = 0.0;
    double beacon_seconds_ = 0.0;
    std::map<std::string, std::vector<std::string>> changed_;
    KnownServer known_;
    bool used_known_ = false;  // this run took the server (and maybe the pairing) as known
    bool paired_ = false;
    CopyWatch* watch_ = nullptr;         // the copy in progress, while RunSync runs
    std::unique_ptr<CheckAhead> ahead_;  // the first share's source check, made meanwhile
};

// A remote result code (rsync's own exit codes, the server's answers, the client's local codes)
// as "name (number)", e.g. "conflict (214)"; unknown codes as "code 77".
S2S_EXPORT std::string RsyncResultName(int code);
// The short description of a result code, or "" when none is known.
S2S_EXPORT const char* RsyncResultMeaning(int code);

}  // namespace S2S

#endif  // S2S_TASK_RUN_H
