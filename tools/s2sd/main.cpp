// s2sd: the sync service. Runs in the foreground (logging to standard error, as systemd wants
// it) or, with --daemon, detached (logging to /var/log/s2s/s2sd.log). SIGTERM and SIGINT cancel
// the running transfers cleanly and end the service; SIGHUP reopens the log file (after the log
// was rotated by another program). One service runs per root: a lock file beside the control
// socket is taken before anything else and held for the life of the process.
#include <fcntl.h>
#include <signal.h>
#include <sys/stat.h>
#include <unistd.h>

#include <cerrno>
#include <cstdio>
#include <cstdlib>
#include <cstring>
#include <string>

#include "s2s_control.h"
#include "s2s_host.h"
#include "s2s_logger.h"
#include "s2s_platform.h"
#include "service/files.h"
#include "service/service.h"

namespace {

const char kLockPath[] = "/run/s2s/s2sd.lock";

const char kUsage[] =
    "usage: s2sd [--daemon] [--log-file] [--max-runs N] [--delay SECONDS] [--verbose]\n"
    "\n"
    "The sync service: runs the sync tasks on their schedules and in real time, and answers\n"
    "the s2s tool on the control socket "
    "/run/s2s/s2sd.sock"
    ".\n"
    "  --daemon         detach from the terminal; log to /var/log/s2s/s2sd.log\n"
    "  --log-file       log to /var/log/s2s/s2sd.log also in the foreground\n"
    "  --max-runs N     at most N runs at once (default 2)\n"
    "  --delay SECONDS  how long changes of a real-time share are gathered (default 5)\n"
    "  --verbose        also informational lines (each run's steps)\n"
    "Runs that fell due while the service was down run once at start; real-time tasks get one\n"
    "full run at start. Fixed paths move below $S2S_ROOT when it is set.\n";

s2sd::Service* g_service = nullptr;
std::string g_log_path;

void OnStop(int) {
    if (g_service != nullptr) {
        g_service->Stop();
    }
}

void OnHangup(int) {
    if (g_service != nullptr) {
        g_service->Hangup();
    }
}

// Opens the log file anew at its path; the logger swaps it in under its own lock, so no line is
// lost or torn.
void ReopenLog() {
    if (g_log_path.empty()) {
        return;
    }
    if (S2S::Logger::Reopen(0640) != 0) {
        S2S::Logger::LogMsg(S2S::Logger::Error, "[ERROR] s2sd(%d): cannot reopen %s: %s\n",
                            __LINE__, g_log_path.c_str(), std::strerror(errno));
        return;
    }
    S2S::Logger::LogMsg(S2S::Logger::Note, "[NOTE] s2sd(%d): log reopened\n", __LINE__);
}

bool ParseNumber(const char* text, long low, long high, long& value) {
    char* end = nullptr;
    errno = 0;
    value = std::strtol(text, &end, 10);
    return end != text && *end == '\0' && errno == 0 && value >= low && value <= high;
}

// Detaches: a grandchild in a new session goes on, without a terminal or standard streams.
int Detach() {
    pid_t pid = fork();
    if (pid < 0) {
        return -1;
    }
    if (pid > 0) {
        _exit(0);
    }
    if (setsid() < 0) {
        return -1;
    }
    pid = fork();
    if (pid < 0) {
        return -1;
    }
    if (pid > 0) {
        _exit(0);
    }
    if (chdir("/") != 0) {
        return -1;
    }
    const int null = open("/dev/null", O_RDWR | O_CLOEXEC);
    if (null < 0) {
        return -1;
    }
    dup2(null, 0);
    dup2(null, 1);
    dup2(null, 2);
    if (null > 2) {
        close(null);
    }
    return 0;
}

}  // namespace

