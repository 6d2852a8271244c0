// RunChild: fork and exec without a shell, the merged output pipe read line by line, the
// cancel poll, and the stop of the child's whole process group (SIGTERM, then SIGKILL). Every
// path reaps the child before returning (no zombie and no running member of the group is left),
// except a child whose caller has all it needs: it is left to this thread's list of runs that
// end by themselves, reaped without waiting at the next run and waited for when the thread ends.
#include "rsync/child_process.h"

#include <fcntl.h>
#include <poll.h>
#include <signal.h>
#include <sys/stat.h>
#include <sys/syscall.h>
#include <sys/wait.h>
#include <unistd.h>

#include <algorithm>
#include <cerrno>
#include <chrono>
#include <cstdlib>
#include <cstring>
#include <thread>
#include <utility>
#include <vector>

#include "platform/env.h"

namespace S2S {
namespace rsync_internal {

namespace {

constexpr int kPollMillis = 100;  // well under the 200 ms the cancel predicate is promised
// Without a pidfd (kernels before 5.3) nothing signals the child's end: it is checked this often.
constexpr int kReapCheckMillis = 5;
constexpr auto kTermGrace = std::chrono::seconds(3);
constexpr auto kKillGrace = std::chrono::seconds(3);

class Fd {
  public:
    explicit Fd(int fd = -1) : fd_(fd) {}
    ~Fd() { reset(); }
    Fd(const Fd&) = delete;
    Fd& operator=(const Fd&) = delete;
    int get() const { return fd_; }
    int release() { return std::exchange(fd_, -1); }
    void reset(int fd = -1) {
        if (fd_ >= 0) {
            close(fd_);
        }
        fd_ = fd;
    }

  private:
    int fd_;
};

bool IsExecutable(const std::string& path) {
    struct stat st;
    return stat(path.c_str(), &st) == 0 && S_ISREG(st.st_mode) && access(path.c_str(), X_OK) == 0;
}

// A descriptor that turns readable the moment the process ends (-1 where the kernel has none).
int OpenPidFd(pid_t pid) {
    return static_cast<int>(syscall(SYS_pidfd_open, pid, 0));
}

// Waits until the process behind `pidfd` ends, at most `millis`; sleeps instead without one.
void AwaitExit(int pidfd, int millis) {
    if (pidfd >= 0) {
        struct pollfd pfd = {pidfd, POLLIN, 0};
        while (poll(&pfd, 1, millis) < 0 && errno == EINTR) {
        }
    } else {
        std::this_thread::sleep_for(std::chrono::milliseconds(std::min(millis, kReapCheckMillis)));
    }
}

// Splits the merged output into lines; progress meters rewrite their line with '\r'.
class LineSplitter {
  public:
    explicit LineSplitter(const LineSink& sink) : sink_(sink) {}
    void Feed(const char* data, size_t size) {
        for (size_t i = 0; i < size; ++i) {
            char c = data[i];
            if (c == '\n' || c == '\r') {
                Flush();
            } else if (pending_.size() < kMaxLine) {
                pending_.push_back(c);
            }
        }
    }
    void Flush() {
        if (!pending_.empty() && sink_) {
            sink_(pending_);
        }
        pending_.clear();
    }

  private:
    static constexpr size_t kMaxLine = 8192;
    const LineSink& sink_;
    std::string pending_;
};

// True while any process (zombies included) is still in the group.
bool GroupAlive(pid_t pgid) {
    return s2s_platform::Env::Default()->Kill(-pgid, 0) == 0 || errno == EPERM;
}

// Reaps `pid` without blocking; true once it has been reaped (status in `*status`).
bool TryReap(pid_t pid, int* status) {
    pid_t r = s2s_platform::Env::Default()->Wait(pid, status, WNOHANG);
    if (r < 0) {
        // Already reaped elsewhere: nothing more can be learnt about it.
        *status = 0;
    }
    return r != 0;
}

void DrainAvailable(int fd, LineSplitter* splitter) {
    char buffer[4096];
    for (;;) {
        ssize_t n = read(fd, buffer, sizeof buffer);
        if (n > 0) {
            splitter->Feed(buffer, static_cast<size_t>(n));
            continue;
        }
        if (n < 0 && errno == EINTR) {
            continue;
        }
        return;
    }
}

// Ends the group: SIGTERM, a grace period, then SIGKILL; reaps `pid` on the way.
void StopGroup(pid_t pid, int pidfd, int fd, LineSplitter* splitter, bool* reaped, int* status) {
    s2s_platform::Env::Default()->Kill(-pid, SIGTERM);
    auto deadline = std::chrono::steady_clock::now() + kTermGrace;
    for (;;) {
        if (!*reaped) {
            *reaped = TryReap(pid, status);
        }
        DrainAvailable(fd, splitter);
        if (*reaped && !GroupAlive(pid)) {
            break;
        }
        auto left = std::chrono::duration_cast<std::chrono::milliseconds>(
            deadline - std::chrono::steady_clock::now());
        if (left.count() <= 0) {
            break;
        }
        // The leader's end wakes this at once; the rest of the group is looked at every 20 ms.
        AwaitExit(*reaped ? -1 : pidfd, static_cast<int>(std::min<long long>(left.count(), 20)));
    }
    if (!*reaped || GroupAlive(pid)) {
        s2s_platform::Env::Default()->Kill(-pid, SIGKILL);
    }
    if (!*reaped) {
        s2s_platform::Env::Default()->Wait(pid, status, 0);
        *reaped = true;
    }
    // Grandchildren that were re-parented are reaped by their new parent; wait (bounded) until
    // the group is gone so that the caller can rely on it.
    deadline = std::chrono::steady_clock::now() + kKillGrace;
    while (GroupAlive(pid) && std::chrono::steady_clock::now() < deadline) {
        s2s_platform::Env::Default()->Kill(-pid, SIGKILL);
        std::this_thread::sleep_for(std::chrono::milliseconds(10));
    }
}

// A child left to end by itself, and what is left of its run.
struct LeftRun {
    pid_t pid;
    int pidfd;   // -1 without pidfds
    int output;  // the read end of its output pipe, drained so that the child never blocks on it
    std::function<void(int status)> after_exit;
};

// The runs this thread left; the thread waits for them before it ends, so the kernel never
// stops one for its forking thread's end.
class LeftRuns {
  public:
    LeftRuns() = default;
    ~LeftRuns() { Finish(); }
    LeftRuns(const LeftRuns&) = delete;
    LeftRuns& operator=(const LeftRuns&) = delete;

