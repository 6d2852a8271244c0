// s2s sync: runs one task once, end to end, through the library's TaskRun (the same sequence the
// sync service's daemon uses). This file holds the presentation: options, the lines and progress
// bar, the JSON summary and the exit codes. A share that failed, or a run stopped by Ctrl-C, is
// never finished: the server keeps it marked as not complete.
#include <signal.h>
#include <unistd.h>

#include <algorithm>
#include <cstdio>
#include <list>
#include <nlohmann/json.hpp>

#include "s2s_host.h"
#include "s2s_rsync_wrapper.h"
#include "s2s_source_guard.h"
#include "s2s_sync_obj.h"
#include "s2s_task_run.h"
#include "tools/s2s/commands.h"
#include "tools/s2s/exit_codes.h"
#include "tools/s2s/options.h"
#include "tools/s2s/password.h"
#include "tools/s2s/progress.h"
#include "tools/s2s/task_file.h"
#include "tools/s2s/task_options.h"

namespace s2s_cli {

namespace {

// The task field options (shared with `s2s task add|update`), then the run's own.
std::vector<OptionSpec> SyncOptions() {
    std::vector<OptionSpec> options = TaskFieldOptions(TaskOptionsFor::kSync);
    const std::vector<OptionSpec> run_options = {
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
    options.insert(options.end(), run_options.begin(), run_options.end());
    return options;
}

const char kSyncEpilogue[] =
    "The password comes from --password-file, else the environment variable S2S_PASSWORD,\n"
    "else the task file's \"pswd\" (only in a file other users cannot read).\n"
    "Ctrl-C stops the copy cleanly: no rsync is left running and the share is not marked\n"
    "complete on the server. Exit codes: see 's2s --help' and docs/cli.md.";

// Set by the signal handler, read by the run's cancel poll.
volatile sig_atomic_t g_stop_signal = 0;

void OnStopSignal(int signo) {
    g_stop_signal = signo;
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

ExitCode ExitCodeFor(S2S::RunFailure failure) {
    switch (failure) {
        case S2S::RunFailure::kNone:
            return kExitOK;
        case S2S::RunFailure::kLocal:
            return kExitInternal;
        case S2S::RunFailure::kUnreachable:
            return kExitUnreachable;
        case S2S::RunFailure::kAuth:
            return kExitAuth;
        case S2S::RunFailure::kConflict:
            return kExitConflict;
        case S2S::RunFailure::kRefused:
            return kExitRefused;
        case S2S::RunFailure::kTransfer:
            return kExitTransfer;
        case S2S::RunFailure::kKeySync:
            return kExitKeySync;
        case S2S::RunFailure::kCancelled:
            return kExitCancelled;
        case S2S::RunFailure::kUnsafeSource:
            return kExitUnsafeSource;
        case S2S::RunFailure::kMaxDelete:
            return kExitMaxDelete;
    }
    return kExitInternal;
}

// The run's lines and progress on the terminal (or standard error when the summary is JSON).
class CliObserver : public S2S::TaskRunObserver {
  public:
    CliObserver(FILE* out, bool quiet, bool progress)
        : out_(out),
          quiet_(quiet),
          progress_(progress),
          bar_(out, isatty(fileno(out)) != 0, !quiet && progress) {}

    void OnMessage(const std::string& line) override { Say(line); }
    void OnError(const std::string& message) override {
        std::fprintf(stderr, "s2s: %s\n", message.c_str());
    }
    void OnCopyStart(const S2S::ShareOutcome& share) override {
        Say("share " + share.name + (share.encrypted ? " (encrypted)" : "") + ": copying (" +
            std::to_string(share.files) + " files, " + FormatBytes(share.bytes) + ")");
        bar_.Start(share.name, share.bytes);
    }
    void OnCopyProgress(const S2S::ShareOutcome&, uint64_t done) override { bar_.Update(done); }
    void OnCopyEnd(const S2S::ShareOutcome&) override { bar_.Finish(); }
    void OnShareEnd(const S2S::ShareOutcome& share) override {
        if (share.state != S2S::ShareState::kSynced) {
            return;
        }
        char seconds[32];
        std::snprintf(seconds, sizeof(seconds), "%.2fs", share.seconds);
        Say("share " + share.name + ": complete, " + std::to_string(share.files) + " files, " +
            FormatBytes(share.bytes) + " (rsync read " + FormatBytes(share.read_bytes) + ") in " +
            seconds);
    }
    bool IsCancelled() override { return g_stop_signal != 0; }
    std::string CancelReason() const override {
        return g_stop_signal == SIGINT ? "Ctrl-C" : "a signal";
    }
    bool WantsProgress() const override { return !quiet_ && progress_; }

  private:
    void Say(const std::string& line) {
        if (quiet_) {
            return;
        }
        std::fprintf(out_, "%s\n", line.c_str());
        std::fflush(out_);
    }

    FILE* out_;
    bool quiet_;
    bool progress_;
    ProgressBar bar_;
};

nlohmann::json Summary(const S2S::TaskRun& run) {
    const ExitCode exit_code = ExitCodeFor(run.Failure());
    nlohmann::json shares = nlohmann::json::array();
    uint64_t files = 0;
    uint64_t bytes = 0;
    uint64_t read_bytes = 0;
    double copy_seconds = 0.0;
    for (const S2S::ShareOutcome& share : run.Shares()) {
        nlohmann::json entry = {{"name", share.name},
                                {"encrypted", share.encrypted},
                                {"state", S2S::ShareStateName(share.state)},
                                {"files", share.files},
                                {"bytes", share.bytes},
                                {"seconds", share.seconds}};
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
        if (!share.rsync_errors.empty()) {
            nlohmann::json lines = nlohmann::json::array();
            size_t start = 0;
            while (start < share.rsync_errors.size()) {
                size_t end = share.rsync_errors.find('\n', start);
                end = end == std::string::npos ? share.rsync_errors.size() : end;
                lines.push_back(share.rsync_errors.substr(start, end - start));
                start = end + 1;
            }
            entry["rsync_errors"] = lines;
        }
        if (!share.guard.empty()) {
            entry["guard"] = share.guard;
        }
        if (share.would_delete >= 0) {
            entry["would_delete"] = share.would_delete;
        }
        if (share.state == S2S::ShareState::kSynced) {
            files += share.files;
            bytes += share.bytes;
        }
        read_bytes += share.read_bytes;
        copy_seconds += share.copy_seconds;
        shares.push_back(entry);
    }
    nlohmann::json doc = {
        {"task", run.Task().GetInfo().GetName()},
        {"task_id", run.Task().GetID()},
        {"server",
         {{"address", run.SettledAddress()},
          {"name", run.Task().GetInfo().GetSyncInfo().GetServerName()},
          {"protocol_version", run.ServerVersion()}}},
        {"result", ExitCodeName(exit_code)},
        {"exit_code", static_cast<int>(exit_code)},
        {"shares", shares},
        {"files", files},
        {"bytes", bytes},
        {"read_bytes", read_bytes},
        {"seconds", run.Seconds()},
        {"copy_seconds", copy_seconds},
        {"steps",
         {{"connect", run.ConnectSeconds()},
          {"pair", run.PairSeconds()},
          {"beacon", run.BeaconSeconds()}}},
    };
    if (!run.Message().empty()) {
        doc["message"] = run.Message();
    }
    if (run.BeaconResult() >= 0) {
        doc["beacon_result"] = run.BeaconResult();
    }
    return doc;
}

// Builds the task from the command-line options (when there is no task file).
bool TaskFromOptions(const Options& opts, S2S::SyncTask& task, std::string& error) {
    // Keys left out take the sync model's defaults.
    S2S::PObject map;
    map["name"] = "cli";
    if (!ApplyTaskFieldOptions(opts, map, error)) {
        return false;
    }
    S2S::PObj2SyncTask(map, task);
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
        for (const std::string& option : TaskFieldOptionNames(TaskOptionsFor::kSync)) {
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
    const S2S::SyncInfo& credentials = task.GetInfo().GetSyncInfo();
    if (!VURN::Backup::RsyncWrapper::credentialsFit(credentials.GetUser(),
                                                    credentials.GetPassword())) {
        return Fail(kExitPassword,
                    "the password is too long: rsync cannot authenticate user name and password "
                    "of more than " +
                        std::to_string(VURN::Backup::RsyncWrapper::kMaxSecretLine) +
                        " bytes together (with the ':' between them)");
    }

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
    CliObserver observer(json ? stderr : stdout, opts.Has("quiet"), !opts.Has("no-progress"));
    S2S::TaskRun run(&observer);
    const std::vector<std::string> excludes = opts.GetAll("exclude");
    run.SetExcludes(std::list<std::string>(excludes.begin(), excludes.end()));
    run.SetGuardOptions(guard);
    int code = kExitOK;
    {
        StopSignals signals;
        code = ExitCodeFor(run.Run(task));
    }
    const nlohmann::json summary = Summary(run);
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
            SyncOptions(),
            kSyncEpilogue,
            RunSyncCommand};
}

}  // namespace s2s_cli
