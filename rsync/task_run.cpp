// TaskRun: the sequence that syncs one task once. The first failure decides the run's class and
// message; later failures are still reported to the observer. A share is finished on the server
// only after its copy (and its key, when it is encrypted) succeeded and no cancel was seen.
#include "s2s_task_run.h"

#include <sys/stat.h>

#include <algorithm>
#include <atomic>
#include <functional>
#include <future>
#include <memory>
#include <utility>

#include "core/protocol.h"
#include "rsync/child_process.h"
#include "rsync/path_list.h"
#include "rsync/transfer_meter.h"
#include "s2s_platform.h"

namespace S2S {

namespace {

// The finish type that tells the server a share's copy is complete (docs/protocol.md).
const char kFinishComplete[] = "complete";

// rsync's exit code for a run stopped by a signal, and for files that vanished while being sent.
constexpr int kResultInterrupted = 20;
constexpr int kResultMaxDelete = 25;  // rsync stopped deleting at --max-delete
constexpr int kResultVanished = 24;

// The run on this thread; the rsync driver's cancel checker is a plain function.
thread_local TaskRun* t_current = nullptr;

// On a thread that makes a source check ahead of its run: the flag that stops it.
thread_local const std::atomic<bool>* t_ahead_stop = nullptr;

bool AheadStopped() {
    return t_ahead_stop != nullptr && t_ahead_stop->load();
}

double SecondsSince(TaskRun::Clock::time_point start) {
    return std::chrono::duration<double>(TaskRun::Clock::now() - start).count();
}

// rsync's refusal of the account, or an SSH login that cannot serve as the receiver's daemon.
bool IsAuthFailure(int code) {
    return code == 5 || code == VURN::Backup::RsyncWrapper::kResultSshLogin;
}

// The class of a remote command that did not answer 0.
RunFailure ClassifyCommandResult(int code) {
    switch (code) {
        case 5:
        case VURN::Backup::RsyncWrapper::kResultSshLogin:
            return RunFailure::kAuth;
        case 10:
        case 30:
        case 35:
            return RunFailure::kUnreachable;
        case kResultInterrupted:
            return RunFailure::kCancelled;
        default:
            return RunFailure::kRefused;
    }
}

// The class of a failed server test (Rsyncer::Initialize's result).
RunFailure ClassifyConnectResult(int code) {
    if (code == VURN::Backup::RsyncWrapper::kResultHookFailed) {
        return RunFailure::kRefused;  // the server answered, but could not run the command
    }
    return IsAuthFailure(code) ? RunFailure::kAuth : RunFailure::kUnreachable;
}

// The class of a failed data transfer (RunSync's result).
RunFailure ClassifyTransferResult(int code) {
    if (code == kResultInterrupted) {
        return RunFailure::kCancelled;
    }
    if (code == kResultMaxDelete) {
        return RunFailure::kMaxDelete;  // rsync's own deletion limit stopped the deletions
    }
    return IsAuthFailure(code) ? RunFailure::kAuth : RunFailure::kTransfer;
}

std::string NameAndMeaning(int code) {
    return RsyncResultName(code) + ", " + RsyncResultMeaning(code);
}

// A dry run or data run of one share runs after the control commands of the same run were taken
// with the same credentials: its "auth" failure is the server refusing that share's module (not
// registered there, or removed), never the password, and the other shares still sync.
bool ShareNotServed(int code) {
    return IsAuthFailure(code);
}

RunFailure ClassifyShareRunResult(int code) {
    return ShareNotServed(code) ? RunFailure::kRefused : ClassifyTransferResult(code);
}

std::string NotServedMessage(const std::string& share, int code) {
    return "the server does not serve share '" + share +
           "' (is it registered there?): " + NameAndMeaning(code);
}

// rsync's own lines (or the library's local cause) as one line for a message: "" or ": a; b".
std::string Because(const std::string& lines) {
    std::string joined;
    size_t start = 0;
    while (start < lines.size()) {
        size_t end = lines.find('\n', start);
        if (end == std::string::npos) {
            end = lines.size();
        }
        const std::string line = lines.substr(start, end - start);
        if (line.find_first_not_of(" \t") != std::string::npos) {
            joined += (joined.empty() ? "" : "; ") + line;
        }
        start = end + 1;
    }
    return joined.empty() ? joined : ": " + joined;
}

// Sets the run of this thread for the life of Run.
class CurrentRun {
  public:
    explicit CurrentRun(TaskRun* run) : previous_(t_current) { t_current = run; }
    ~CurrentRun() { t_current = previous_; }
    CurrentRun(const CurrentRun&) = delete;
    CurrentRun& operator=(const CurrentRun&) = delete;

