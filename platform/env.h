// The platform's one seam to the operating system: file reads, the atomic replacement of a whole
// file, directory creation, file locks, starting, signalling and reaping processes, and the clock.
// Code of the library reaches these through Env::Default(); a test puts an Env of its own in
// place for a scope (EnvOverride) to make a chosen system call fail or a process die at a chosen
// step. Invariant: there is one atomic replacement (ReplaceFile) and one way to start a program
// (Spawn); callers choose options, never their own sequence of system calls.
#ifndef S2S_PLATFORM_ENV_H
#define S2S_PLATFORM_ENV_H

#include <sys/types.h>

#include <chrono>
#include <string>
#include <utility>
#include <vector>

namespace s2s_platform {

// An exclusive flock held on an open descriptor; closing it (destruction) releases the lock.
class FileLock {
  public:
    FileLock() = default;
    explicit FileLock(int fd) : fd_(fd) {}
    ~FileLock();
    FileLock(FileLock&& other) noexcept : fd_(std::exchange(other.fd_, -1)) {}
    FileLock& operator=(FileLock&& other) noexcept;
    FileLock(const FileLock&) = delete;
    FileLock& operator=(const FileLock&) = delete;

    bool held() const { return fd_ >= 0; }
    int fd() const { return fd_; }

  private:
    int fd_ = -1;
};

// How ReplaceFile creates the new file.
struct ReplaceOptions {
    mode_t mode = 0644;  // set with fchmod, so the umask does not apply
    // Owner to give the new file (the old file's, when it differs from ours); -1: our own. Only
    // root can give a file away; anyone else keeps writing as themselves.
    uid_t uid = static_cast<uid_t>(-1);
    gid_t gid = static_cast<gid_t>(-1);
    // The caller holds the lock that serialises the writers of this file: temporaries that a
    // writer who died mid-way left behind are removed first (no other writer can be in flight).
    bool sweep_stale = false;
    // Source tag of the ERROR/WARNING lines ("section_file.cpp"); empty: nothing is logged.
    const char* log_tag = "";
};

// The steps of ReplaceFile, in order. A crash between two of them leaves the old content (up to
// and including kSync) or the new one (from kRename on) under the file's name, never a mix.
enum class ReplaceStep { kCreate = 1, kWrite, kSync, kRename, kSyncDir };
constexpr int kReplaceSteps = 5;
const char* ReplaceStepName(ReplaceStep step);

// A program to start. Standard input is /dev/null. The child gets default signal dispositions
// and an empty signal mask.
struct SpawnSpec {
    std::string program;            // the path executed (see FindProgram; no PATH search)
    std::vector<std::string> argv;  // argv[0] included
    // This process's environment with these variables set (NAME, value) or removed; secrets are
    // handed to a child only this way, never on its command line.
    std::vector<std::pair<std::string, std::string>> set_env;
    std::vector<std::string> unset_env;
    int output_fd = -1;            // standard output: this descriptor, or /dev/null when -1
    int error_fd = -1;             // standard error: the same
    bool own_group = false;        // a process group of its own (pid == pgid)
    bool die_with_parent = false;  // SIGTERM when the calling thread's process dies
    bool detached = false;         // nobody's child: a session of its own, reaped by init
    bool close_other_fds = false;  // descriptors 3 to 1023 closed before exec
    bool drop_mknod = false;       // the capability to create device files dropped
    std::string chdir;             // working directory; empty: inherited
};

// The absolute path of `program` (returned as is when it holds a '/'), or "" when no directory
// of PATH holds an executable of that name.
std::string FindProgram(const std::string& program);

class Env {
  public:
    virtual ~Env();

    // The instance the library uses: an override put in place by EnvOverride, else the POSIX one.
    static Env* Default();

    // --- files
    // A whole file into `out`. 0, or -1 with errno set; a file above `limit` bytes fails with
    // EFBIG.
    virtual int ReadWholeFile(const std::string& path, std::string& out, size_t limit);
    // The same from an open descriptor from its current offset; the descriptor stays open.
    int ReadWholeFd(int fd, std::string& out, size_t limit);
    // `dir` and its missing parents with `mode`; an existing directory is fine. 0, or -1 (errno).
    virtual int MakeDirs(const std::string& dir, mode_t mode = 0755);

    // Replaces `path` by a file holding `content`: a temporary file with a unique name created
    // exclusively (never following a link) in the same directory, all of `content` written,
    // fsync, rename over `path`, fsync of the directory. 0, or -1 with errno set; on every
    // failure the old file stays as it was and the temporary file is removed. A failed sync of
    // the directory (after the rename) is only a warning: the new content is in place.
    int ReplaceFile(const std::string& path, const std::string& content,
                    const ReplaceOptions& options);
    // The prefix of ReplaceFile's temporary names for `path` (a hidden name beside it).
    static std::string TemporaryPrefix(const std::string& path);

    // --- locks
    // Opens `path` (created 0600 unless `directory`; never through a final symbolic link) and
    // takes an exclusive flock, waiting for it. An unheld FileLock with errno set on failure.
    virtual FileLock LockPath(const std::string& path, bool directory);
    // Takes an exclusive flock on `fd`, waiting for it (interrupted waits resume). 0 or -1.
    virtual int LockFd(int fd);

    // --- processes
    // Starts `launch`. The pid (for a detached program its own pid, not an intermediate's), or -1
    // with errno set when it could not be forked. When the program could not be executed the
    // child ends with status 127 and `*exec_error` (when given) holds the errno of exec; 0 when
    // it was executed.
    virtual pid_t Spawn(const SpawnSpec& launch, int* exec_error);
    // kill(2); a negative pid names a process group.
    virtual int Kill(pid_t pid, int signo);
    // waitpid(2) resumed after interruptions.
    virtual pid_t Wait(pid_t pid, int* status, int options);

    // --- clock
    virtual std::chrono::steady_clock::time_point Now();
    virtual struct timespec WallClock();
    virtual void SleepFor(std::chrono::milliseconds pause);

  protected:
    // The system calls ReplaceFile is made of; a test Env makes one of them fail.
    virtual int CreateExclusive(const std::string& path, mode_t mode);
    virtual ssize_t Write(int fd, const void* data, size_t size);
    virtual int Sync(int fd);
    virtual int Rename(const std::string& from, const std::string& to);
    virtual int SyncDir(const std::string& dir);
    // Called after each step of ReplaceFile has succeeded.
    virtual void StepDone(ReplaceStep step);
};

// Puts `env` in place of the default for its lifetime (tests). Not nested across threads.
class EnvOverride {
  public:
    explicit EnvOverride(Env* env);
    ~EnvOverride();
    EnvOverride(const EnvOverride&) = delete;
    EnvOverride& operator=(const EnvOverride&) = delete;

  private:
    Env* previous_;
};

}  // namespace s2s_platform

#endif  // S2S_PLATFORM_ENV_H
