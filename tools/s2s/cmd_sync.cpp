// s2s sync: runs one task once, end to end, in the order the sync service's daemon uses: find a
// reachable address and the server's protocol version, pair the shares, then per share announce
// it, copy it, send an encrypted share's key and finish it, and last report the task's status.
// A share that failed, or a run stopped by Ctrl-C, is never finished: the server keeps it
// marked as not complete.
#include <signal.h>
#include <unistd.h>

#include <algorithm>
#include <chrono>
#include <cstdarg>
#include <cstdio>
#include <list>
#include <nlohmann/json.hpp>

#include "s2s_host.h"
#include "s2s_rsyncer.h"
#include "s2s_source_guard.h"
#include "s2s_sync_obj.h"
#include "tools/s2s/commands.h"
#include "tools/s2s/exit_codes.h"
#include "tools/s2s/options.h"
#include "tools/s2s/password.h"
#include "tools/s2s/progress.h"
#include "tools/s2s/task_file.h"
#include "tools/s2s/transfer_meter.h"

namespace s2s_cli {

namespace {

using Clock = std::chrono::steady_clock;

// The finish type that tells the server a share's copy is complete (docs/protocol.md).
const char kFinishComplete[] = "complete";

const std::vector<OptionSpec> kSyncOptions = {
    {"task", "FILE", false, "the task file (JSON task map); replaces --name to --max-bandwidth"},
    {"name", "NAME", false, "the task's name (default \"cli\")"},
    {"id", "N", false, "the task's id (default 0)"},
    {"server", "HOST", false, "the receiving server's host name"},
    {"server-ip", "ADDRESS", false, "the receiving server's address (tried first)"},
    {"user", "USER", false, "the user the server knows this client by"},
    {"share", "NAME", true, "a registered share to sync"},
    {"compress", "", false, "compress data on the wire"},
    {"block-level", "", false, "send only the changed blocks of changed files"},
    {"ssh", "", false, "reach the server over SSH"},
    {"ssh-port", "PORT", false, "the server's SSH port (also used for encryption keys)"},
    {"max-bandwidth", "N", false, "the bandwidth limit handed to rsync (0: none)"},
    {"password-file", "FILE", false, "read the password from FILE (mode 600; - for stdin)"},
    {"exclude", "PATTERN", true, "leave out files matching an rsync exclude pattern"},
    {"allow-empty-source", "", false, "sync an empty share folder even over a full copy"},
    {"max-delete", "N|N%", false, "refuse a share's run that would delete more than N (or N%)"},
    {"json", "", false, "print a JSON summary on standard output (messages go to stderr)"},
    {"no-progress", "", false, "no progress display while copying"},
    {"quiet", "", false, "only errors and the summary"},
    {"verbose", "", false, "also the library's informational log lines"},
    {"debug", "", false, "also the library's debug log lines"},
    {"help", "", false, "show this help"},
};

const char kSyncEpilogue[] =
    "The password comes from --password-file, else the environment variable S2S_PASSWORD,\n"
    "else the task file's \"pswd\" (only in a file other users cannot read).\n"
    "Ctrl-C stops the copy cleanly: no rsync is left running and the share is not marked\n"
    "complete on the server. Exit codes: see 's2s --help' and docs/cli.md.";

// Set by the signal handler, read by the cancel checker that rsync runs poll.
volatile sig_atomic_t g_stop_signal = 0;

// The cancel checker is a plain function (the library's interface), so the progress display it
// drives is reached through this pointer while a copy runs.
struct CopyWatch {
    TransferMeter meter;
    ProgressBar* bar = nullptr;
    uint64_t total = 0;
    int percent = -1;  // rsync's own overall progress, once it reports one
};
CopyWatch* g_watch = nullptr;

void OnStopSignal(int signo) {
    g_stop_signal = signo;
}

void OnProgress(int percent) {
    if (g_watch != nullptr && percent >= 0 && percent <= 100) {
        g_watch->percent = percent;
    }
}

bool CancelRequested() {
    if (g_watch != nullptr && g_watch->bar != nullptr) {
        g_watch->meter.Poll();
        // rsync's percentage counts the files it skips as unchanged; the bytes read only what it
        // sends. The percentage is the better measure of how far the share is, when there is one.
        const uint64_t done = g_watch->percent >= 0
                                  ? g_watch->total / 100 * static_cast<uint64_t>(g_watch->percent)
                                  : g_watch->meter.Bytes();
        g_watch->bar->Update(done);
    }
    return g_stop_signal != 0;
}

// Installs the stop handlers for the life of a sync and restores the old ones afterwards.
class StopSignals {
  public:
    StopSignals() {
        struct sigaction action = {};
        action.sa_handler = OnStopSignal;
        sigemptyset(&action.sa_mask);
        // No SA_RESTART: a blocking wait returns early so the stop is seen at once.
        sigaction(SIGINT, &action, &old_int_);
        sigaction(SIGTERM, &action, &old_term_);
        sigaction(SIGHUP, &action, &old_hup_);
    }
    ~StopSignals() {
        sigaction(SIGINT, &old_int_, nullptr);
        sigaction(SIGTERM, &old_term_, nullptr);
        sigaction(SIGHUP, &old_hup_, nullptr);
    }
    StopSignals(const StopSignals&) = delete;
    StopSignals& operator=(const StopSignals&) = delete;

