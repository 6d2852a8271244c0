// s2s: the sending side's command-line tool. It manages the share registry, runs a sync task once
// end to end against a receiving server, and tells when a task runs next.
#include <cstdio>
#include <cstring>
#include <string>

#include "tools/s2s/commands.h"
#include "tools/s2s/exit_codes.h"

namespace s2s_cli {

namespace {

const char kVersion[] = "1.0.0";

void PrintMainHelp() {
    std::printf(
        "Usage: s2s COMMAND [OPTIONS]\n"
        "\n"
        "Keeps the shared folders of this server in sync with a receiving server.\n"
        "\n"
        "Commands:\n"
        "  sync       run one sync task once: pair the shares, copy them, report the status\n"
        "  next-run   print when a task runs next, in local time\n"
        "  share      manage the share registry (add, remove, list)\n"
        "  task       check a task file, or print it\n"
        "  help       show the help of a command: s2s help sync\n"
        "\n"
        "Every command answers --help. The password is read from --password-file or the\n"
        "environment variable S2S_PASSWORD, never from the command line.\n"
        "\n"
        "Exit codes:\n");
    const ExitCode codes[] = {kExitOK,           kExitInternal,    kExitUsage,    kExitInvalidTask,
                              kExitPassword,     kExitUnreachable, kExitAuth,     kExitConflict,
                              kExitRefused,      kExitTransfer,    kExitKeySync,  kExitRegistry,
                              kExitUnsafeSource, kExitMaxDelete,   kExitCancelled};
    for (ExitCode code : codes) {
        std::printf("  %3d  %-13s %s\n", static_cast<int>(code), ExitCodeName(code),
                    ExitCodeMeaning(code));
    }
}

int Dispatch(const std::string& command, const Args& rest) {
    if (command == "sync") {
        return RunSyncCommand(rest);
    }
    if (command == "next-run") {
        return RunNextRunCommand(rest);
    }
    if (command == "share") {
        return RunShareCommand(rest);
    }
    if (command == "task") {
        return RunTaskCommand(rest);
    }
    return Fail(kExitUsage, "unknown command '" + command + "'");
}

}  // namespace

}  // namespace s2s_cli

int main(int argc, char** argv) {
    using namespace s2s_cli;
    if (argc < 2) {
        PrintMainHelp();
        return kExitUsage;
    }
    const std::string command = argv[1];
    Args rest(argv + 2, argv + argc);
    if (command == "--help" || command == "-h") {
        PrintMainHelp();
        return kExitOK;
    }
    if (command == "--version") {
        std::printf("s2s %s\n", kVersion);
        return kExitOK;
    }
    if (command == "help") {
        if (rest.empty()) {
            PrintMainHelp();
            return kExitOK;
        }
        Args help_args(rest.begin() + 1, rest.end());
        help_args.push_back("--help");
        return Dispatch(rest[0], help_args);
    }
    return Dispatch(command, rest);
}
