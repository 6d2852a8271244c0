// The program runner of the tests: starts a program without a shell, with extra environment
// variables and a given standard input, and collects its exit code, standard output and error.
// Output goes to anonymous memory files, so a chatty program never blocks on a full pipe while
// the test waits for something else.
#ifndef S2S_TESTS_SUPPORT_PROGRAM_H
#define S2S_TESTS_SUPPORT_PROGRAM_H

#include <signal.h>
#include <sys/mman.h>
#include <sys/wait.h>
#include <unistd.h>

#include <cerrno>
#include <map>
#include <stdexcept>
#include <string>
#include <vector>

namespace s2s_test {

using EnvMap = std::map<std::string, std::string>;

struct ProgramResult {
    int status = -1;  // the exit code, or 128 + signal when it was killed
    std::string out;
    std::string err;
    std::string All() const { return out + err; }
};

// The path of a program this build made (s2s, s2s-receiver, s2sd).
inline std::string ToolPath(const std::string& name) {
    return std::string(S2S_TOOL_DIR) + "/" + name;
}

// A running program: this process's environment with `env` over it, `input` on its standard
// input. Killed (and reaped) on destruction when still running.
class Program {
  public:
    Program(const std::vector<std::string>& argv, const EnvMap& env = {},
            const std::string& input = std::string()) {
        // env(1) sets the variables and runs the program: nothing but exec follows the fork.
        std::vector<std::string> all = {"/usr/bin/env"};
        for (const auto& kv : env) {
            all.push_back(kv.first + "=" + kv.second);
        }
        all.insert(all.end(), argv.begin(), argv.end());
        std::vector<char*> args;
        for (auto& a : all) {
            args.push_back(&a[0]);
        }
        args.push_back(nullptr);
        const int in = memfd_create("stdin", MFD_CLOEXEC);
        out_ = memfd_create("stdout", MFD_CLOEXEC);
        err_ = memfd_create("stderr", MFD_CLOEXEC);
        if (in < 0 || out_ < 0 || err_ < 0 ||
            pwrite(in, input.data(), input.size(), 0) != static_cast<ssize_t>(input.size()) ||
            (pid_ = fork()) < 0) {
            throw std::runtime_error("cannot start " + argv.at(0));
        }
        if (pid_ == 0) {
            dup2(in, 0);
            dup2(out_, 1);
            dup2(err_, 2);
            execv(args[0], args.data());
            _exit(127);
        }
        close(in);
    }
    ~Program() {
        if (!done_) {
            kill(pid_, SIGKILL);
            Wait();
        }
        close(out_);
        close(err_);
    }
    Program(const Program&) = delete;
    Program& operator=(const Program&) = delete;

    pid_t Pid() const { return pid_; }
    // True once the program has ended; Wait then returns at once.
    bool Ended() {
        Reap(WNOHANG);
        return done_;
    }
    ProgramResult Wait() {
        Reap(0);
        return result_;
    }

  private:
    void Reap(int flags) {
        int status = 0;
        pid_t r = 0;
        while (!done_ && (r = waitpid(pid_, &status, flags)) < 0 && errno == EINTR) {
        }
        if (!done_ && r == pid_) {
            result_.status = WIFEXITED(status) ? WEXITSTATUS(status) : 128 + WTERMSIG(status);
            result_.out = ReadAll(out_);
            result_.err = ReadAll(err_);
            done_ = true;
        }
    }
    static std::string ReadAll(int fd) {
        std::string text;
        char buffer[8192];
        for (ssize_t n;
             (n = pread(fd, buffer, sizeof buffer, static_cast<off_t>(text.size()))) > 0;) {
            text.append(buffer, static_cast<size_t>(n));
        }
        return text;
    }

    pid_t pid_ = -1;
    int out_ = -1;
    int err_ = -1;
    bool done_ = false;
    ProgramResult result_;
};

// Runs a program to its end.
inline ProgramResult RunProgram(const std::vector<std::string>& argv, const EnvMap& env = {},
                                const std::string& input = std::string()) {
    return Program(argv, env, input).Wait();
}

}  // namespace s2s_test

#endif  // S2S_TESTS_SUPPORT_PROGRAM_H
