// s2s task check|show: looks at a task file without running it.
#include <cstdio>
#include <sstream>

#include "s2s_sync_obj.h"
#include "tools/s2s/commands.h"
#include "tools/s2s/exit_codes.h"
#include "tools/s2s/options.h"
#include "tools/s2s/task_file.h"

namespace s2s_cli {

namespace {

const char kTaskHelp[] =
    "Usage: s2s task check FILE\n"
    "       s2s task show FILE\n"
    "\n"
    "check: reads a task file and validates the task as a sync would (the server is not\n"
    "       contacted); exit 0 when it is valid, 3 when not.\n"
    "show:  prints the task as the sync model sees it (defaults filled in, no password).\n"
    "\n"
    "A task file is one JSON object with the keys of the task map: \"id\", \"name\",\n"
    "\"share_list\", \"user\", \"pswd\", \"server_ip\", \"server_name\", \"compress\", \"block\",\n"
    "\"ssh\", \"ssh_port\", \"max_bandwidth\", \"schedule_mode\", \"schedule_begin_year\",\n"
    "\"schedule_begin_month\", \"schedule_begin_day\", \"schedule_begin_hour\",\n"
    "\"schedule_begin_min\", \"week_schd\", \"period_hour\", \"period_minute\",\n"
    "\"repeat_times_in_day\". See docs/cli.md.\n";

const std::vector<OptionSpec> kTaskOptions = {{"help", "", false, "show this help"}};

}  // namespace

int RunTaskCommand(const Args& args) {
    SetupLogging(0);
    if (args.empty() || args[0] == "--help" || args[0] == "-h") {
        std::fputs(kTaskHelp, args.empty() ? stderr : stdout);
        return args.empty() ? kExitUsage : kExitOK;
    }
    const std::string action = args[0];
    if (action != "check" && action != "show") {
        return Fail(kExitUsage, "unknown task command '" + action + "' (check or show)");
    }
    Options opts;
    std::string error;
    if (!opts.Parse(kTaskOptions, Args(args.begin() + 1, args.end()), error)) {
        return Fail(kExitUsage, error);
    }
    if (opts.Has("help")) {
        std::fputs(kTaskHelp, stdout);
        return kExitOK;
    }
    if (opts.Positional().size() != 1) {
        return Fail(kExitUsage, "task " + action + " needs exactly one task file");
    }
    S2S::SyncTask task;
    bool has_password = false;
    if (!LoadTask(opts.Positional()[0], task, has_password, error)) {
        return Fail(kExitInvalidTask, error);
    }
    if (action == "show") {
        std::ostringstream text;
        text << task;
        std::printf("%s\n", text.str().c_str());
        return kExitOK;
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