    void Add(LeftRun run) { runs_.push_back(std::move(run)); }
    bool Empty() const { return runs_.empty(); }

    // Reaps the runs that have ended, without waiting.
    void ReapEnded() {
        for (size_t i = 0; i < runs_.size();) {
            int status = 0;
            Drain(runs_[i]);
            if (TryReap(runs_[i].pid, &status)) {
                End(i, status);
            } else {
                ++i;
            }
        }
    }

    // Waits for every run; one that outlasts the grace period is stopped.
    void Finish() {
        while (!runs_.empty()) {
            LeftRun& run = runs_.back();
            const auto deadline = std::chrono::steady_clock::now() + kTermGrace;
            int status = 0;
            bool reaped = false;
            while (!(reaped = TryReap(run.pid, &status)) &&
                   std::chrono::steady_clock::now() < deadline) {
                Drain(run);
                AwaitExit(run.pidfd, 20);
            }
            const bool stopped = !reaped;
            if (stopped) {
                LineSplitter splitter(kNoSink);
                StopGroup(run.pid, run.pidfd, run.output, &splitter, &reaped, &status);
            }
            End(runs_.size() - 1, stopped ? -1 : status);
        }
    }

  private:
    static void Drain(const LeftRun& run) {
        LineSplitter splitter(kNoSink);
        DrainAvailable(run.output, &splitter);
    }
    // The run has been reaped (`status`: its wait status, -1 when it was stopped): whatever of
    // its group is left goes, then its descriptors.
    void End(size_t i, int status) {
        LeftRun run = std::move(runs_[i]);
        runs_.erase(runs_.begin() + static_cast<std::ptrdiff_t>(i));
        if (GroupAlive(run.pid)) {
            s2s_platform::Env::Default()->Kill(-run.pid, SIGKILL);
        }
        if (run.pidfd >= 0) {
            close(run.pidfd);
        }
        if (run.output >= 0) {
            close(run.output);
        }
        if (run.after_exit) {
            run.after_exit(status);
        }
    }

