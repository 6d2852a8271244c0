// Pid-file checks and service control: systemd when it runs the machine, otherwise detached
// executables tracked by pid files in the run directory.
#include <errno.h>
#include <fcntl.h>
#include <poll.h>
#include <signal.h>
#include <sys/stat.h>
#include <sys/syscall.h>
#include <sys/wait.h>
#include <time.h>
#include <unistd.h>

#include <cstdlib>
#include <cstring>
#include <string>

#include "platform/env.h"
#include "platform/platform_internal.h"
#include "s2s_logger.h"
#include "s2s_platform.h"

using S2S::Logger;
using s2s_platform::Fail;
using s2s_platform::Succeed;

namespace {

constexpr int kStopGraceMs = 10000;
constexpr int kKillWaitMs = 5000;

// The process state letter and start time (clock ticks after boot) from /proc/<pid>/stat.
bool ProcStat(pid_t pid, char& state, unsigned long long& start) {
    std::string text;
    if (s2s_platform::Env::Default()->ReadWholeFile("/proc/" + std::to_string(pid) + "/stat", text,
                                                    4096) != 0) {
        return false;
    }
    // The command name may hold blanks and parentheses; the fields resume after the last ')'.
    size_t close = text.rfind(')');
    if (close == std::string::npos || close + 2 >= text.size()) {
        return false;
    }
    state = text[close + 2];
    // Field 22 is the start time; the state is field 3.
    size_t pos = close + 2;
    for (int field = 3; field < 22; ++field) {
        pos = text.find(' ', pos);
        if (pos == std::string::npos) {
            return false;
        }
        ++pos;
    }
    start = std::strtoull(text.c_str() + pos, nullptr, 10);
    return true;
}

bool ProcessAlive(pid_t pid) {
    if (pid <= 0 || (kill(pid, 0) != 0 && errno != EPERM)) {
        return false;
    }
    char state = '?';
    unsigned long long start = 0;
    // A zombie whose parent never reaps it (an init that does not) is not running.
    return !ProcStat(pid, state, start) || (state != 'Z' && state != 'X');
}

// The pid (and, when recorded, the start time) of a pid file; false when missing or garbage.
bool ReadPidFile(const char* path, pid_t& pid, unsigned long long& start) {
    std::string text;
    if (path == nullptr || s2s_platform::Env::Default()->ReadWholeFile(path, text, 256) != 0) {
        return false;
    }
    std::string first = s2s_platform::Trim(text.substr(0, text.find('\n')));
    if (first.empty() || first.size() > 10 ||
        first.find_first_not_of("0123456789") != std::string::npos) {
        return false;
    }
    long value = std::strtol(first.c_str(), nullptr, 10);
    if (value <= 0 || value > 0x3fffffff) {
        return false;
    }
    pid = static_cast<pid_t>(value);
    start = 0;
    size_t newline = text.find('\n');
    if (newline != std::string::npos) {
        std::string second = s2s_platform::Trim(text.substr(newline + 1));
        if (!second.empty() && second.find_first_not_of("0123456789") == std::string::npos) {
            start = std::strtoull(second.c_str(), nullptr, 10);
        }
    }
    return true;
}

bool ValidServiceName(const char* name) {
    if (name == nullptr || name[0] == '\0' || name[0] == '.' || name[0] == '-' ||
        std::strlen(name) > 128) {
        return false;
    }
    for (const char* p = name; *p != '\0'; ++p) {
        char c = *p;
        bool ok = (c >= 'a' && c <= 'z') || (c >= 'A' && c <= 'Z') || (c >= '0' && c <= '9') ||
                  c == '_' || c == '.' || c == '@' || c == '-';
        if (!ok) {
            return false;
        }
    }
    return true;
}

bool UseSystemd() {
    const char* root = std::getenv("S2S_ROOT");
    if (root != nullptr && root[0] != '\0') {
        return false;
    }
    struct stat st;
    return stat(S2S_PATH_SYSTEMD_RUNTIME, &st) == 0 && S_ISDIR(st.st_mode);
}

// Runs systemctl with the given arguments; its exit status, or -1 when it could not run. Its
// errors reach our standard error; its output too unless `quiet`.
int Systemctl(const char* verb, const char* name, bool quiet) {
    s2s_platform::Env* env = s2s_platform::Env::Default();
    std::string unit = std::string(name) + ".service";
    s2s_platform::SpawnSpec launch;
    launch.program = s2s_platform::FindProgram("systemctl");
    if (launch.program.empty()) {
        errno = ENOENT;
        return -1;
    }
    launch.argv = {"systemctl", verb};
    if (quiet) {
        launch.argv.push_back("--quiet");
    }
    launch.argv.push_back(unit);
    launch.output_fd = quiet ? -1 : STDOUT_FILENO;
    launch.error_fd = STDERR_FILENO;
    int exec_error = 0;
    pid_t pid = env->Spawn(launch, &exec_error);
    int status = 0;
    if (pid < 0 || env->Wait(pid, &status, 0) < 0) {
        return -1;
    }
    if (exec_error != 0) {
        errno = exec_error;
        return -1;
    }
    return WIFEXITED(status) ? WEXITSTATUS(status) : -1;
}

// A fixed path, or "" in the out-of-memory case where S2SPath has none to give.
std::string Fixed(const char* path) {
    const char* resolved = S2SPath(path);
    return resolved == nullptr ? std::string() : resolved;
}

std::string RunDir() {
    return Fixed(S2S_PATH_RUN_DIR);
}

std::string PidFilePath(const char* name) {
    return RunDir() + "/" + name + ".pid";
}

// Whether the service recorded in its pid file is the process running under that pid: a
// recorded start time must match, so a pid reused by another program does not count.
bool ServiceAlive(const char* name, pid_t* pid_out) {
    pid_t pid = 0;
    unsigned long long recorded = 0;
    if (!ReadPidFile(PidFilePath(name).c_str(), pid, recorded) || !ProcessAlive(pid)) {
        return false;
    }
    if (recorded != 0) {
        char state = '?';
        unsigned long long start = 0;
        if (ProcStat(pid, state, start) && start != recorded) {
            return false;
        }
    }
    if (pid_out != nullptr) {
        *pid_out = pid;
    }
    return true;
}

// Start and stop of one run directory are serialised by an flock on the directory itself.
s2s_platform::FileLock LockRunDir() {
    std::string dir = RunDir();
    s2s_platform::Env* env = s2s_platform::Env::Default();
    if (env->MakeDirs(dir) != 0) {
        return s2s_platform::FileLock();
    }
    return env->LockPath(dir, true);
}

int WritePidFile(const std::string& path, pid_t pid) {
    std::string text = std::to_string(pid) + "\n";
    char state = '?';
    unsigned long long start = 0;
    if (ProcStat(pid, state, start)) {
        text += std::to_string(start) + "\n";
    }
    // Written under the run directory's lock: a temporary left by a dead starter is stale.
    s2s_platform::ReplaceOptions options;
    options.sweep_stale = true;
    return s2s_platform::Env::Default()->ReplaceFile(path, text, options);
}

// Starts `exe` detached (a session of its own, nobody's child here: init reaps it), with every
// inherited descriptor closed, so it keeps none of the caller's sockets and locks alive. Returns
// its pid, or -1 with errno (also when exec failed).
pid_t SpawnDetached(const std::string& exe, const char* name) {
    s2s_platform::SpawnSpec launch;
    launch.program = exe;
    launch.argv = {name};
    launch.detached = true;
    launch.close_other_fds = true;
    launch.chdir = "/";
    int exec_error = 0;
    pid_t pid = s2s_platform::Env::Default()->Spawn(launch, &exec_error);
    if (pid > 0 && exec_error != 0) {
        errno = exec_error;
        return -1;
    }
    return pid;
}

// Waits until `pid` has exited (or turned zombie), at most `limit_ms`. True when it is gone.
bool WaitGone(pid_t pid, int limit_ms) {
    int pidfd = static_cast<int>(syscall(SYS_pidfd_open, pid, 0));
    if (pidfd >= 0) {
        // A pidfd turns readable when the process exits, even for a process that is not ours.
        struct pollfd pfd = {pidfd, POLLIN, 0};
        struct timespec begin;
        clock_gettime(CLOCK_MONOTONIC, &begin);
        for (;;) {
            struct timespec now;
            clock_gettime(CLOCK_MONOTONIC, &now);
            long elapsed =
                (now.tv_sec - begin.tv_sec) * 1000 + (now.tv_nsec - begin.tv_nsec) / 1000000;
            if (elapsed >= limit_ms) {
                break;
            }
            int rc = poll(&pfd, 1, static_cast<int>(limit_ms - elapsed));
            if (rc > 0) {
                close(pidfd);
                return true;
            }
            if (rc == 0 || errno != EINTR) {
                break;
            }
        }
        close(pidfd);
        return !ProcessAlive(pid);
    }
    // Kernels without pidfd_open: check every 10 ms.
    for (int waited = 0; waited < limit_ms; waited += 10) {
        if (!ProcessAlive(pid)) {
            return true;
        }
        struct timespec pause = {0, 10000000};
        nanosleep(&pause, nullptr);
    }
    return !ProcessAlive(pid);
}

int ServiceFailure(int line, const char* what, const char* name, int err) {
    Logger::LogMsg(Logger::Error, "[ERROR] service.cpp(%d): Fail to %s service '%s', error:'%s'\n",
                   line, what, name, std::strerror(err));
    return Fail(VLIB_ERR_SERVICE_FAILED);
}

}  // namespace

