// The POSIX implementation of Env (the default instance) and the one atomic file replacement,
// built on Env's overridable system calls.
#include "platform/env.h"

#include <dirent.h>
#include <fcntl.h>
#include <linux/capability.h>
#include <signal.h>
#include <sys/file.h>
#include <sys/prctl.h>
#include <sys/stat.h>
#include <sys/wait.h>
#include <time.h>
#include <unistd.h>

#include <atomic>
#include <cerrno>
#include <cstdlib>
#include <cstring>
#include <random>
#include <thread>

#include "platform/platform_internal.h"
#include "s2s_logger.h"
#include "s2s_platform.h"

extern char** environ;

namespace s2s_platform {

namespace {

using S2S::Logger;

std::atomic<Env*> g_override{nullptr};

std::string DirName(const std::string& path) {
    size_t slash = path.find_last_of('/');
    if (slash == std::string::npos) {
        return ".";
    }
    return slash == 0 ? "/" : path.substr(0, slash);
}

std::string BaseName(const std::string& path) {
    size_t slash = path.find_last_of('/');
    return slash == std::string::npos ? path : path.substr(slash + 1);
}

// Six characters from [A-Za-z0-9], different in every call and process.
std::string UniqueSuffix() {
    static const char kChars[] = "ABCDEFGHIJKLMNOPQRSTUVWXYZabcdefghijklmnopqrstuvwxyz0123456789";
    static std::atomic<unsigned long long> counter{0};
    struct timespec now;
    clock_gettime(CLOCK_REALTIME, &now);
    std::seed_seq seed{static_cast<unsigned long long>(getpid()), counter.fetch_add(1),
                       static_cast<unsigned long long>(now.tv_nsec),
                       static_cast<unsigned long long>(now.tv_sec)};
    std::mt19937 random(seed);
    std::string out(6, 'X');
    for (char& c : out) {
        c = kChars[random() % (sizeof(kChars) - 1)];
    }
    return out;
}

// The temporaries of dead writers; only called by a writer holding the file's writer lock.
void RemoveStale(const std::string& dir, const std::string& prefix) {
    DIR* d = opendir(dir.c_str());
    if (d == nullptr) {
        return;
    }
    while (dirent* entry = readdir(d)) {
        if (std::strncmp(entry->d_name, prefix.c_str(), prefix.size()) == 0) {
            unlinkat(dirfd(d), entry->d_name, 0);
        }
    }
    closedir(d);
}

// In the child between fork and exec: async-signal-safe calls only. Never returns.
[[noreturn]] void ExecChild(const SpawnSpec& launch, char* const* argv, char* const* envp,
                            int null_fd, int report_fd) {
    // Every disposition back to its default before the mask opens: an ignored signal would stay
    // ignored across exec, and a handler of ours must not run in the child.
    struct sigaction dfl {};
    dfl.sa_handler = SIG_DFL;
    sigemptyset(&dfl.sa_mask);
    for (int sig = 1; sig < NSIG; ++sig) {
        sigaction(sig, &dfl, nullptr);  // SIGKILL, SIGSTOP and unused numbers refuse: harmless
    }
    sigset_t none;
    sigemptyset(&none);
    sigprocmask(SIG_SETMASK, &none, nullptr);
    int out = launch.output_fd >= 0 ? launch.output_fd : null_fd;
    int error = launch.error_fd >= 0 ? launch.error_fd : null_fd;
    bool ok = dup2(null_fd, 0) >= 0 && dup2(out, 1) >= 0 && dup2(error, 2) >= 0;
    if (ok && launch.close_other_fds) {
        for (int fd = 3; fd < 1024; ++fd) {
            if (fd != report_fd) {
                close(fd);
            }
        }
    }
    if (ok && launch.drop_mknod && prctl(PR_CAPBSET_DROP, CAP_MKNOD, 0, 0, 0) != 0) {
        ok = false;
    }
    if (ok && !launch.chdir.empty() && chdir(launch.chdir.c_str()) != 0) {
        // Not fatal: the program chooses its own working directory.
    }
    int err = errno;
    if (ok) {
        execve(launch.program.c_str(), argv, envp);
        err = errno;
    }
    ssize_t ignored = write(report_fd, &err, sizeof err);
    (void)ignored;
    _exit(127);
}

// One small value from a pipe: a write of up to PIPE_BUF bytes arrives whole or not at all.
bool ReadValue(int fd, void* data, size_t size) {
    ssize_t n;
    while ((n = read(fd, data, size)) < 0 && errno == EINTR) {
    }
    return n == static_cast<ssize_t>(size);
}

class Pipe {
  public:
    Pipe() { ok_ = pipe2(fds_, O_CLOEXEC) == 0; }
    ~Pipe() {
        CloseRead();
        CloseWrite();
    }
    Pipe(const Pipe&) = delete;
    Pipe& operator=(const Pipe&) = delete;
    bool ok() const { return ok_; }
    int read_end() const { return fds_[0]; }
    int write_end() const { return fds_[1]; }
    void CloseRead() { CloseOne(0); }
    void CloseWrite() { CloseOne(1); }