    static const LineSink kNoSink;
    std::vector<LeftRun> runs_;
};

const LineSink LeftRuns::kNoSink;

thread_local LeftRuns t_left_runs;
thread_local int t_left_runs_scopes = 0;

}  // namespace

void FinishLeftRuns() {
    t_left_runs.Finish();
}

LeftRunsScope::LeftRunsScope() {
    ++t_left_runs_scopes;
}

LeftRunsScope::~LeftRunsScope() {
    if (--t_left_runs_scopes == 0) {
        t_left_runs.Finish();
    }
}

std::string FindProgram(const std::string& program) {
    return s2s_platform::FindProgram(program);
}

ChildOutcome RunChild(const ChildCommand& job, const boost::function<bool()>& cancel,
                      const LineSink& sink) {
    ChildOutcome outcome;
    t_left_runs.ReapEnded();
    if (job.argv.empty()) {
        outcome.error = "no program given";
        return outcome;
    }
    std::string program = FindProgram(job.argv[0]);
    if (program.empty() || !IsExecutable(program)) {
        outcome.error = "cannot find the program " + job.argv[0];
        return outcome;
    }

    int fds[2];
    if (pipe2(fds, O_CLOEXEC) != 0) {
        outcome.error = std::string("pipe: ") + strerror(errno);
        return outcome;
    }
    Fd read_end(fds[0]);
    Fd write_end(fds[1]);

    // The child leads a process group of its own, so that a cancel ends all it started. It is
    // told (SIGTERM) when its parent dies, even by SIGKILL, so a killed service leaves no
    // transfer behind; the kernel ties this to the thread that forked, not the process: callers
    // wait for the child on the thread that started it, so the thread never ends first.
    s2s_platform::Env* env = s2s_platform::Env::Default();
    s2s_platform::SpawnSpec launch;
    launch.program = program;
    launch.argv = job.argv;
    launch.set_env = job.set_env;
    launch.unset_env = job.unset_env;
    launch.output_fd = write_end.get();
    launch.error_fd = write_end.get();
    launch.own_group = true;
    launch.die_with_parent = true;
    // A program that cannot be executed ends with status 127, as from a shell.
    pid_t pid = env->Spawn(launch, nullptr);
    if (pid < 0) {
        outcome.error = std::string("fork: ") + strerror(errno);
        return outcome;
    }
    outcome.started = true;
    write_end.reset();
    fcntl(read_end.get(), F_SETFL, fcntl(read_end.get(), F_GETFL) | O_NONBLOCK);

    // The child's end wakes the loop through its pidfd, its output through the pipe: nothing
    // waits for a timer unless a cancel predicate has to be asked.
    Fd pid_fd(OpenPidFd(pid));
    LineSplitter splitter(sink);
    bool reaped = false;
    bool eof = false;
    int status = 0;
    while (!reaped || !eof) {
        if (cancel && cancel()) {
            outcome.cancelled = true;
            StopGroup(pid, pid_fd.get(), read_end.get(), &splitter, &reaped, &status);
            break;
        }
        struct pollfd pfds[3];
        nfds_t count = 0;
        if (!eof) {
            pfds[count++] = {read_end.get(), POLLIN, 0};
        }
        if (!reaped && pid_fd.get() >= 0) {
            pfds[count++] = {pid_fd.get(), POLLIN, 0};
        }
        const nfds_t readyAt = count;
        if (!reaped && job.ready && job.ready_fd >= 0 && t_left_runs_scopes > 0) {
            pfds[count++] = {job.ready_fd, POLLIN, 0};
        }
        // Runs left earlier are reaped while this one goes on, not only after it.
        t_left_runs.ReapEnded();
        int timeout = cancel || !t_left_runs.Empty() ? kPollMillis : -1;
        if (!reaped && pid_fd.get() < 0) {
            timeout = eof ? kReapCheckMillis : std::min(kPollMillis, 4 * kReapCheckMillis);
        }
        // With nothing left to watch (output closed, no pidfd) this is a plain pause.
        int r = poll(pfds, count, timeout);
        if (r < 0 && errno != EINTR) {
            std::this_thread::sleep_for(std::chrono::milliseconds(kReapCheckMillis));
        }
        if (!eof && r > 0 && pfds[0].revents != 0) {
            char buffer[4096];
            ssize_t n = read(read_end.get(), buffer, sizeof buffer);
            if (n > 0) {
                splitter.Feed(buffer, static_cast<size_t>(n));
            } else if (n == 0 || (errno != EAGAIN && errno != EINTR)) {
                eof = true;
            }
        }
        if (r > 0 && readyAt < count && pfds[readyAt].revents != 0 && job.ready()) {
            // What is left of the run (rsync's own end) no longer concerns the caller.
            splitter.Flush();
            t_left_runs.Add({pid, pid_fd.release(), eof ? -1 : read_end.release(), job.after_exit});
            outcome.exit_code = 0;
            outcome.left_running = true;
            return outcome;
        }
        if (!reaped) {
            siginfo_t ended = {};
            if (cancel &&
                waitid(P_PID, static_cast<id_t>(pid), &ended, WEXITED | WNOHANG | WNOWAIT) == 0 &&
                ended.si_pid == pid) {
                // The last look, while the ended child can still be examined (its counters in
                // /proc); it has ended, so the answer no longer matters.
                cancel();
            }
            reaped = TryReap(pid, &status);
            if (reaped && !eof) {
                // Output the child wrote before it ended is still in the pipe: take it. Whatever
                // of the group still holds the pipe open then goes with its leader.
                DrainAvailable(read_end.get(), &splitter);
                if (GroupAlive(pid)) {
                    s2s_platform::Env::Default()->Kill(-pid, SIGKILL);
                }
                DrainAvailable(read_end.get(), &splitter);
                eof = true;
            }
        }
    }
    if (GroupAlive(pid)) {
        s2s_platform::Env::Default()->Kill(-pid, SIGKILL);
    }
    DrainAvailable(read_end.get(), &splitter);
    splitter.Flush();
    if (WIFEXITED(status)) {
        outcome.exit_code = WEXITSTATUS(status);
    } else if (WIFSIGNALED(status)) {
        outcome.signal = WTERMSIG(status);
    }
    return outcome;
}

}  // namespace rsync_internal
}  // namespace S2S