  private:
    TaskRun* previous_;
};

}  // namespace

const char* ShareStateName(ShareState state) {
    switch (state) {
        case ShareState::kSynced:
            return "synced";
        case ShareState::kFailed:
            return "failed";
        case ShareState::kCancelled:
            return "cancelled";
        case ShareState::kRefused:
            return "refused";
        case ShareState::kNotRun:
            break;
    }
    return "not-run";
}

TaskRunObserver::~TaskRunObserver() = default;
void TaskRunObserver::OnMessage(const std::string&) {}
void TaskRunObserver::OnError(const std::string&) {}
void TaskRunObserver::OnCopyStart(const ShareOutcome&) {}
void TaskRunObserver::OnCopyProgress(const ShareOutcome&, uint64_t) {}
void TaskRunObserver::OnCopyEnd(const ShareOutcome&) {}
void TaskRunObserver::OnShareEnd(const ShareOutcome&) {}
bool TaskRunObserver::IsCancelled() {
    return false;
}
std::string TaskRunObserver::CancelReason() const {
    return "a request";
}
bool TaskRunObserver::WantsProgress() const {
    return false;
}

// The copy in progress: the share, what rsync has read, and rsync's own percentage once it
// reports one.
struct TaskRun::CopyWatch {
    ShareOutcome* share = nullptr;
    TransferMeter meter;
    int percent = -1;
};

// The source check of the run's first share (its walk and its dry run), made on a thread of its
// own with an Rsyncer of its own while the run's connection test, version query and pairing go
// out: the dry run changes nothing on the server, so the order of what the server sees is the
// same, and the cold walks of both trees no longer wait for those commands. Its verdict counts
// only for the share and the server address it was made for; the deletion limit it yields is put
// on the run's own Rsyncer as always (EnforceShareSource), so a folder emptied after the check
// still cannot empty the receiver's copy.
class TaskRun::CheckAhead {
  public:
    CheckAhead(const SyncInfo& info, std::string address, std::string share,
               std::list<std::string> excludes, const SourceGuardOptions& options)
        : address_(std::move(address)), share_(std::move(share)) {
        done_ = std::async(std::launch::async, [this, info, excludes, options]() {
            t_ahead_stop = &stop_;
            Rsyncer rsyncer;
            rsyncer.Adopt(info, address_, -1);
            rsyncer.SetCancelChecker(&AheadStopped);
            ShareInfo facts;
            if (rsyncer.GetShareInfo(share_, facts) == 0) {
                size_ = MeasureTree(facts.GetModulePath());
            }
            report_ = AssessShareSource(rsyncer, share_, excludes, options, &AheadStopped);
        });
    }
    ~CheckAhead() {
        stop_ = true;  // the future's end waits for the thread
    }
    CheckAhead(const CheckAhead&) = delete;
    CheckAhead& operator=(const CheckAhead&) = delete;

    // Waits for the check and takes its outcome when it was made for `share` at `address`; a
    // cancel seen meanwhile stops it (its report then refuses the share). False: check afresh.
    bool Take(const std::string& share, const std::string& address,
              const std::function<bool()>& cancelled, TreeSize& size, SourceGuardReport& report) {
        if (share != share_ || address != address_) {
            return false;
        }
        while (done_.wait_for(std::chrono::milliseconds(200)) != std::future_status::ready) {
            if (cancelled()) {
                stop_ = true;
            }
        }
        done_.get();
        size = size_;
        report = report_;
        return true;
    }

