// s2s task check|show FILE: looks at a task file without running it, and the --help page of the
// whole `s2s task` group (the commands that ask the sync service are in cmd_service.cpp).
#include <cstdio>
#include <sstream>

#include "s2s_sync_obj.h"
#include "tools/s2s/commands.h"
#include "tools/s2s/exit_codes.h"
#include "tools/s2s/task_file.h"

namespace s2s_cli {

namespace {

const char kTaskHelp[] =
    "Usage: s2s task check FILE\n"
    "       s2s task show FILE\n"
    "       s2s task add (--task FILE | --server HOST --user USER --share NAME ...)\n"
    "       s2s task update ID [--task FILE] [OPTIONS]\n"
    "       s2s task remove|run|cancel ID\n"
    "       s2s task show ID [--json]\n"
    "       s2s task list [--json]\n"
    "       s2s task status [ID] [--watch] [--json]\n"
    "       s2s task history [ID] [--count N] [--json]\n"
    "\n"
    "check:   reads a task file and validates the task as a sync would (the server is not\n"
    "         contacted); exit 0 when it is valid, 3 when not.\n"
    "show:    with a FILE, prints the task as the sync model sees it (defaults filled in, no\n"
    "         password); with an ID (digits only), the task the sync service keeps.\n"
    "add:     gives a task to the sync service s2sd, which runs it on its schedule.\n"
    "update:  changes a task of the service: the task file's keys and the options given\n"
    "         replace those of the task, the rest stays.\n"
    "remove, run, cancel: forget a task, run it now, stop its run.\n"
    "list, status, history: the service's tasks, their runs in progress, their past runs.\n"
    "Run 's2s task COMMAND --help' for a command's options.\n"
    "\n"
    "A task file is one JSON object with the keys of the task map: \"id\", \"name\",\n"
    "\"share_list\", \"user\", \"pswd\", \"server_ip\", \"server_name\", \"compress\", \"block\",\n"
    "\"ssh\", \"ssh_port\", \"max_bandwidth\", \"schedule_mode\", \"schedule_begin_year\",\n"
    "\"schedule_begin_month\", \"schedule_begin_day\", \"schedule_begin_hour\",\n"
    "\"schedule_begin_min\", \"week_schd\", \"period_hour\", \"period_minute\",\n"
    "\"repeat_times_in_day\", \"allow_empty_source\", \"max_delete\". See docs/cli.md.\n";

const std::vector<OptionSpec> kCheckOptions = {{"help", "", false, "show this help"}};

int RunCheck(const Options& opts) {
    SetupLogging(0);
    if (opts.Positional().size() != 1) {
        return Fail(kExitUsage, "task check needs exactly one task file");
    }
    return CheckTaskFile(opts.Positional()[0]);
}

}  // namespace

std::string TaskHelp() {
    return kTaskHelp;
}

std::vector<Command> TaskFileCommands() {
    return {{"check", "s2s task check FILE",
             "Reads a task file and validates the task as a sync would, without contacting\n"
             "the server: exit 0 when it is valid, 3 when not.",
             kCheckOptions, "", RunCheck}};
}

int ShowTaskFile(const std::string& path) {
    S2S::SyncTask task;
    S2S::SourceGuardOptions guard;
    bool has_password = false;
    std::string error;
    if (!LoadTask(path, task, guard, has_password, error)) {
        return Fail(kExitInvalidTask, error);
    }
    std::ostringstream text;
    text << task;
    // The guards are the task file's own keys, beside the sync model's task map.
    text << "\n<Source Guards>\n"
         << "allow_empty_source: ... " << (guard.allowEmptySource ? "yes" : "no") << "\n"
         << "max_delete: ........... "
         << (guard.maxDelete.set ? guard.maxDelete.ToString() : std::string("none"));
    std::printf("%s\n", text.str().c_str());
    return kExitOK;
}

int CheckTaskFile(const std::string& path) {
    S2S::SyncTask task;
    bool has_password = false;
    std::string error;
    if (!LoadTask(path, task, has_password, error)) {
        return Fail(kExitInvalidTask, error);
    }
    if (task.GetInfo().GetName().empty()) {
        return Fail(kExitInvalidTask, "the task has no name (\"name\")");
    }
    if (task.GetInfo().GetShareList().empty()) {
        return Fail(kExitInvalidTask, "the task names no share (\"share_list\")");
    }
    SetupLogging(1);
    const bool valid = task.GetInfo().Validate();
    SetupLogging(0);
    if (!valid) {
        return Fail(kExitInvalidTask, "the task is invalid (see the note above)");
    }
    std::printf("task \"%s\" is valid (%zu share%s, schedule %s)\n",
                task.GetInfo().GetName().c_str(), task.GetInfo().GetShareList().size(),
                task.GetInfo().GetShareList().size() == 1 ? "" : "s",
                task.GetInfo().GetSchedule().GetModeStr().c_str());
    return kExitOK;
}

}  // namespace s2s_cli