  private:
    void CloseOne(int i) {
        if (ok_ && fds_[i] >= 0) {
            close(fds_[i]);
            fds_[i] = -1;
        }
    }
    int fds_[2] = {-1, -1};
    bool ok_ = false;
};

}  // namespace

std::string FindProgram(const std::string& program) {
    if (program.empty()) {
        return std::string();
    }
    if (program.find('/') != std::string::npos) {
        return program;
    }
    const char* path = std::getenv("PATH");
    std::string dirs = path != nullptr && *path != '\0' ? path : "/usr/local/bin:/usr/bin:/bin";
    size_t start = 0;
    while (start <= dirs.size()) {
        size_t end = dirs.find(':', start);
        if (end == std::string::npos) {
            end = dirs.size();
        }
        std::string candidate = dirs.substr(start, end - start) + "/" + program;
        struct stat st;
        if (end > start && stat(candidate.c_str(), &st) == 0 && S_ISREG(st.st_mode) &&
            access(candidate.c_str(), X_OK) == 0) {
            return candidate;
        }
        start = end + 1;
    }
    return std::string();
}

// --- FileLock ----------------------------------------------------------------------------------

FileLock::~FileLock() {
    if (fd_ >= 0) {
        close(fd_);
    }
}

FileLock& FileLock::operator=(FileLock&& other) noexcept {
    if (this != &other) {
        if (fd_ >= 0) {
            close(fd_);
        }
        fd_ = std::exchange(other.fd_, -1);
    }
    return *this;
}

const char* ReplaceStepName(ReplaceStep step) {
    static const char* const kNames[kReplaceSteps] = {"create", "write", "fsync", "rename",
                                                      "sync the directory of"};
    int index = static_cast<int>(step) - 1;
    return index >= 0 && index < kReplaceSteps ? kNames[index] : "?";
}

// --- Env ---------------------------------------------------------------------------------------

Env::~Env() = default;

Env* Env::Default() {
    Env* env = g_override.load();
    if (env != nullptr) {
        return env;
    }
    // Leaked on purpose: used from atexit handlers and other threads at exit.
    static Env* posix = new Env();
    return posix;
}

EnvOverride::EnvOverride(Env* env) : previous_(g_override.exchange(env)) {}

EnvOverride::~EnvOverride() {
    g_override.store(previous_);
}

int Env::ReadWholeFd(int fd, std::string& out, size_t limit) {
    out.clear();
    char chunk[65536];
    for (;;) {
        ssize_t n = read(fd, chunk, sizeof(chunk));
        if (n < 0) {
            if (errno == EINTR) {
                continue;
            }
            return -1;
        }
        if (n == 0) {
            return 0;
        }
        if (out.size() + static_cast<size_t>(n) > limit) {
            errno = EFBIG;
            return -1;
        }
        out.append(chunk, static_cast<size_t>(n));
    }
}

int Env::ReadWholeFile(const std::string& path, std::string& out, size_t limit) {
    int fd = open(path.c_str(), O_RDONLY | O_CLOEXEC);
    if (fd < 0) {
        return -1;
    }
    int rc = ReadWholeFd(fd, out, limit);
    int saved = errno;
    close(fd);
    errno = saved;
    return rc;
}

int Env::MakeDirs(const std::string& dir, mode_t mode) {
    if (dir.empty()) {
        errno = EINVAL;
        return -1;
    }
    struct stat st;
    if (stat(dir.c_str(), &st) == 0) {
        if (S_ISDIR(st.st_mode)) {
            return 0;
        }
        errno = ENOTDIR;
        return -1;
    }
    size_t slash = dir.find_last_of('/');
    if (slash != std::string::npos && slash > 0 && MakeDirs(dir.substr(0, slash), mode) != 0) {
        return -1;
    }
    if (mkdir(dir.c_str(), mode) != 0 && errno != EEXIST) {
        return -1;
    }
    return 0;
}

std::string Env::TemporaryPrefix(const std::string& path) {
    return "." + BaseName(path) + ".s2stmp-";
}

int Env::ReplaceFile(const std::string& path, const std::string& content,
                     const ReplaceOptions& options) {
    const std::string dir = DirName(path);
    const std::string prefix = TemporaryPrefix(path);
    const bool log = options.log_tag != nullptr && options.log_tag[0] != '\0';
    if (options.sweep_stale) {
        RemoveStale(dir, prefix);
    }
    std::string temp;
    int fd = -1;
    for (int attempt = 0; attempt < 100 && fd < 0; ++attempt) {
        temp = dir + "/" + prefix + UniqueSuffix();
        fd = CreateExclusive(temp, 0600);
        if (fd < 0 && errno != EEXIST) {
            break;
        }
    }
    if (fd < 0) {
        int saved = errno;
        if (log) {
            Logger::LogMsg(Logger::Error,
                           "[ERROR] %s(%d): Fail to create a temporary file in '%s', error:'%s'\n",
                           options.log_tag, __LINE__, dir.c_str(), std::strerror(saved));
        }
        errno = saved;
        return -1;
    }
    const char* op = "chmod";
    int err = fchmod(fd, options.mode & 07777) == 0 ? 0 : errno;
    if (err == 0 && ((options.uid != static_cast<uid_t>(-1) && options.uid != geteuid()) ||
                     (options.gid != static_cast<gid_t>(-1) && options.gid != getegid()))) {
        if (fchown(fd, options.uid, options.gid) != 0 && errno != EPERM) {
            op = "chown";
            err = errno;
        }
    }
    if (err == 0) {
        StepDone(ReplaceStep::kCreate);
        op = "write";
        for (size_t done = 0; err == 0 && done < content.size();) {
            ssize_t n = Write(fd, content.data() + done, content.size() - done);
            if (n > 0) {
                done += static_cast<size_t>(n);
            } else if (n == 0) {
                err = EIO;
            } else if (errno != EINTR) {
                err = errno;
            }
        }
    }
    if (err == 0) {
        StepDone(ReplaceStep::kWrite);
        op = "fsync";
        err = Sync(fd) == 0 ? 0 : errno;
    }
    if (close(fd) != 0 && err == 0) {
        op = "close";
        err = errno;
    }
    if (err == 0) {
        StepDone(ReplaceStep::kSync);
        op = "rename";
        err = Rename(temp, path) == 0 ? 0 : errno;
    }
    if (err != 0) {
        unlink(temp.c_str());
        if (log) {
            Logger::LogMsg(Logger::Error,
                           "[ERROR] %s(%d): Fail to %s the new content of '%s', error:'%s'\n",
                           options.log_tag, __LINE__, op, path.c_str(), std::strerror(err));
        }
        errno = err;
        return -1;
    }
    StepDone(ReplaceStep::kRename);
    // The new name is in place; syncing the directory makes the rename itself durable.
    if (SyncDir(dir) != 0) {
        if (log) {
            Logger::LogMsg(Logger::Warning,
                           "[WARNING] %s(%d): Fail to sync directory '%s', error:'%s'\n",
                           options.log_tag, __LINE__, dir.c_str(), std::strerror(errno));
        }
    } else {
        StepDone(ReplaceStep::kSyncDir);
    }
    return 0;
}

FileLock Env::LockPath(const std::string& path, bool directory) {
    int fd = directory ? open(path.c_str(), O_RDONLY | O_DIRECTORY | O_CLOEXEC)
                       : open(path.c_str(), O_RDWR | O_CREAT | O_CLOEXEC | O_NOFOLLOW, 0600);
    if (fd < 0) {
        return FileLock();
    }
    if (LockFd(fd) != 0) {
        int saved = errno;
        close(fd);
        errno = saved;
        return FileLock();
    }
    return FileLock(fd);
}

int Env::LockFd(int fd) {
    int rc;
    while ((rc = flock(fd, LOCK_EX)) != 0 && errno == EINTR) {
    }
    return rc;
}

pid_t Env::Spawn(const SpawnSpec& launch, int* exec_error) {
    if (exec_error != nullptr) {
        *exec_error = 0;
    }
    // Everything the child needs is prepared before fork: after it, only async-signal-safe calls.
    std::vector<std::string> argv_strings(launch.argv);
    std::vector<char*> argv;
    for (auto& s : argv_strings) {
        argv.push_back(&s[0]);
    }
    argv.push_back(nullptr);
    std::vector<std::string> env_strings;
    for (char** e = environ; e != nullptr && *e != nullptr; ++e) {
        std::string entry(*e);
        std::string name = entry.substr(0, entry.find('='));
        bool drop = false;
        for (const auto& unset : launch.unset_env) {
            drop = drop || name == unset;
        }
        for (const auto& set : launch.set_env) {
            drop = drop || name == set.first;
        }
        if (!drop) {
            env_strings.push_back(entry);
        }
    }
    for (const auto& set : launch.set_env) {
        env_strings.push_back(set.first + "=" + set.second);
    }
    std::vector<char*> envp;
    for (auto& s : env_strings) {
        envp.push_back(&s[0]);
    }
    envp.push_back(nullptr);

    int null_fd = open("/dev/null", O_RDWR | O_CLOEXEC);
    if (null_fd < 0) {
        return -1;
    }
    // `report` carries exec's errno (its write end is close-on-exec: a successful exec closes it
    // unwritten); `pid_report` the detached program's pid from the intermediate child.
    Pipe report;
    Pipe pid_report;
    if (!report.ok() || (launch.detached && !pid_report.ok())) {
        int saved = errno;
        close(null_fd);
        errno = saved;
        return -1;
    }
    const pid_t parent = getpid();
    pid_t pid = fork();
    if (pid < 0) {
        int saved = errno;
        close(null_fd);
        errno = saved;
        return -1;
    }
    if (pid == 0) {
        if (launch.detached) {
            // The program leads a session and process group of its own, and is the child of an
            // intermediate that exits at once, so init reaps it.
            pid_t program = fork();
            if (program != 0) {
                ssize_t ignored = write(pid_report.write_end(), &program, sizeof program);
                (void)ignored;
                _exit(program < 0 ? 1 : 0);
            }
            if (setsid() < 0) {
                _exit(1);
            }
        } else if (launch.own_group) {
            setpgid(0, 0);
        }
        // The child is told (SIGTERM) when its parent dies, even by SIGKILL. The kernel ties this
        // to the thread that forked; a parent that died before it took effect shows in getppid().
        if (launch.die_with_parent &&
            (prctl(PR_SET_PDEATHSIG, SIGTERM) != 0 || getppid() != parent)) {
            _exit(127);
        }
        ExecChild(launch, argv.data(), envp.data(), null_fd, report.write_end());
    }
    close(null_fd);
    report.CloseWrite();
    pid_t started = pid;
    if (launch.detached) {
        pid_report.CloseWrite();
        int status = 0;
        Wait(pid, &status, 0);
        if (!ReadValue(pid_report.read_end(), &started, sizeof started) || started <= 0 ||
            !WIFEXITED(status) || WEXITSTATUS(status) != 0) {
            errno = EAGAIN;
            return -1;
        }
    } else if (launch.own_group) {
        // Both ends set the group so that a signal right after fork already reaches the child.
        setpgid(pid, pid);
    }
    int err = 0;
    if (ReadValue(report.read_end(), &err, sizeof err) && exec_error != nullptr) {
        *exec_error = err != 0 ? err : EIO;
    }
    return started;
}

int Env::Kill(pid_t pid, int signo) {
    return kill(pid, signo);
}

pid_t Env::Wait(pid_t pid, int* status, int options) {
    pid_t r;
    while ((r = waitpid(pid, status, options)) < 0 && errno == EINTR) {
    }
    return r;
}

std::chrono::steady_clock::time_point Env::Now() {
    return std::chrono::steady_clock::now();
}

struct timespec Env::WallClock() {
    struct timespec now;
    clock_gettime(CLOCK_REALTIME, &now);
    return now;
}

void Env::SleepFor(std::chrono::milliseconds pause) {
    std::this_thread::sleep_for(pause);
}

int Env::CreateExclusive(const std::string& path, mode_t mode) {
    return open(path.c_str(), O_WRONLY | O_CREAT | O_EXCL | O_NOFOLLOW | O_CLOEXEC, mode);
}

ssize_t Env::Write(int fd, const void* data, size_t size) {
    return write(fd, data, size);
}

int Env::Sync(int fd) {
    return fsync(fd);
}

int Env::Rename(const std::string& from, const std::string& to) {
    return rename(from.c_str(), to.c_str());
}

int Env::SyncDir(const std::string& dir) {
    int fd = open(dir.c_str(), O_RDONLY | O_DIRECTORY | O_CLOEXEC);
    if (fd < 0) {
        // Nothing to sync through (a directory we may write but not read): not an error.
        return 0;
    }
    int rc = fsync(fd);
    int saved = errno;
    close(fd);
    errno = saved;
    return rc;
}

void Env::StepDone(ReplaceStep) {}

}  // namespace s2s_platform

extern "C" {

int S2SFileReplace(const char* path, const void* data, size_t size, unsigned int mode) {
    if (path == nullptr || path[0] == '\0' || (data == nullptr && size > 0)) {
        errno = EINVAL;
        return s2s_platform::Fail(VLIB_ERR_BAD_PARAMETER);
    }
    s2s_platform::ReplaceOptions options;
    options.mode = static_cast<mode_t>(mode);
    std::string content(static_cast<const char*>(data), size);
    if (s2s_platform::Env::Default()->ReplaceFile(path, content, options) != 0) {
        int saved = errno;
        s2s_platform::SetError(s2s_platform::ErrorFromErrno(saved));
        errno = saved;
        return -1;
    }
    return s2s_platform::Succeed(0);
}

}  // extern "C"
