// s2s task add|update|remove|show|list|run|cancel|status|history and s2s pause|resume: the front
// end of the sync service s2sd. Each command is one request over the control socket
// (control_client.h); the task travels as the sync model's task map, its password beside it in
// the request and never in the map, on a command line or in what is printed.
#include <signal.h>
#include <time.h>
#include <unistd.h>

#include <algorithm>
#include <cstdio>
#include <nlohmann/json.hpp>

#include "s2s_control.h"
#include "s2s_sync_obj.h"
#include "tools/s2s/commands.h"
#include "tools/s2s/control_client.h"
#include "tools/s2s/exit_codes.h"
#include "tools/s2s/password.h"
#include "tools/s2s/service_view.h"
#include "tools/s2s/task_file.h"
#include "tools/s2s/task_options.h"

namespace s2s_cli {

namespace {

namespace Control = S2S::Control;

const OptionSpec kHelp = {"help", "", false, "show this help"};
const OptionSpec kJson = {"json", "", false, "print the answer as JSON"};

const char kTaskFieldEpilogue[] =
    "The password comes from --password-file, else the environment variable S2S_PASSWORD,\n"
    "else the task file's \"pswd\" (only in a file other users cannot read); the service keeps\n"
    "it in a root-only file. The task file's \"id\", \"status\" and \"sync_result\" are the\n"
    "service's own and are not taken. The schedule comes from the task file's schedule keys\n"
    "(see 's2s task --help' and docs/cli.md).";

std::vector<OptionSpec> With(std::vector<OptionSpec> options, const std::vector<OptionSpec>& more) {
    options.insert(options.end(), more.begin(), more.end());
    return options;
}

// A task id argument: digits only, like every number on this command line.
bool ParseTaskId(const std::string& text, unsigned long long& id) {
    return ParseUnsigned(text, ~0ULL, id);
}

bool IsTaskId(const std::string& text) {
    unsigned long long id = 0;
    return ParseTaskId(text, id);
}

// The one task id a command takes; `optional` allows none (0 is returned through `given`).
int TaskIdArgument(const Options& opts, const std::string& command, bool optional,
                   unsigned long long& id, bool& given) {
    const std::vector<std::string>& args = opts.Positional();
    given = !args.empty();
    if (args.size() > 1 || (!given && !optional)) {
        return Fail(kExitUsage, command + (optional ? " takes at most one task id"
                                                    : " needs exactly one task id"));
    }
    if (given && !ParseTaskId(args[0], id)) {
        return Fail(kExitUsage, command + ": '" + args[0] + "' is not a task id (digits only)");
    }
    return kExitOK;
}

S2S::PObject Request(const char* command) {
    S2S::PObject request;
    request[Control::kKeyCommand] = command;
    return request;
}

void PrintJson(const nlohmann::json& doc) {
    std::printf("%s\n", doc.dump(2).c_str());
}

// What add and update send: `map` (the task as the service has it, or the defaults) with the
// task file's keys and then the options written over it, and the password when one was given.
int BuildTask(const Options& opts, S2S::PObject& map, std::string& password, bool& has_password) {
    std::string error;
    has_password = false;
    std::string file_password;
    bool file_has_password = false;
    if (opts.Has("task")) {
        S2S::PObject file;
        if (!LoadTaskFile(opts.Get("task"), file, file_has_password, error)) {
            return Fail(kExitInvalidTask, error);
        }
        for (const auto& entry : file.asMap()) {
            if (entry.first == "pswd") {
                file_password = entry.second.asString();
            } else if (entry.first != "id" && entry.first != "status" &&
                       entry.first != "sync_result") {
                map[entry.first] = entry.second;
            }
        }
    }
    if (!ApplyTaskFieldOptions(opts, map, error)) {
        return Fail(kExitUsage, error);
    }
    bool found = false;
    if (!LoadPassword(opts.Get("password-file"), password, found, error)) {
        return Fail(kExitPassword, error);
    }
    if (found) {
        has_password = true;
    } else if (file_has_password) {
        password = file_password;
        has_password = true;
    }
    std::fill(file_password.begin(), file_password.end(), '\0');
    const S2S::PObject& task = map;
    if (task["name"].asString().empty()) {
        return Fail(kExitInvalidTask, "the task has no name (--name NAME or \"name\")");
    }
    if (task["share_list"].asArray().empty()) {
        return Fail(kExitInvalidTask, "the task names no share (--share NAME or \"share_list\")");
    }
    return kExitOK;
}

// The task map of a task without its password: the service keeps that apart.
S2S::PObject TaskMap(const S2S::SyncTask& task) {
    S2S::PObject map;
    S2S::SyncTask2PObj(task, map);
    map.asMap().erase("pswd");
    return map;
}

int PrintTaskId(const Options& opts, unsigned long long id, const char* done) {
    if (opts.Has("json")) {
        PrintJson({{Control::kKeyTaskId, id}});
    } else {
        std::printf("task %llu %s\n", id, done);
    }
    return kExitOK;
}

int RunAdd(const Options& opts) {
    if (!opts.Positional().empty()) {
        return Fail(kExitUsage,
                    "task add takes no arguments (unexpected '" + opts.Positional()[0] + "')");
    }
    S2S::PObject map = TaskMap(S2S::SyncTask());
    map.asMap().erase("id");
    std::string password;
    bool has_password = false;
    int code = BuildTask(opts, map, password, has_password);
    if (code != kExitOK) {
        return code;
    }
    if (!has_password) {
        std::fprintf(stderr,
                     "s2s: note: no password given (--password-file, S2S_PASSWORD or the task "
                     "file's \"pswd\"); the task runs with an empty one\n");
    }
    S2S::PObject request = Request(Control::kAdd);
    request[Control::kKeyTask] = map;
    request[Control::kKeyPassword] = password;
    std::fill(password.begin(), password.end(), '\0');
    S2S::PObject reply;
    code = AskService(request, reply);
    request[Control::kKeyPassword] = "";
    if (code != kExitOK) {
        return code;
    }
    const S2S::PObject& answer = reply;
    return PrintTaskId(opts, answer[Control::kKeyTaskId].asUInt64(), "added");
}

// The task the service keeps under `id`, in `task` (its reply map).
int FetchTask(unsigned long long id, S2S::PObject& task) {
    S2S::PObject request = Request(Control::kShow);
    request[Control::kKeyTaskId] = id;
    S2S::PObject reply;
    const int code = AskService(request, reply);
    if (code == kExitOK) {
        const S2S::PObject& answer = reply;
        task = answer[Control::kKeyTask];
    }
    return code;
}

int RunUpdate(const Options& opts) {
    unsigned long long id = 0;
    bool given = false;
    int code = TaskIdArgument(opts, "task update", false, id, given);
    if (code != kExitOK) {
        return code;
    }
    bool changes = false;
    for (const OptionSpec& option : TaskFieldOptions(TaskOptionsFor::kService)) {
        changes = changes || opts.Has(option.name);
    }
    if (!changes) {
        return Fail(kExitUsage, "task update needs --task FILE or an option to change");
    }
    S2S::PObject current;
    code = FetchTask(id, current);
    if (code != kExitOK) {
        return code;
    }
    // Through the sync model, so only the task's own keys go back (not the state or next run).
    S2S::SyncTask task;
    S2S::PObj2SyncTask(current, task);
    S2S::PObject map = TaskMap(task);
    std::string password;
    bool has_password = false;
    code = BuildTask(opts, map, password, has_password);
    if (code != kExitOK) {
        return code;
    }
    map["id"] = id;
    map[Control::kKeyTaskId] = id;
    S2S::PObject request = Request(Control::kUpdate);
    request[Control::kKeyTask] = map;
    if (has_password) {
        request[Control::kKeyPassword] = password;
        std::fill(password.begin(), password.end(), '\0');
    }
    S2S::PObject reply;
    code = AskService(request, reply);
    request[Control::kKeyPassword] = "";
    return code != kExitOK ? code : PrintTaskId(opts, id, "updated");
}

// remove, run and cancel: one task id, one line of answer.
int SimpleTaskCommand(const Options& opts, const char* command, const char* done) {
    unsigned long long id = 0;
    bool given = false;
    int code = TaskIdArgument(opts, std::string("task ") + command, false, id, given);
    if (code != kExitOK) {
        return code;
    }
    S2S::PObject request = Request(command);
    request[Control::kKeyTaskId] = id;
    S2S::PObject reply;
    code = AskService(request, reply);
    if (code == kExitOK) {
        std::printf("task %llu %s\n", id, done);
    }
    return code;
}

int RunRemove(const Options& opts) {
    return SimpleTaskCommand(opts, Control::kRemove, "removed");
}

int RunRun(const Options& opts) {
    return SimpleTaskCommand(opts, Control::kRun, "started (see 's2s task status')");
}

int RunCancel(const Options& opts) {
    return SimpleTaskCommand(opts, Control::kCancel, "cancelled");
}

int RunList(const Options& opts) {
    if (!opts.Positional().empty()) {
        return Fail(kExitUsage, "task list takes no arguments");
    }
    S2S::PObject reply;
    const int code = AskService(Request(Control::kList), reply);
    if (code != kExitOK) {
        return code;
    }
    const S2S::PObject& tasks = static_cast<const S2S::PObject&>(reply)[Control::kKeyTasks];
    if (opts.Has("json")) {
        nlohmann::json doc = nlohmann::json::array();
        for (const S2S::PObject& task : tasks.asArray()) {
            doc.push_back(TaskMapToJson(task));
        }
        PrintJson(doc);
    } else {
        std::fputs(TaskListTable(tasks).c_str(), stdout);
    }
    return kExitOK;
}

int RunShow(const Options& opts) {
    if (opts.Positional().size() != 1) {
        return Fail(kExitUsage, "task show needs a task file or a task id");
    }
    const std::string& what = opts.Positional()[0];
    if (!IsTaskId(what)) {
        if (!opts.Has("json")) {
            return ShowTaskFile(what);
        }
        S2S::PObject map;
        bool has_password = false;
        std::string error;
        if (!LoadTaskFile(what, map, has_password, error)) {
            return Fail(kExitInvalidTask, error);
        }
        PrintJson(TaskMapToJson(map));
        return kExitOK;
    }
    unsigned long long id = 0;
    ParseTaskId(what, id);
    S2S::PObject task;
    const int code = FetchTask(id, task);
    if (code != kExitOK) {
        return code;
    }
    if (opts.Has("json")) {
        PrintJson(TaskMapToJson(task));
    } else {
        std::fputs(TaskDetails(task).c_str(), stdout);
    }
    return kExitOK;
}

volatile sig_atomic_t g_stop_watch = 0;

void OnWatchStop(int) {
    g_stop_watch = 1;
}

// Redraws the status of running tasks every `interval` seconds until none is running or
// queued, or until Ctrl-C.
int WatchStatus(const Options& opts, const S2S::PObject& request, unsigned long long interval) {
    struct sigaction action = {};
    action.sa_handler = OnWatchStop;
    sigemptyset(&action.sa_mask);
    struct sigaction old_int = {};
    struct sigaction old_term = {};
    sigaction(SIGINT, &action, &old_int);
    sigaction(SIGTERM, &action, &old_term);
    const bool terminal = isatty(STDOUT_FILENO) != 0 && !opts.Has("json");
    int lines = 0;
    int code = kExitOK;
    while (true) {
        S2S::PObject reply;
        code = AskService(request, reply);
        if (code != kExitOK) {
            break;
        }
        const S2S::PObject& tasks = static_cast<const S2S::PObject&>(reply)[Control::kKeyTasks];
        if (opts.Has("json")) {
            // One document per line, so a script can read them as they come.
            std::printf("%s\n", PObjectToJson(tasks).dump().c_str());
        } else {
            const std::string table = StatusTable(tasks);
            if (terminal && lines > 0) {
                std::printf("\033[%dA\033[J", lines);  // back over the last table, then clear
            } else if (!terminal && lines > 0) {
                std::printf("\n");
            }
            std::fputs(table.c_str(), stdout);
            lines = static_cast<int>(std::count(table.begin(), table.end(), '\n'));
        }
        std::fflush(stdout);
        if (!AnyActive(tasks)) {
            break;
        }
        for (unsigned long long tenth = 0; tenth < interval * 10 && g_stop_watch == 0; ++tenth) {
            const struct timespec pause = {0, 100000000};
            nanosleep(&pause, nullptr);
        }
        if (g_stop_watch != 0) {
            code = kExitCancelled;
            break;
        }
    }
    sigaction(SIGINT, &old_int, nullptr);
    sigaction(SIGTERM, &old_term, nullptr);
    return code;
}

int RunStatus(const Options& opts) {
    unsigned long long id = 0;
    bool given = false;
    int code = TaskIdArgument(opts, "task status", true, id, given);
    if (code != kExitOK) {
        return code;
    }
    unsigned long long interval = 1;
    std::string error;
    if (opts.Has("interval") &&
        (!opts.GetUnsigned("interval", 3600, interval, error) || interval == 0)) {
        return Fail(kExitUsage, "--interval must be a number of seconds from 1 to 3600");
    }
    if (opts.Has("interval") && !opts.Has("watch")) {
        return Fail(kExitUsage, "--interval goes with --watch");
    }
    S2S::PObject request = Request(Control::kStatus);
    if (given) {
        request[Control::kKeyTaskId] = id;
    }
    if (opts.Has("watch")) {
        return WatchStatus(opts, request, interval);
    }
    S2S::PObject reply;
    code = AskService(request, reply);
    if (code != kExitOK) {
        return code;
    }
    const S2S::PObject& tasks = static_cast<const S2S::PObject&>(reply)[Control::kKeyTasks];
    if (opts.Has("json")) {
        PrintJson(PObjectToJson(tasks));
    } else {
        std::fputs(StatusTable(tasks).c_str(), stdout);
    }
    return kExitOK;
}

int RunHistory(const Options& opts) {
    unsigned long long id = 0;
    bool given = false;
    int code = TaskIdArgument(opts, "task history", true, id, given);
    if (code != kExitOK) {
        return code;
    }
    S2S::PObject request = Request(Control::kHistory);
    if (given) {
        request[Control::kKeyTaskId] = id;
    }
    if (opts.Has("count")) {
        unsigned long long count = 0;
        std::string error;
        if (!opts.GetUnsigned("count", 1000, count, error) || count == 0) {
            return Fail(kExitUsage, "--count must be a number from 1 to 1000");
        }
        request[Control::kKeyCount] = count;
    }
    S2S::PObject reply;
    code = AskService(request, reply);
    if (code != kExitOK) {
        return code;
    }
    const S2S::PObject& runs = static_cast<const S2S::PObject&>(reply)[Control::kKeyRuns];
    if (opts.Has("json")) {
        PrintJson(PObjectToJson(runs));
    } else {
        std::fputs(HistoryText(runs).c_str(), stdout);
    }
    return kExitOK;
}

// pause and resume: the whole service, or one task.
int PauseOrResume(const Options& opts, const char* command, const char* done) {
    unsigned long long id = 0;
    bool given = false;
    int code = TaskIdArgument(opts, command, true, id, given);
    if (code != kExitOK) {
        return code;
    }
    S2S::PObject request = Request(command);
    if (given) {
        request[Control::kKeyTaskId] = id;
    }
    S2S::PObject reply;
    code = AskService(request, reply);
    if (code == kExitOK) {
        if (given) {
            std::printf("task %llu %s\n", id, done);
        } else {
            std::printf("sync service %s\n", done);
        }
    }
    return code;
}

int RunPause(const Options& opts) {
    return PauseOrResume(opts, Control::kPause, "paused");
}

int RunResume(const Options& opts) {
    return PauseOrResume(opts, Control::kResume, "resumed");
}

}  // namespace

std::vector<Command> TaskServiceCommands() {
    const std::vector<OptionSpec> only_help = {kHelp};
    const std::vector<OptionSpec> listing = {kJson, kHelp};
    return {
        {"add", "s2s task add (--task FILE | --server HOST --user USER --share NAME ...)",
         "Gives a task to the sync service s2sd, which runs it on its schedule, and prints\n"
         "the id the service gave it.",
         With(TaskFieldOptions(TaskOptionsFor::kService),
              {{"json", "", false, "print the new task's id as JSON"}, kHelp}),
         kTaskFieldEpilogue, RunAdd},
        {"update", "s2s task update ID [--task FILE] [OPTIONS]",
         "Changes a task of the sync service: the task file's keys and the options given\n"
         "replace those of the task; the rest, and the password unless one is given, stay.",
         With(TaskFieldOptions(TaskOptionsFor::kService),
              {{"json", "", false, "print the task's id as JSON"}, kHelp}),
         kTaskFieldEpilogue, RunUpdate},
        {"remove", "s2s task remove ID",
         "Removes a task from the sync service (a running task must be cancelled first).",
         only_help, "", RunRemove},
        {"show", "s2s task show (FILE | ID) [--json]",
         "Prints a task: a task file as the sync model sees it (defaults filled in), or,\n"
         "given a task id (digits only; write ./NAME for a file named by digits), the task\n"
         "the sync service keeps with its state and next run. The password is never shown.",
         listing, "", RunShow},
        {"list", "s2s task list [--json]",
         "Lists the sync service's tasks with their state, schedule and next run.", listing, "",
         RunList},
        {"run", "s2s task run ID", "Runs a task of the sync service now.", only_help, "", RunRun},
        {"cancel", "s2s task cancel ID",
         "Stops a task's run: its rsync ends, and the share being copied is not marked\n"
         "complete.",
         only_help, "", RunCancel},
        {"status",
         "s2s task status [ID] [--watch [--interval SECONDS]] [--json]",
         "Shows what the sync service's tasks are doing: state, the share being copied,\n"
         "bytes done, next run and the last result.",
         {{"watch", "", false, "refresh until no task is running or queued, or until Ctrl-C"},
          {"interval", "SECONDS", false, "seconds between refreshes with --watch (default 1)"},
          {"json", "", false, "print the answer as JSON (with --watch: one line per refresh)"},
          kHelp},
         "Ctrl-C ends --watch with exit code 130; the runs go on.",
         RunStatus},
        {"history",
         "s2s task history [ID] [--count N] [--json]",
         "Shows the last runs the sync service recorded (of one task, or of all), newest\n"
         "first, with each share's result, files and bytes.",
         {{"count", "N", false, "the number of runs (1 to 1000, default 20)"}, kJson, kHelp},
         "",
         RunHistory},
    };
}

std::vector<Command> ServiceCommands() {
    const std::vector<OptionSpec> only_help = {kHelp};
    return {
        {"pause", "s2s pause [ID]",
         "Pauses the sync service, or only task ID: no run starts until it is resumed.", only_help,
         "", RunPause},
        {"resume", "s2s resume [ID]", "Lets the sync service, or task ID, start runs again.",
         only_help, "", RunResume},
    };
}

}  // namespace s2s_cli