int main(int argc, char** argv) {
    bool daemon = false;
    bool log_file = false;
    int level = S2S::Logger::Note;
    s2sd::ServiceOptions options;
    for (int i = 1; i < argc; ++i) {
        const std::string arg = argv[i];
        long value = 0;
        if (arg == "--daemon") {
            daemon = true;
        } else if (arg == "--log-file") {
            log_file = true;
        } else if (arg == "--verbose") {
            level = S2S::Logger::Info;
        } else if (arg == "--max-runs" && i + 1 < argc && ParseNumber(argv[i + 1], 1, 64, value)) {
            options.max_runs = static_cast<unsigned>(value);
            ++i;
        } else if (arg == "--delay" && i + 1 < argc && ParseNumber(argv[i + 1], 0, 3600, value)) {
            options.realtime_delay_ms = value * 1000;
            ++i;
        } else if (arg == "--help" || arg == "-h") {
            std::fputs(kUsage, stdout);
            return 0;
        } else {
            std::fprintf(stderr, "s2sd: unknown or incomplete option '%s'\n%s", arg.c_str(),
                         kUsage);
            return 2;
        }
    }
    options.db_path = S2SPath(S2S::Control::kDatabasePath);
    options.password_dir = S2SPath(S2S::Control::kPasswordDir);
    options.socket_path = S2SPath(S2S::Control::kSocketPath);

    // Held open (never closed) until the process ends; a second daemon stops here, before it
    // touches the socket, the store or the log.
    long holder = 0;
    std::string lock_error;
    const int lock_fd = s2sd::LockInstance(S2SPath(kLockPath), holder, lock_error);
    if (lock_fd == -2) {
        std::fprintf(stderr, "%s\n", lock_error.c_str());
        return 1;
    }
    if (lock_fd < 0 || s2sd::WriteLockPid(lock_fd, lock_error) != 0) {
        std::fprintf(stderr, "s2sd: %s\n", lock_error.c_str());
        return 1;
    }

    if (daemon || log_file) {
        g_log_path = S2SPath(S2S::Control::kLogPath);
        std::string error;
        if (s2sd::MakeDirs(g_log_path.substr(0, g_log_path.rfind('/')), 0750, error) != 0) {
            std::fprintf(stderr, "s2sd: %s\n", error.c_str());
            return 1;
        }
        const mode_t old_mask = umask(027);
        const int rc = S2S::Logger::Initialize(S2S::Logger::File, level, g_log_path, 5);
        umask(old_mask);
        if (rc != 0) {
            std::fprintf(stderr, "s2sd: cannot open the log %s: %s\n", g_log_path.c_str(),
                         std::strerror(errno));
            return 1;
        }
    } else {
        S2S::Logger::Initialize(S2S::Logger::Stderr, level, "", 0);
    }
    if (daemon && Detach() != 0) {
        std::fprintf(stderr, "s2sd: cannot detach: %s\n", std::strerror(errno));
        return 1;
    }
    if (daemon && s2sd::WriteLockPid(lock_fd, lock_error) != 0) {
        S2S::Logger::LogMsg(S2S::Logger::Error, "[ERROR] s2sd(%d): %s\n", __LINE__,
                            lock_error.c_str());
        return 1;
    }

    // The private temporary directory of remote commands is made now, before another user can
    // make it first; when one stands in its way already, every run would fail, so say it now.
    std::string temp_error;
    if (!S2S::PrepareTempDir(temp_error)) {
        S2S::Logger::LogMsg(S2S::Logger::Error, "[ERROR] s2sd(%d): %s\n", __LINE__,
                            temp_error.c_str());
    }

    s2sd::WallClock clock;
    s2sd::Service service(options, clock);
    std::string error;
    if (service.Start(error) != 0) {
        S2S::Logger::LogMsg(S2S::Logger::Error, "[ERROR] s2sd(%d): %s\n", __LINE__, error.c_str());
        if (!daemon) {
            std::fprintf(stderr, "s2sd: %s\n", error.c_str());
        }
        return 1;
    }
    service.SetHangupHandler(ReopenLog);
    g_service = &service;
    struct sigaction action = {};
    sigemptyset(&action.sa_mask);
    action.sa_handler = OnStop;
    sigaction(SIGTERM, &action, nullptr);
    sigaction(SIGINT, &action, nullptr);
    action.sa_handler = OnHangup;
    sigaction(SIGHUP, &action, nullptr);
    action.sa_handler = SIG_IGN;
    sigaction(SIGPIPE, &action, nullptr);

    service.Serve();
    g_service = nullptr;
    return 0;
}
