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
    // The library logs through one process-wide logger; below ERROR nothing passes, so a quiet run
    // prints only the tool's own lines.
    int level = S2S::Logger::Error;
    if (verbosity < 0) {
        level = S2S::Logger::Error - 1;
    } else if (verbosity == 1) {
        level = S2S::Logger::Info;
    } else if (verbosity >= 2) {
        level = S2S::Logger::Debug;
    }
    S2S::Logger::Initialize(S2S::Logger::Stderr, level, "", 0);
}

}  // namespace s2s_cli