extern "C" {

int VLIBCProcAliveByPidFile(const char* pidFile) {
    pid_t pid = 0;
    unsigned long long start = 0;
    return ReadPidFile(pidFile, pid, start) && ProcessAlive(pid) ? 1 : 0;
}

int VLIBServiceStart(const char* name, int flags) {
    (void)flags;
    if (!ValidServiceName(name)) {
        return Fail(VLIB_ERR_BAD_PARAMETER);
    }
    if (UseSystemd()) {
        if (Systemctl("is-active", name, true) == 0) {
            return Fail(VLIB_ERR_SERVICE_ALREADY);
        }
        int rc = Systemctl("start", name, false);
        if (rc == 0) {
            return Succeed(0);
        }
        // systemctl exits with 5 for a unit it does not know.
        return rc == 5 ? Fail(VLIB_ERR_SERVICE_UNKNOWN)
                       : ServiceFailure(__LINE__, "start", name, rc < 0 ? errno : EIO);
    }
    s2s_platform::FileLock lock = LockRunDir();
    if (!lock.held()) {
        return ServiceFailure(__LINE__, "lock the run directory of", name, errno);
    }
    if (ServiceAlive(name, nullptr)) {
        return Fail(VLIB_ERR_SERVICE_ALREADY);
    }
    std::string service_dir = Fixed(S2S_PATH_SERVICE_DIR);
    if (service_dir.empty()) {
        return Fail(VLIB_ERR_OUT_OF_MEMORY);
    }
    std::string exe = service_dir + "/" + name;
    if (access(exe.c_str(), X_OK) != 0) {
        Logger::LogMsg(Logger::Error,
                       "[ERROR] service.cpp(%d): No executable for service '%s' at '%s'\n",
                       __LINE__, name, exe.c_str());
        return Fail(VLIB_ERR_SERVICE_UNKNOWN);
    }
    pid_t pid = SpawnDetached(exe, name);
    if (pid < 0) {
        return ServiceFailure(__LINE__, "start", name, errno);
    }
    if (WritePidFile(PidFilePath(name), pid) != 0) {
        int saved = errno;
        s2s_platform::Env::Default()->Kill(pid, SIGTERM);
        return ServiceFailure(__LINE__, "record the pid of", name, saved);
    }
    return Succeed(0);
}

int VLIBServicePause(const char* name) {
    if (!ValidServiceName(name)) {
        return Fail(VLIB_ERR_BAD_PARAMETER);
    }
    if (UseSystemd()) {
        if (Systemctl("is-active", name, true) != 0) {
            return Fail(VLIB_ERR_SERVICE_ALREADY);
        }
        int rc = Systemctl("stop", name, false);
        return rc == 0 ? Succeed(0) : ServiceFailure(__LINE__, "stop", name, rc < 0 ? errno : EIO);
    }
    s2s_platform::FileLock lock = LockRunDir();
    if (!lock.held()) {
        return ServiceFailure(__LINE__, "lock the run directory of", name, errno);
    }
    std::string pid_file = PidFilePath(name);
    pid_t pid = 0;
    if (!ServiceAlive(name, &pid)) {
        unlink(pid_file.c_str());  // stale or missing
        return Fail(VLIB_ERR_SERVICE_ALREADY);
    }
    if (s2s_platform::Env::Default()->Kill(pid, SIGTERM) != 0 && errno != ESRCH) {
        return ServiceFailure(__LINE__, "signal", name, errno);
    }
    if (!WaitGone(pid, kStopGraceMs)) {
        Logger::LogMsg(Logger::Warning,
                       "[WARNING] service.cpp(%d): Service '%s' ignored SIGTERM, killing it\n",
                       __LINE__, name);
        s2s_platform::Env::Default()->Kill(pid, SIGKILL);
        if (!WaitGone(pid, kKillWaitMs)) {
            return ServiceFailure(__LINE__, "stop", name, ETIMEDOUT);
        }
    }
    unlink(pid_file.c_str());
    return Succeed(0);
}

int VLIBServiceIsRunning(const char* name) {
    if (!ValidServiceName(name)) {
        return Fail(VLIB_ERR_BAD_PARAMETER);
    }
    if (UseSystemd()) {
        int rc = Systemctl("is-active", name, true);
        if (rc < 0) {
            return ServiceFailure(__LINE__, "query", name, errno);
        }
        return Succeed(rc == 0 ? 1 : 0);
    }
    return Succeed(ServiceAlive(name, nullptr) ? 1 : 0);
}

}  // extern "C"
