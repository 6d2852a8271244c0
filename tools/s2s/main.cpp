// s2s: the sending side's command-line tool. It manages the share registry, runs a sync task
// once end to end against a receiving server, tells when a task runs next, and is the front end
// of the sync service s2sd (the tasks it keeps and runs).
#include <cstdio>
#include <string>

#include "tools/s2s/command_line.h"
#include "tools/s2s/commands.h"
#include "tools/s2s/exit_codes.h"

namespace s2s_cli {

namespace {

std::string MainHelp() {
    std::string text =
        "Usage: s2s COMMAND [OPTIONS]\n"
        "\n"
        "Keeps the shared folders of this server in sync with a receiving server.\n"
        "\n"
        "Commands:\n"
        "  sync       run one sync task once: pair the shares, copy them, report the status\n"
        "  next-run   print when a task runs next, in local time\n"
        "  share      manage the share registry (add, remove, list)\n"
        "  task       check a task file; add, change, run and watch the sync service's tasks\n"
        "  pause      stop the sync service (or one task) from starting scheduled runs\n"
        "  resume     let it start them again\n"
        "  help       show the help of a command: s2s help sync\n"
        "\n"
        "Every command answers --help. The password is read from --password-file or the\n"
        "environment variable S2S_PASSWORD, never from the command line.\n"
        "\n"
        "Exit codes:\n";
    const ExitCode codes[] = {kExitOK,           kExitInternal,    kExitUsage,     kExitInvalidTask,
                              kExitPassword,     kExitUnreachable, kExitAuth,      kExitConflict,
                              kExitRefused,      kExitTransfer,    kExitKeySync,   kExitRegistry,
                              kExitUnsafeSource, kExitMaxDelete,   kExitNoService, kExitNoSuchTask,
                              kExitBusy,         kExitNotRunning,  kExitService,   kExitCancelled};
    for (ExitCode code : codes) {
        char line[160];
        std::snprintf(line, sizeof(line), "  %3d  %-13s %s\n", static_cast<int>(code),
                      ExitCodeName(code), ExitCodeMeaning(code));
        text += line;
    }
    return text;
}

}  // namespace

}  // namespace s2s_cli

int main(int argc, char** argv) {
    using namespace s2s_cli;
    CommandLine cli(MainHelp());
    CLI::App* root = cli.Root();
    cli.AddCommand(root, SyncCommand());
    cli.AddCommand(root, NextRunCommand());
    CLI::App* share = cli.AddGroup(root, "share", ShareHelp());
    for (const Command& command : ShareCommands()) {
        cli.AddCommand(share, command);
    }
    CLI::App* task = cli.AddGroup(root, "task", TaskHelp());
    for (const Command& command : TaskFileCommands()) {
        cli.AddCommand(task, command);
    }
    for (const Command& command : TaskServiceCommands()) {
        cli.AddCommand(task, command);
    }
    for (const Command& command : ServiceCommands()) {
        cli.AddCommand(root, command);
    }

    Args args(argv + 1, argv + argc);
    // "s2s help COMMAND..." is "s2s COMMAND... --help".
    if (!args.empty() && args[0] == "help") {
        return cli.Help(Args(args.begin() + 1, args.end()));
    }
    return cli.Run(args);
}