  private:
    struct sigaction old_int_ = {};
    struct sigaction old_term_ = {};
    struct sigaction old_hup_ = {};
};

double SecondsSince(Clock::time_point start) {
    return std::chrono::duration<double>(Clock::now() - start).count();
}

// The exit class of a remote command that did not answer 0.
ExitCode ClassifyCommandResult(int code) {
    switch (code) {
        case 5:
            return kExitAuth;
        case 10:
        case 30:
        case 35:
            return kExitUnreachable;
        case 20:
            return kExitCancelled;
        default:
            return kExitRefused;
    }
}

// What happened to one share, for the lines printed and the JSON summary.
struct ShareReport {
    std::string name;
    bool encrypted = false;
    TreeSize size;
    uint64_t read_bytes = 0;  // what rsync read to send it (unchanged files are not read)
    double seconds = 0.0;
    double start_seconds = 0.0;
    double copy_seconds = 0.0;
    double key_seconds = 0.0;
    double finish_seconds = 0.0;
    std::string state = "not-run";  // synced, failed, cancelled, refused, not-run
    int result = 0;
    std::string step;  // the step that failed: source-check, start, copy, key, finish
    std::string message;
    std::string guard;            // why the source check refused the share
    long long would_delete = -1;  // what the refused run would have deleted on the receiver
};

class SyncRun {
  public:
    SyncRun(const Options& opts, FILE* out) : opts_(opts), out_(out) {}

    int Run(S2S::SyncTask& task);
    void SetGuardOptions(const S2S::SourceGuardOptions& guard) { guard_ = guard; }
    nlohmann::json Summary() const;

  private:
    int Connect();
    int Pair();
    void SyncShare(ShareReport& share);
    bool GuardSource(ShareReport& share);
    int Finish(int code, const std::string& message);
    void Say(const char* format, ...) __attribute__((format(printf, 2, 3)));

