// Helpers every command of `s2s` shares: failure messages and where the library's log goes.
#include <cstdio>

#include "s2s_logger.h"
#include "tools/s2s/commands.h"
#include "tools/s2s/exit_codes.h"

namespace s2s_cli {

int Fail(int code, const std::string& message) {
    std::fprintf(stderr, "s2s: %s\n", message.c_str());
    if (code == kExitUsage) {
        std::fprintf(stderr, "Try 's2s --help' or 's2s COMMAND --help'.\n");
    }
    return code;
}

void SetupLogging(int verbosity) {
    // The library logs through one process-wide logger, in lines for the system log (level tag,
    // source file and line). A person at the terminal gets the tool's own messages, which carry
    // the cause; the library's lines go there only when asked for (--verbose, --debug). By
    // default its errors go to the system log, and a quiet run drops them.
    if (verbosity == 0) {
        S2S::Logger::Initialize(S2S::Logger::Syslog, S2S::Logger::Error, "", 0);
        return;
    }
    int level = S2S::Logger::Error - 1;
    if (verbosity == 1) {
        level = S2S::Logger::Info;
    } else if (verbosity >= 2) {
        level = S2S::Logger::Debug;
    }
    S2S::Logger::Initialize(S2S::Logger::Stderr, level, "", 0);
}

}  // namespace s2s_cli