  private:
    std::atomic<bool> stop_{false};
    const std::string address_;
    const std::string share_;
    TreeSize size_;
    SourceGuardReport report_;
    std::future<void> done_;  // last: destroyed (and waited for) first
};

TaskRun::TaskRun(TaskRunObserver* observer)
    : observer_(observer != nullptr ? observer : &silent_) {}

TaskRun::~TaskRun() = default;

double TaskRun::Seconds() const {
    return SecondsSince(started_);
}

void TaskRun::Say(const std::string& line) {
    observer_->OnMessage(line);
}

void TaskRun::Fail(RunFailure failure, const std::string& message) {
    if (failure_ == RunFailure::kNone) {
        failure_ = failure;
        message_ = message;
    }
    if (failure != RunFailure::kNone) {
        observer_->OnError(message);
    }
}

bool TaskRun::Cancelled() {
    if (!cancelled_ && observer_->IsCancelled()) {
        cancelled_ = true;
    }
    return cancelled_;
}

bool TaskRun::PollCurrent() {
    TaskRun* run = t_current;
    if (run == nullptr) {
        return false;
    }
    run->PollCopy();
    return run->Cancelled();
}

void TaskRun::PollCopy() {
    if (watch_ == nullptr) {
        return;
    }
    watch_->meter.Poll();
    // rsync's percentage counts the files it skips as unchanged; the bytes read only what it
    // sends. The percentage is the better measure of how far the share is, when there is one.
    const uint64_t total = watch_->share->bytes;
    const uint64_t done = watch_->percent >= 0
                              ? total / 100 * static_cast<uint64_t>(watch_->percent)
                              : watch_->meter.Bytes();
    observer_->OnCopyProgress(*watch_->share, done);
}

KnownServer TaskRun::LearntServer() const {
    KnownServer server;
    if (!paired_ || settled_address_.empty() || failure_ == RunFailure::kUnreachable ||
        failure_ == RunFailure::kAuth || failure_ == RunFailure::kConflict ||
        failure_ == RunFailure::kRefused) {
        return server;
    }
    server.address = settled_address_;
    server.version = server_version_;
    server.paired = task_.GetInfo().GetShareList();
    return server;
}

bool TaskRun::Connect() {
    const SyncInfo& info = task_.GetInfo().GetSyncInfo();
    const std::string target =
        info.GetServerIP().empty()
            ? info.GetServerName()
            : info.GetServerIP() +
                  (info.GetServerName().empty() ? "" : " (" + info.GetServerName() + ")");
    // Every control command names this server by its client ID: without one nothing can be asked.
    if (GetClientID().empty()) {
        Fail(RunFailure::kLocal,
             std::string("no client ID could be found for this server (no serial number, no "
                         "network interface with a MAC address): set serial= under [host] in ") +
                 S2SPath(S2S_PATH_HOST_CONF));
        return false;
    }
    if (!protocol::TaskNameValid(task_.GetInfo().GetName())) {
        Fail(RunFailure::kLocal, protocol::kTaskNameRule);
        return false;
    }
    Say("connecting to " + target + " as " + info.GetUser());
    const int rc = rsyncer_.Connect(info);
    server_version_ = rsyncer_.GetServerVersionValue();
    if (Cancelled()) {
        Fail(RunFailure::kCancelled, "stopped before the server answered");
        return false;
    }
    if (rc == kRsyncResultNoAddress) {
        Fail(RunFailure::kUnreachable, "no address found for server " + target);
        return false;
    }
    if (rc == kRsyncResultNoVersion) {
        // Never taken for an old server: pairing would then skip the multi-source check.
        const int why = rsyncer_.GetServerVersionResult();
        Fail(why == 1 || why == 11 ? RunFailure::kLocal : ClassifyCommandResult(why),
             "the server answered, but its protocol version could not be read (" +
                 RsyncResultName(why) + ")" + Because(rsyncer_.GetLastError()));
        return false;
    }
    if (rc != 0) {
        const RunFailure failure = ClassifyConnectResult(rc);
        std::string why = "the server did not answer";
        if (rc == VURN::Backup::RsyncWrapper::kResultSshLogin) {
            why = "the SSH login '" + info.GetUser() + "' cannot serve the receiving server";
        } else if (failure == RunFailure::kAuth) {
            why = "the server refused user '" + info.GetUser() + "' or its password";
        } else if (failure == RunFailure::kRefused) {
            why = "the server could not run the connection test";
        }
        Fail(failure, why + ": " + NameAndMeaning(rc) + Because(rsyncer_.GetLastError()));
        return false;
    }
    settled_address_ = rsyncer_.GetSyncInfo().GetServerIP();
    Say("server " + settled_address_ + " answers: " +
        (server_version_ > 0 ? "protocol version " + std::to_string(server_version_)
                             : std::string("an old server (one client per server, no share "
                                           "attributes)")));
    return true;
}

bool TaskRun::Pair() {
    const std::list<std::string>& shares = task_.GetInfo().GetShareList();
    std::list<std::string> conflicts;
    int result = 0;
    const auto refuseAll = [this, &result]() {
        for (ShareOutcome& share : shares_) {
            share.state = ShareState::kRefused;
            share.step = "pairing";
            share.result = result;
        }
    };
    const std::string pairedOther = "the server is paired with another client: ";
    if (rsyncer_.DoPairing(false, shares, conflicts, result) != 0) {
        if (Cancelled()) {
            Fail(RunFailure::kCancelled, "stopped while pairing");
            return false;
        }
        if (result != 0 && result != kRsyncResultConflict) {
            if (result == kRsyncResultDryRunOK) {
                // An old server pairs one client as a whole.
                Fail(RunFailure::kConflict,
                     pairedOther + RsyncResultName(result) + "; nothing was synced");
                return false;
            }
            Fail(ClassifyCommandResult(result),
                 "the server refused the pairing: " + RsyncResultName(result));
            return false;
        }
        Fail(RunFailure::kLocal,
             "the pairing request could not be sent" + Because(rsyncer_.GetLastError()));
        return false;
    }
    if (result == kRsyncResultConflict || !conflicts.empty()) {
        std::string names;
        for (const std::string& name : conflicts) {
            names += (names.empty() ? "'" : ", '") + name + "'";
        }
        if (names.empty()) {
            names = "(not named by the server)";
        }
        refuseAll();
        Fail(RunFailure::kConflict, std::string(conflicts.size() == 1 ? "share " : "shares ") +
                                        names + (conflicts.size() == 1 ? " is" : " are") +
                                        " already paired with another client; nothing was "
                                        "synced");
        return false;
    }
    if (result != 0) {
        if (Cancelled()) {
            Fail(RunFailure::kCancelled, "stopped while pairing");
            return false;
        }
        if (result == kRsyncResultDryRunOK) {
            Fail(RunFailure::kConflict,
                 pairedOther + RsyncResultName(result) + "; nothing was synced");
            return false;
        }
        refuseAll();
        Fail(ClassifyCommandResult(result),
             "the server refused the pairing: " + NameAndMeaning(result));
        return false;
    }
    Say("paired " + std::to_string(shares.size()) + " share" + (shares.size() == 1 ? "" : "s"));
    return true;
}

// Before anything is sent: a share whose folder is missing, not mounted or (against a full copy)
// empty, or whose run would delete more than allowed, is refused and never marked complete.
bool TaskRun::GuardSource(ShareOutcome& share) {
    return Judge(share,
                 CheckShareSource(rsyncer_, share.name, excludes_, guard_, &TaskRun::PollCurrent));
}

bool TaskRun::Judge(ShareOutcome& share, const SourceGuardReport& guard) {
    if (guard.result == SourceGuardResult::kSafe) {
        return true;
    }
    share.step = "source-check";
    share.guard = SourceGuardResultName(guard.result);
    if (guard.receiver.known) {
        share.would_delete = static_cast<long long>(guard.receiver.deletions);
    }
    share.message = guard.message;
    if (Cancelled()) {
        share.state = ShareState::kCancelled;
    } else if (guard.result == SourceGuardResult::kCheckFailed &&
               ShareNotServed(guard.dryRunResult)) {
        share.state = ShareState::kRefused;
        share.result = guard.dryRunResult;
        share.message = NotServedMessage(share.name, guard.dryRunResult);
        Fail(ClassifyShareRunResult(guard.dryRunResult), share.message);
    } else if (guard.result == SourceGuardResult::kCheckFailed) {
        share.state = ShareState::kFailed;
        share.result = guard.dryRunResult;
        Fail(guard.dryRunResult != 0 ? ClassifyTransferResult(guard.dryRunResult)
                                     : RunFailure::kLocal,
             share.message +
                 (guard.dryRunResult != 0 ? ": " + NameAndMeaning(guard.dryRunResult) : ""));
    } else if (guard.result == SourceGuardResult::kTooManyDeletions) {
        share.state = ShareState::kRefused;
        Fail(RunFailure::kMaxDelete, share.message);
    } else {
        share.state = ShareState::kRefused;
        Fail(RunFailure::kUnsafeSource,
             share.message + (guard.result == SourceGuardResult::kEmptySource
                                  ? " (--allow-empty-source syncs it anyway)"
                                  : ""));
    }
    return false;
}

// Measures the whole share and checks its source; false when the share is refused.
bool TaskRun::PrepareWhole(ShareOutcome& share, const std::string& folder) {
    share.changed_paths = 0;
    const std::unique_ptr<CheckAhead> ahead = std::move(ahead_);
    TreeSize size;
    SourceGuardReport report;
    if (ahead != nullptr &&
        ahead->Take(
            share.name, settled_address_, [this]() { return Cancelled(); }, size, report)) {
        share.files = size.files;
        share.bytes = size.bytes;
        return Judge(share, EnforceShareSource(rsyncer_, report));
    }
    size = MeasureTree(folder);
    share.files = size.files;
    share.bytes = size.bytes;
    return GuardSource(share);
}

bool TaskRun::StartShare(ShareOutcome& share, int& result) {
    int started = rsyncer_.StartSyncShare(share.name, result);
    if ((started != 0 || result != 0) && used_known_ && !Cancelled()) {
        // The server or its pairing taken from the previous run no longer holds: test and pair
        // afresh, then ask once more.
        used_known_ = false;
        Say("share " + share.name + ": the server answered " + RsyncResultName(result) +
            "; testing the server and pairing again");
        if (!Connect() || !Pair()) {
            if (share.state == ShareState::kNotRun) {
                share.state = Cancelled() ? ShareState::kCancelled : ShareState::kFailed;
                share.step = "start";
                share.message = message_;
            }
            return false;
        }
        started = rsyncer_.StartSyncShare(share.name, result);
    }
    if (started != 0 || result != 0) {
        share.step = "start";
        share.result = result;
        share.state = Cancelled() ? ShareState::kCancelled : ShareState::kRefused;
        share.message =
            "the server refused to start share '" + share.name + "': " + NameAndMeaning(result);
        if (!Cancelled()) {
            Fail(result == 0 ? RunFailure::kLocal : ClassifyCommandResult(result), share.message);
        }
        return false;
    }
    return true;
}

int TaskRun::Copy(ShareOutcome& share, const std::vector<std::string>* paths, int& result) {
    CopyWatch watch;
    watch.share = &share;
    observer_->OnCopyStart(share);
    watch_ = &watch;
    const Clock::time_point step = Clock::now();
    const int rc = paths != nullptr
                       ? rsyncer_.RunSyncPaths(share.name, *paths, excludes_, result)
                       : rsyncer_.RunSync(task_.GetID(), share.name, "/", excludes_, result);
    share.copy_seconds += SecondsSince(step);
    watch.meter.Poll();
    share.read_bytes += watch.meter.Bytes();
    watch_ = nullptr;
    observer_->OnCopyEnd(share);
    return rc;
}

void TaskRun::SyncShare(ShareOutcome& share) {
    const Clock::time_point start = Clock::now();
    ShareInfo info;
    if (rsyncer_.GetShareInfo(share.name, info) != 0) {
        share.state = ShareState::kFailed;
        share.step = "start";
        share.message = "share '" + share.name + "' is not registered or unreadable";
        Fail(RunFailure::kLocal, share.message);
        return;
    }
    share.encrypted = info.IsEncrypted();
    // The server files a share under its volume's name: a folder on the root file system, with
    // no volume named for it, has none, and the server would refuse the start for a missing key.
    VolumeInfo volume;
    if (GetVolumeInfo(share.name, volume) == 0 && volume.GetPath().size() < 2) {
        std::string parent = info.GetPath().substr(0, info.GetPath().rfind('/'));
        share.state = ShareState::kRefused;
        share.step = "start";
        share.message = "share '" + share.name + "' lies on no named volume (its folder " +
                        info.GetPath() + " is on the root file system): name its volume under " +
                        "[volumes] in " + S2SPath(S2S_PATH_HOST_CONF) + ", e.g. " +
                        (parent.empty() ? info.GetPath() : parent) + "=\"internal,directory\"";
        share.seconds = SecondsSince(start);
        Fail(RunFailure::kLocal, share.message);
        return;
    }
    const auto changed = changed_.find(share.name);
    const std::vector<std::string>* paths =
        changed != changed_.end() && !changed->second.empty() ? &changed->second : nullptr;
    bool whole = paths == nullptr;
    std::vector<std::string> settled;
    if (paths != nullptr) {
        settled = SettledPaths(info.GetModulePath(), *paths);
        paths = &settled;
        // Only the changed paths are measured, checked and sent.
        const SourceGuardReport guard = CheckChangedPaths(rsyncer_, share.name, *paths, excludes_,
                                                          guard_, &TaskRun::PollCurrent, whole);
        if (!whole && !Judge(share, guard)) {
            share.seconds = SecondsSince(start);
            return;
        }
        if (!whole) {
            share.changed_paths = paths->size();
            Say("share " + share.name + ": sending " + std::to_string(paths->size()) +
                " changed path" + (paths->size() == 1 ? "" : "s"));
            for (const std::string& path : *paths) {
                struct stat st;
                if (lstat((info.GetModulePath() + "/" + path).c_str(), &st) == 0 &&
                    S_ISREG(st.st_mode)) {
                    ++share.files;
                    share.bytes += static_cast<uint64_t>(st.st_size);
                }
            }
        }
    }
    if (whole) {
        paths = nullptr;
        if (!PrepareWhole(share, info.GetModulePath())) {
            share.seconds = SecondsSince(start);
            return;
        }
    }

    int result = 0;
    Clock::time_point step = Clock::now();
    const bool started = StartShare(share, result);
    share.start_seconds = SecondsSince(step);
    if (!started) {
        return;
    }

    int rc = Copy(share, paths, result);
    if (paths != nullptr && rc == 0 && result == kResultMaxDelete && !guard_.maxDelete.set &&
        !Cancelled()) {
        // More vanished than the changes named (the folder emptied meanwhile, a volume went):
        // the whole share's check decides, as for any full run.
        Say("share " + share.name +
            ": more is gone than the changes named; checking and syncing the whole share");
        if (!PrepareWhole(share, info.GetModulePath())) {
            share.seconds = SecondsSince(start);
            return;
        }
        rc = Copy(share, nullptr, result);
    }
    share.seconds = SecondsSince(start);
    if (Cancelled()) {
        share.state = ShareState::kCancelled;
        share.step = "copy";
        share.result = result;
        return;
    }
    // Files that vanish while they are being sent are normal on a live share; the next run takes
    // the share as it is then.
    if (rc != 0 || (result != 0 && result != kResultVanished)) {
        const bool notServed = rc == 0 && ShareNotServed(result);
        share.state = notServed ? ShareState::kRefused : ShareState::kFailed;
        share.step = "copy";
        share.result = result;
        share.rsync_errors = rsyncer_.GetLastError();
        share.message =
            (notServed ? NotServedMessage(share.name, result)
                       : "copying share '" + share.name + "' failed: " + NameAndMeaning(result)) +
            Because(share.rsync_errors) + "; it is not marked complete";
        Fail(rc != 0 ? RunFailure::kLocal : ClassifyShareRunResult(result), share.message);
        return;
    }
    if (result == kResultVanished) {
        Say("share " + share.name + ": some files vanished while they were copied");
    }

    if (share.encrypted) {
        step = Clock::now();
        const int key = rsyncer_.SyncEncryptKey(share.name);
        share.key_seconds = SecondsSince(step);
        if (Cancelled()) {
            share.state = ShareState::kCancelled;
            share.step = "key";
            return;
        }
        if (key != 0) {
            share.state = ShareState::kFailed;
            share.step = "key";
            share.result = key;
            share.rsync_errors = rsyncer_.GetLastError();
            share.message = "sending the key of share '" + share.name +
                            "' failed: " + NameAndMeaning(key) + Because(share.rsync_errors);
            Fail(RunFailure::kKeySync, share.message);
            return;
        }
        Say("share " + share.name + ": key sent");
    }

    step = Clock::now();
    const int finished = rsyncer_.FinishSync(kFinishComplete, share.name, result);
    share.finish_seconds = SecondsSince(step);
    if (finished != 0 || result != 0) {
        share.state = Cancelled() ? ShareState::kCancelled : ShareState::kFailed;
        share.step = "finish";
        share.result = result;
        share.message = "the server did not accept the end of share '" + share.name +
                        "': " + RsyncResultName(result);
        if (!Cancelled()) {
            Fail(result == 0 ? RunFailure::kLocal : ClassifyCommandResult(result), share.message);
        }
        return;
    }
    share.seconds = SecondsSince(start);
    share.state = ShareState::kSynced;
}

// Only where the address is known before the server is tested (given as an address, or the
// one an earlier run settled on), for a share copied whole, and not over SSH (its login check
// belongs to the run's thread).
void TaskRun::StartCheckAhead() {
    ahead_.reset();
    const SyncInfo& info = task_.GetInfo().GetSyncInfo();
    const std::string address = used_known_ ? known_.address : info.GetServerIP();
    if (shares_.empty() || address.empty() || info.UseSSH()) {
        return;
    }
    const std::string& share = shares_.front().name;
    const auto changed = changed_.find(share);
    if (changed != changed_.end() && !changed->second.empty()) {
        return;
    }
    ahead_ = std::make_unique<CheckAhead>(info, address, share, excludes_, guard_);
}

RunFailure TaskRun::Run(const SyncTask& task) {
    task_ = task;
    started_ = Clock::now();
    failure_ = RunFailure::kNone;
    message_.clear();
    paired_ = false;
    const SyncInfo& info = task_.GetInfo().GetSyncInfo();
    given_address_ = info.GetServerIP().empty() ? info.GetServerName() : info.GetServerIP();
    shares_.clear();
    for (const std::string& name : task_.GetInfo().GetShareList()) {
        ShareOutcome share;
        share.name = name;
        shares_.push_back(share);
    }
    Say("task \"" + task_.GetInfo().GetName() + "\": " + std::to_string(shares_.size()) + " share" +
        (shares_.size() == 1 ? "" : "s"));

    // Command runs may answer before rsync has ended; Run waits for them before it returns.
    rsync_internal::LeftRunsScope leftRuns;
    CurrentRun current(this);
    // A check made ahead and not taken (the run ended before its share) is stopped when Run ends.
    struct AheadEnd {
        std::unique_ptr<CheckAhead>& ahead;
        ~AheadEnd() { ahead.reset(); }
    } aheadEnd{ahead_};
    rsyncer_.SetCancelChecker(&TaskRun::PollCurrent);
    // rsync reports its progress only when asked to; a run without a display does not ask.
    if (observer_->WantsProgress()) {
        rsyncer_.SetProgressCallback([this](int percent) {
            if (watch_ != nullptr && percent >= 0 && percent <= 100) {
                watch_->percent = percent;
            }
        });
    }
    Clock::time_point step = Clock::now();
    used_known_ = !known_.address.empty();
    StartCheckAhead();
    bool connected = true;
    if (used_known_) {
        rsyncer_.Adopt(info, known_.address, known_.version);
        server_version_ = known_.version;
        settled_address_ = known_.address;
    } else {
        connected = Connect();
    }
    connect_seconds_ = SecondsSince(step);
    if (!connected) {
        return failure_;
    }
    step = Clock::now();
    bool paired = used_known_;
    for (const std::string& name : task_.GetInfo().GetShareList()) {
        if (std::find(known_.paired.begin(), known_.paired.end(), name) == known_.paired.end()) {
            paired = false;
        }
    }
    paired = paired || Pair();
    pair_seconds_ = SecondsSince(step);
    if (!paired) {
        return failure_;
    }
    paired_ = true;
    for (ShareOutcome& share : shares_) {
        if (Cancelled()) {
            break;
        }
        SyncShare(share);
        observer_->OnShareEnd(share);
        // Without the server or the credentials the remaining shares cannot fare better.
        if (failure_ == RunFailure::kAuth || failure_ == RunFailure::kUnreachable) {
            break;
        }
    }
    if (Cancelled()) {
        Fail(RunFailure::kCancelled, "stopped by " + observer_->CancelReason() +
                                         "; no unfinished share was marked complete");
        return failure_;
    }
    int result = 0;
    step = Clock::now();
    const int beacon = rsyncer_.SendBeacon(task_.GetInfo().GetName(), result);
    beacon_seconds_ = SecondsSince(step);
    if (beacon == 0) {
        beacon_result_ = result;
        if (result != 0 && !Cancelled()) {
            Fail(ClassifyCommandResult(result),
                 "the server did not take the task's status: " + RsyncResultName(result));
        }
    } else if (!Cancelled()) {
        Fail(RunFailure::kLocal,
             "the task's status could not be sent" + Because(rsyncer_.GetLastError()));
    }
    if (Cancelled()) {
        Fail(RunFailure::kCancelled, "stopped while reporting the task's status");
    }
    return failure_;
}

}  // namespace S2S