    const Options& opts_;
    FILE* out_;
    S2S::SyncTask task_;
    S2S::Rsyncer rsyncer_;
    S2S::SourceGuardOptions guard_;
    std::vector<ShareReport> shares_;
    Clock::time_point started_ = Clock::now();
    int exit_code_ = kExitOK;
    std::string message_;
    int beacon_result_ = -1;
    bool quiet_ = false;
    double connect_seconds_ = 0.0;
    double pair_seconds_ = 0.0;
    double beacon_seconds_ = 0.0;
};

void SyncRun::Say(const char* format, ...) {
    if (quiet_) {
        return;
    }
    va_list args;
    va_start(args, format);
    std::vfprintf(out_, format, args);
    va_end(args);
    std::fflush(out_);
}

int SyncRun::Finish(int code, const std::string& message) {
    if (exit_code_ == kExitOK) {
        exit_code_ = code;
        message_ = message;
    }
    if (code != kExitOK) {
        std::fprintf(stderr, "s2s: %s\n", message.c_str());
    }
    return code;
}

int SyncRun::Connect() {
    const S2S::SyncInfo& info = task_.GetInfo().GetSyncInfo();
    const std::string target =
        info.GetServerIP().empty()
            ? info.GetServerName()
            : info.GetServerIP() +
                  (info.GetServerName().empty() ? "" : " (" + info.GetServerName() + ")");
    Say("connecting to %s as %s\n", target.c_str(), info.GetUser().c_str());
    const int rc = rsyncer_.Initialize(info);
    if (g_stop_signal != 0) {
        return Finish(kExitCancelled, "stopped before the server answered");
    }
    if (rc == S2S::kRsyncResultNoAddress) {
        return Finish(kExitUnreachable, "no address found for server " + target);
    }
    if (rc != 0) {
        const ExitCode code = ClassifyConnectResult(rc);
        std::string why = code == kExitAuth
                              ? "the server refused user '" + info.GetUser() + "' or its password"
                              : "the server did not answer";
        return Finish(code, why + ": " + ResultName(rc) + ", " + ResultMeaning(rc));
    }
    const int version = rsyncer_.GetServerVersionValue();
    Say("server %s answers: %s\n", rsyncer_.GetSyncInfo().GetServerIP().c_str(),
        version > 0 ? ("protocol version " + std::to_string(version)).c_str()
                    : "an old server (one client per server, no share attributes)");
    return kExitOK;
}

int SyncRun::Pair() {
    const std::list<std::string>& shares = task_.GetInfo().GetShareList();
    std::list<std::string> conflicts;
    int result = 0;
    if (rsyncer_.DoPairing(false, shares, conflicts, result) != 0) {
        if (g_stop_signal != 0) {
            return Finish(kExitCancelled, "stopped while pairing");
        }
        if (result != 0 && result != S2S::kRsyncResultConflict) {
            if (result == S2S::kRsyncResultDryRunOK) {
                // An old server pairs one client as a whole.
                return Finish(kExitConflict, "the server is paired with another client: " +
                                                 ResultName(result) + "; nothing was synced");
            }
            return Finish(ClassifyCommandResult(result),
                          "the server refused the pairing: " + ResultName(result));
        }
        return Finish(kExitInternal, "the pairing request could not be sent (see the log above)");
    }
    if (result == S2S::kRsyncResultConflict || !conflicts.empty()) {
        std::string names;
        for (const std::string& name : conflicts) {
            names += (names.empty() ? "'" : ", '") + name + "'";
        }
        if (names.empty()) {
            names = "(not named by the server)";
        }
        for (ShareReport& share : shares_) {
            share.state = "refused";
            share.step = "pairing";
            share.result = result;
        }
        return Finish(kExitConflict, std::string(conflicts.size() == 1 ? "share " : "shares ") +
                                         names + (conflicts.size() == 1 ? " is" : " are") +
                                         " already paired with another client; nothing was "
                                         "synced");
    }
    if (result != 0) {
        if (g_stop_signal != 0) {
            return Finish(kExitCancelled, "stopped while pairing");
        }
        if (result == S2S::kRsyncResultDryRunOK) {
            return Finish(kExitConflict, "the server is paired with another client: " +
                                             ResultName(result) + "; nothing was synced");
        }
        for (ShareReport& share : shares_) {
            share.state = "refused";
            share.step = "pairing";
            share.result = result;
        }
        return Finish(
            ClassifyCommandResult(result),
            "the server refused the pairing: " + ResultName(result) + ", " + ResultMeaning(result));
    }
    Say("paired %zu share%s\n", shares.size(), shares.size() == 1 ? "" : "s");
    return kExitOK;
}

void SyncRun::SyncShare(ShareReport& share) {
    const Clock::time_point start = Clock::now();
    S2S::ShareInfo info;
    if (rsyncer_.GetShareInfo(share.name, info) != 0) {
        share.state = "failed";
        share.step = "start";
        share.message = "share '" + share.name + "' is not registered or unreadable";
        Finish(kExitInternal, share.message);
        return;
    }
    share.encrypted = info.IsEncrypted();
    share.size = MeasureTree(info.GetModulePath());
    if (!GuardSource(share)) {
        return;
    }

    int result = 0;
    Clock::time_point step = Clock::now();
    const int started = rsyncer_.StartSyncShare(share.name, result);
    share.start_seconds = SecondsSince(step);
    if (started != 0 || result != 0) {
        share.step = "start";
        share.result = result;
        share.state = g_stop_signal != 0 ? "cancelled" : "refused";
        share.message = "the server refused to start share '" + share.name +
                        "': " + ResultName(result) + ", " + ResultMeaning(result);
        if (g_stop_signal == 0) {
            Finish(result == 0 ? kExitInternal : ClassifyCommandResult(result), share.message);
        }
        return;
    }

    Say("share %s%s: copying (%s files, %s)\n", share.name.c_str(),
        share.encrypted ? " (encrypted)" : "", std::to_string(share.size.files).c_str(),
        FormatBytes(share.size.bytes).c_str());
    const bool terminal = isatty(fileno(out_)) != 0;
    ProgressBar bar(out_, terminal, !quiet_ && !opts_.Has("no-progress"));
    CopyWatch watch;
    watch.bar = &bar;
    watch.total = share.size.bytes;
    bar.Start(share.name, share.size.bytes);
    g_watch = &watch;
    const std::vector<std::string> excludes_vec = opts_.GetAll("exclude");
    const std::list<std::string> excludes(excludes_vec.begin(), excludes_vec.end());
    step = Clock::now();
    const int rc = rsyncer_.RunSync(task_.GetID(), share.name, "/", excludes, result);
    share.copy_seconds = SecondsSince(step);
    watch.meter.Poll();
    share.read_bytes = watch.meter.Bytes();
    g_watch = nullptr;
    bar.Finish();
    share.seconds = SecondsSince(start);
    if (g_stop_signal != 0) {
        share.state = "cancelled";
        share.step = "copy";
        share.result = result;
        return;
    }
    // Files that vanish while they are being sent are normal on a live share; the next run takes
    // the share as it is then.
    if (rc != 0 || (result != 0 && result != 24)) {
        share.state = "failed";
        share.step = "copy";
        share.result = result;
        share.message = "copying share '" + share.name + "' failed: " + ResultName(result) + ", " +
                        ResultMeaning(result) + "; it is not marked complete";
        Finish(rc != 0 ? kExitInternal : ClassifyTransferResult(result), share.message);
        return;
    }
    if (result == 24) {
        Say("share %s: some files vanished while they were copied\n", share.name.c_str());
    }

    if (share.encrypted) {
        step = Clock::now();
        const int key = rsyncer_.SyncEncryptKey(share.name);
        share.key_seconds = SecondsSince(step);
        if (g_stop_signal != 0) {
            share.state = "cancelled";
            share.step = "key";
            return;
        }
        if (key != 0) {
            share.state = "failed";
            share.step = "key";
            share.result = key;
            share.message = "sending the key of share '" + share.name +
                            "' failed: " + ResultName(key) + ", " + ResultMeaning(key);
            Finish(kExitKeySync, share.message);
            return;
        }
        Say("share %s: key sent\n", share.name.c_str());
    }

    step = Clock::now();
    const int finished = rsyncer_.FinishSync(kFinishComplete, share.name, result);
    share.finish_seconds = SecondsSince(step);
    if (finished != 0 || result != 0) {
        share.state = g_stop_signal != 0 ? "cancelled" : "failed";
        share.step = "finish";
        share.result = result;
        share.message = "the server did not accept the end of share '" + share.name +
                        "': " + ResultName(result);
        if (g_stop_signal == 0) {
            Finish(result == 0 ? kExitInternal : ClassifyCommandResult(result), share.message);
        }
        return;
    }
    share.seconds = SecondsSince(start);
    share.state = "synced";
    Say("share %s: complete, %s files, %s (rsync read %s) in %.2fs\n", share.name.c_str(),
        std::to_string(share.size.files).c_str(), FormatBytes(share.size.bytes).c_str(),
        FormatBytes(share.read_bytes).c_str(), share.seconds);
}

// Before anything is sent: a share whose folder is missing, not mounted or (against a full copy)
// empty, or whose run would delete more than allowed, is refused and never marked complete.
bool SyncRun::GuardSource(ShareReport& share) {
    const std::vector<std::string> rules = opts_.GetAll("exclude");
    const S2S::SourceGuardReport guard = S2S::CheckShareSource(
        rsyncer_, share.name, std::list<std::string>(rules.begin(), rules.end()), guard_,
        &CancelRequested);
    if (guard.result == S2S::SourceGuardResult::kSafe) {
        return true;
    }
    share.step = "source-check";
    share.guard = S2S::SourceGuardResultName(guard.result);
    if (guard.receiver.known) {
        share.would_delete = static_cast<long long>(guard.receiver.deletions);
    }
    share.message = guard.message;
    if (g_stop_signal != 0) {
        share.state = "cancelled";
    } else if (guard.result == S2S::SourceGuardResult::kCheckFailed) {
        share.state = "failed";
        share.result = guard.dryRunResult;
        Finish(guard.dryRunResult != 0 ? ClassifyTransferResult(guard.dryRunResult) : kExitInternal,
               share.message + (guard.dryRunResult != 0 ? ": " + ResultName(guard.dryRunResult)
                                                        : std::string()));
    } else if (guard.result == S2S::SourceGuardResult::kTooManyDeletions) {
        share.state = "refused";
        Finish(kExitMaxDelete, share.message);
    } else {
        share.state = "refused";
        Finish(kExitUnsafeSource,
               share.message + (guard.result == S2S::SourceGuardResult::kEmptySource
                                    ? " (--allow-empty-source syncs it anyway)"
                                    : ""));
    }
    return false;
}

int SyncRun::Run(S2S::SyncTask& task) {
    task_ = task;
    quiet_ = opts_.Has("quiet");
    for (const std::string& name : task_.GetInfo().GetShareList()) {
        ShareReport share;
        share.name = name;
        shares_.push_back(share);
    }
    Say("task \"%s\": %zu share%s\n", task_.GetInfo().GetName().c_str(), shares_.size(),
        shares_.size() == 1 ? "" : "s");

    StopSignals signals;
    rsyncer_.SetCancelChecker(&CancelRequested);
    // rsync reports its progress only when asked to; a run without a display does not ask.
    if (!quiet_ && !opts_.Has("no-progress")) {
        rsyncer_.SetProgressCallback(&OnProgress);
    }
    Clock::time_point step = Clock::now();
    const int connected = Connect();
    connect_seconds_ = SecondsSince(step);
    if (connected != kExitOK) {
        return exit_code_;
    }
    step = Clock::now();
    const int paired = Pair();
    pair_seconds_ = SecondsSince(step);
    if (paired != kExitOK) {
        return exit_code_;
    }
    for (ShareReport& share : shares_) {
        if (g_stop_signal != 0) {
            break;
        }
        SyncShare(share);
        // Without the server or the credentials the remaining shares cannot fare better.
        if (exit_code_ == kExitAuth || exit_code_ == kExitUnreachable) {
            break;
        }
    }
    if (g_stop_signal != 0) {
        return Finish(kExitCancelled, std::string("stopped by ") +
                                          (g_stop_signal == SIGINT ? "Ctrl-C" : "a signal") +
                                          "; no unfinished share was marked complete");
    }
    int result = 0;
    step = Clock::now();
    const int beacon = rsyncer_.SendBeacon(task_.GetInfo().GetName(), result);
    beacon_seconds_ = SecondsSince(step);
    if (beacon == 0) {
        beacon_result_ = result;
        if (result != 0 && g_stop_signal == 0) {
            Finish(ClassifyCommandResult(result),
                   "the server did not take the task's status: " + ResultName(result));
        }
    } else if (g_stop_signal == 0) {
        Finish(kExitInternal, "the task's status could not be sent (see the log above)");
    }
    if (g_stop_signal != 0) {
        return Finish(kExitCancelled, "stopped while reporting the task's status");
    }
    return exit_code_;
}

nlohmann::json SyncRun::Summary() const {
    nlohmann::json shares = nlohmann::json::array();
    uint64_t files = 0;
    uint64_t bytes = 0;
    uint64_t read_bytes = 0;
    double copy_seconds = 0.0;
    for (const ShareReport& share : shares_) {
        nlohmann::json entry = {{"name", share.name},        {"encrypted", share.encrypted},
                                {"state", share.state},      {"files", share.size.files},
                                {"bytes", share.size.bytes}, {"seconds", share.seconds}};
        if (!share.step.empty()) {
            entry["failed_step"] = share.step;
        }
        if (!share.step.empty() && (share.guard.empty() || share.result != 0)) {
            entry["result"] = share.result;
            entry["result_name"] = ResultName(share.result);
        }
        if (!share.message.empty()) {
            entry["message"] = share.message;
        }
        if (!share.guard.empty()) {
            entry["guard"] = share.guard;
        }
        if (share.would_delete >= 0) {
            entry["would_delete"] = share.would_delete;
        }
        if (share.state == "synced") {
            files += share.size.files;
            bytes += share.size.bytes;
        }
        read_bytes += share.read_bytes;
        copy_seconds += share.copy_seconds;
        shares.push_back(entry);
    }
    const S2S::SyncInfo info = rsyncer_.GetSyncInfo();
    nlohmann::json doc = {
        {"task", task_.GetInfo().GetName()},
        {"task_id", task_.GetID()},
        {"server",
         {{"address", info.GetServerIP()},
          {"name", task_.GetInfo().GetSyncInfo().GetServerName()},
          {"protocol_version", rsyncer_.GetServerVersionValue()}}},
        {"result", ExitCodeName(static_cast<ExitCode>(exit_code_))},
        {"exit_code", exit_code_},
        {"shares", shares},
        {"files", files},
        {"bytes", bytes},
        {"read_bytes", read_bytes},
        {"seconds", SecondsSince(started_)},
        {"copy_seconds", copy_seconds},
        {"steps",
         {{"connect", connect_seconds_}, {"pair", pair_seconds_}, {"beacon", beacon_seconds_}}},
    };
    if (!message_.empty()) {
        doc["message"] = message_;
    }
    if (beacon_result_ >= 0) {
        doc["beacon_result"] = beacon_result_;
    }
    return doc;
}

// Builds the task from the command-line options (when there is no task file).
bool TaskFromOptions(const Options& opts, S2S::SyncTask& task, std::string& error) {
    S2S::TaskInfo info = task.GetInfo();
    info.SetName(opts.Get("name", "cli"));
    const std::vector<std::string> shares = opts.GetAll("share");
    info.SetShareList(std::list<std::string>(shares.begin(), shares.end()));
    S2S::SyncInfo sync = info.GetSyncInfo();
    sync.SetServerName(opts.Get("server"));
    sync.SetServerIP(opts.Get("server-ip"));
    sync.SetUser(opts.Get("user"));
    sync.SetCompression(opts.Has("compress"));
    sync.SetBlockLevelSync(opts.Has("block-level"));
    sync.SetSSH(opts.Has("ssh"));
    unsigned long long value = 0;
    if (opts.Has("ssh-port")) {
        if (!opts.GetUnsigned("ssh-port", 65535, value, error)) {
            return false;
        }
        sync.SetSSHPort(static_cast<unsigned>(value));
    }
    if (opts.Has("max-bandwidth")) {
        if (!opts.GetUnsigned("max-bandwidth", 0xFFFFFFFFULL, value, error)) {
            return false;
        }
        sync.SetMaxBandwidth(static_cast<unsigned>(value));
    }
    if (opts.Has("id")) {
        if (!opts.GetUnsigned("id", ~0ULL, value, error)) {
            return false;
        }
        task.SetID(value);
    }
    info.SetSyncInfo(sync);
    task.SetInfo(info);
    return true;
}

}  // namespace

int RunSyncCommand(const Options& opts) {
    std::string error;
    SetupLogging(0);
    if (!opts.Positional().empty()) {
        return Fail(kExitUsage,
                    "sync takes no arguments (unexpected '" + opts.Positional()[0] + "')");
    }
    int verbosity = opts.Has("quiet") ? -1 : 0;
    if (opts.Has("debug")) {
        verbosity = 2;
    } else if (opts.Has("verbose")) {
        verbosity = 1;
    }
    SetupLogging(verbosity);

    S2S::SyncTask task;
    S2S::SourceGuardOptions guard;
    bool task_has_password = false;
    if (opts.Has("task")) {
        for (const char* option : {"name", "id", "server", "server-ip", "user", "share", "compress",
                                   "block-level", "ssh", "ssh-port", "max-bandwidth"}) {
            if (opts.Has(option)) {
                return Fail(kExitUsage, std::string("--") + option +
                                            " cannot be used with --task (edit the task file)");
            }
        }
        if (!LoadTask(opts.Get("task"), task, guard, task_has_password, error)) {
            return Fail(kExitInvalidTask, error);
        }
    } else if (!TaskFromOptions(opts, task, error)) {
        return Fail(kExitUsage, error);
    }

    // The run's own options win over the task file's.
    guard.allowEmptySource = guard.allowEmptySource || opts.Has("allow-empty-source");
    if (opts.Has("max-delete") &&
        !S2S::DeleteLimit::Parse(opts.Get("max-delete"), guard.maxDelete, error)) {
        return Fail(kExitUsage, "--max-delete: " + error);
    }

    std::string password;
    bool found = false;
    if (!LoadPassword(opts.Get("password-file"), password, found, error)) {
        return Fail(kExitPassword, error);
    }
    if (found) {
        S2S::TaskInfo info = task.GetInfo();
        S2S::SyncInfo sync = info.GetSyncInfo();
        sync.SetPassword(password);
        info.SetSyncInfo(sync);
        task.SetInfo(info);
    }
    std::fill(password.begin(), password.end(), '\0');

    // The first broken rule is logged as a NOTE line; a person needs to see it here. The two rules
    // whose note has no line end are checked first with a message of our own.
    if (task.GetInfo().GetName().empty()) {
        return Fail(kExitInvalidTask, "the task has no name");
    }
    if (task.GetInfo().GetShareList().empty()) {
        return Fail(kExitInvalidTask, "the task names no share (--share NAME or \"share_list\")");
    }
    if (verbosity < 1) {
        SetupLogging(1);
    }
    const bool valid = task.GetInfo().Validate();
    SetupLogging(verbosity);
    if (!valid) {
        return Fail(kExitInvalidTask, "the task is invalid (see the note above)");
    }

    const bool json = opts.Has("json");
    SyncRun run(opts, json ? stderr : stdout);
    run.SetGuardOptions(guard);
    const int code = run.Run(task);
    const nlohmann::json summary = run.Summary();
    if (json) {
        std::printf("%s\n", summary.dump(2).c_str());
    } else if (!opts.Has("quiet") || code != kExitOK) {
        std::printf("%s: %s files, %s in the synced shares (rsync read %s) in %.2fs (%s)\n",
                    code == kExitOK ? "done" : "failed",
                    std::to_string(summary["files"].get<uint64_t>()).c_str(),
                    FormatBytes(summary["bytes"].get<uint64_t>()).c_str(),
                    FormatBytes(summary["read_bytes"].get<uint64_t>()).c_str(),
                    summary["seconds"].get<double>(), ExitCodeName(static_cast<ExitCode>(code)));
    }
    return code;
}

Command SyncCommand() {
    return {"sync",
            "s2s sync (--task FILE | --server HOST --user USER --share NAME ...)",
            "Runs one sync task once, end to end: pairs the shares with the server, copies\n"
            "each one, sends encrypted shares' keys, marks them complete and reports\n"
            "the task's status.",
            kSyncOptions,
            kSyncEpilogue,
            RunSyncCommand};
}

}  // namespace s2s_cli
