// Scaffolding for the end-to-end scenarios: a sending and a receiving server, each under its own
// S2S_ROOT in a temporary directory, driven only through the built programs s2s and s2s-receiver.
//
// The sending side reaches the receiver's rsync daemon at the standard port, so every test
// process first moves into a network namespace of its own (only a loopback, up), where that port
// is free whatever else runs; the programs it starts inherit it. That needs root: without it the
// scenarios are skipped.
#ifndef S2S_TESTS_TOOLS_S2S_SCENARIO_H
#define S2S_TESTS_TOOLS_S2S_SCENARIO_H

#include <dirent.h>
#include <fcntl.h>
#include <net/if.h>
#include <sched.h>
#include <signal.h>
#include <sys/ioctl.h>
#include <sys/socket.h>
#include <sys/stat.h>
#include <sys/wait.h>
#include <unistd.h>

#include <climits>
#include <cstdio>
#include <cstdlib>
#include <cstring>
#include <fstream>
#include <map>
#include <memory>
#include <set>
#include <sstream>
#include <stdexcept>
#include <string>
#include <vector>

#include "support/test_util.h"

namespace s2s_scenario {

inline std::string Tool(const std::string& name) {
    return std::string(S2S_TOOL_DIR) + "/" + name;
}

inline void MakeDirs(const std::string& path, mode_t mode = 0755) {
    for (size_t pos = 1; pos <= path.size(); ++pos) {
        if (pos == path.size() || path[pos] == '/') {
            mkdir(path.substr(0, pos).c_str(), mode);
        }
    }
}

inline std::string RealPath(const std::string& path) {
    char buffer[PATH_MAX];
    if (realpath(path.c_str(), buffer) == nullptr) {
        throw std::runtime_error("realpath failed for " + path);
    }
    return buffer;
}

inline bool IsPathThere(const std::string& path) {
    struct stat st;
    return lstat(path.c_str(), &st) == 0;
}

// Moves this process into a fresh network namespace with its loopback up; false when it cannot
// (not root, or no namespaces here). Done once per process.
inline bool EnterPrivateNetwork() {
    static int state = -1;
    if (state >= 0) {
        return state == 1;
    }
    state = 0;
    if (geteuid() != 0 || unshare(CLONE_NEWNET) != 0) {
        return false;
    }
    const int fd = socket(AF_INET, SOCK_DGRAM | SOCK_CLOEXEC, 0);
    if (fd < 0) {
        return false;
    }
    struct ifreq ifr;
    std::memset(&ifr, 0, sizeof ifr);
    std::strncpy(ifr.ifr_name, "lo", IFNAMSIZ - 1);
    bool up = ioctl(fd, SIOCGIFFLAGS, &ifr) == 0;
    ifr.ifr_flags = static_cast<short>(ifr.ifr_flags | IFF_UP | IFF_RUNNING);
    up = up && ioctl(fd, SIOCSIFFLAGS, &ifr) == 0;
    close(fd);
    state = up ? 1 : 0;
    return up;
}

// A program started without a shell, its standard output and error going to files, its
// standard input from a file (or /dev/null).
class Child {
  public:
    Child(const std::vector<std::string>& argv, const std::map<std::string, std::string>& env,
          const std::string& dir, const std::string& input = std::string())
        : out_(dir + "/stdout." + std::to_string(++Counter())),
          err_(dir + "/stderr." + std::to_string(Counter())) {
        const std::string in = dir + "/stdin." + std::to_string(Counter());
        s2s_test::WriteFile(in, input);
        pid_ = fork();
        if (pid_ < 0) {
            throw std::runtime_error("fork failed");
        }
        if (pid_ == 0) {
            const int fin = open(in.c_str(), O_RDONLY);
            const int fout = open(out_.c_str(), O_WRONLY | O_CREAT | O_TRUNC, 0600);
            const int ferr = open(err_.c_str(), O_WRONLY | O_CREAT | O_TRUNC, 0600);
            if (fin < 0 || fout < 0 || ferr < 0) {
                _exit(126);
            }
            dup2(fin, 0);
            dup2(fout, 1);
            dup2(ferr, 2);
            for (const auto& kv : env) {
                setenv(kv.first.c_str(), kv.second.c_str(), 1);
            }
            std::vector<char*> args;
            for (const auto& a : argv) {
                args.push_back(const_cast<char*>(a.c_str()));
            }
            args.push_back(nullptr);
            execv(args[0], args.data());
            _exit(127);
        }
    }
    ~Child() {
        if (pid_ > 0 && !done_) {
            kill(pid_, SIGKILL);
            Wait();
        }
    }
    Child(const Child&) = delete;
    Child& operator=(const Child&) = delete;

    pid_t Pid() const { return pid_; }
    void Signal(int signo) const { kill(pid_, signo); }
    // The exit code, or 128 + signal when it was killed.
    int Wait() {
        if (!done_) {
            int status = 0;
            while (waitpid(pid_, &status, 0) < 0 && errno == EINTR) {
            }
            status_ = WIFEXITED(status) ? WEXITSTATUS(status) : 128 + WTERMSIG(status);
            done_ = true;
        }
        return status_;
    }
    std::string Out() const { return s2s_test::ReadFile(out_); }
    std::string Err() const { return s2s_test::ReadFile(err_); }

  private:
    static int& Counter() {
        static int n = 0;
        return n;
    }

    std::string out_;
    std::string err_;
    pid_t pid_ = -1;
    bool done_ = false;
    int status_ = -1;
};

struct Result {
    int status = -1;
    std::string out;
    std::string err;
    std::string All() const { return out + err; }
};

// The direct and indirect child processes of `pid`.
inline std::vector<pid_t> Descendants(pid_t pid) {
    std::vector<pid_t> all;
    std::vector<pid_t> todo = {pid};
    while (!todo.empty()) {
        const pid_t p = todo.back();
        todo.pop_back();
        std::ifstream in("/proc/" + std::to_string(p) + "/task/" + std::to_string(p) + "/children");
        long child = 0;
        while (in >> child) {
            all.push_back(static_cast<pid_t>(child));
            todo.push_back(static_cast<pid_t>(child));
        }
    }
    return all;
}

inline std::string ProcessName(pid_t pid) {
    std::string name = s2s_test::ReadFile("/proc/" + std::to_string(pid) + "/comm");
    while (!name.empty() && name.back() == '\n') {
        name.pop_back();
    }
    return name;
}

// Processes whose command line mentions `needle` (rsync runs name the paths they copy).
inline std::vector<pid_t> ProcessesMentioning(const std::string& needle) {
    std::vector<pid_t> found;
    DIR* dir = opendir("/proc");
    if (dir == nullptr) {
        return found;
    }
    while (struct dirent* entry = readdir(dir)) {
        char* end = nullptr;
        const long pid = std::strtol(entry->d_name, &end, 10);
        if (*end != '\0' || pid <= 0 || pid == getpid()) {
            continue;
        }
        std::string cmdline =
            s2s_test::ReadFile("/proc/" + std::string(entry->d_name) + "/cmdline");
        for (char& c : cmdline) {
            if (c == '\0') {
                c = ' ';
            }
        }
        if (cmdline.find(needle) != std::string::npos) {
            found.push_back(static_cast<pid_t>(pid));
        }
    }
    closedir(dir);
    return found;
}

// Every entry below `root` (type, relative path, size, mode, modification time) and every file's
// content: two trees with equal manifests are identical for the sync's purposes.
inline std::map<std::string, std::string> Manifest(const std::string& root,
                                                   const std::string& rel = "") {
    std::map<std::string, std::string> out;
    DIR* dir = opendir((root + rel).c_str());
    if (dir == nullptr) {
        return out;
    }
    std::vector<std::string> names;
    while (struct dirent* entry = readdir(dir)) {
        if (std::strcmp(entry->d_name, ".") != 0 && std::strcmp(entry->d_name, "..") != 0) {
            names.push_back(entry->d_name);
        }
    }
    closedir(dir);
    for (const std::string& name : names) {
        const std::string path = rel + "/" + name;
        struct stat st;
        if (lstat((root + path).c_str(), &st) != 0) {
            continue;
        }
        std::ostringstream facts;
        facts << std::oct << (st.st_mode & 07777) << std::dec << " " << st.st_mtime;
        if (S_ISDIR(st.st_mode)) {
            out[path] = "dir " + facts.str();
            const auto sub = Manifest(root, path);
            out.insert(sub.begin(), sub.end());
        } else if (S_ISREG(st.st_mode)) {
            out[path] = "file " + std::to_string(st.st_size) + " " + facts.str() + " " +
                        std::to_string(std::hash<std::string>()(s2s_test::ReadFile(root + path)));
        } else {
            out[path] = "other " + facts.str();
        }
    }
    return out;
}

// Writes `count` files of `size` pseudo-random bytes (different per file) under `dir`.
inline void GenerateFiles(const std::string& dir, int count, size_t size, unsigned seed = 1) {
    MakeDirs(dir);
    unsigned state = seed * 2654435761u + 1;
    for (int i = 0; i < count; ++i) {
        std::string content(size, '\0');
        for (char& c : content) {
            state = state * 1103515245u + 12345u;
            c = static_cast<char>(state >> 16);
        }
        s2s_test::WriteFile(dir + "/file" + std::to_string(i), content);
    }
}

// Random bytes from the kernel (incompressible: compressed transfers stay slow enough to be
// caught in the middle).
inline void WriteRandomFile(const std::string& path, size_t size) {
    std::ifstream in("/dev/urandom", std::ios::binary);
    std::string content(size, '\0');
    in.read(&content[0], static_cast<std::streamsize>(size));
    s2s_test::WriteFile(path, content);
}

// One server: a root directory standing for "/", with host facts and a volume.
class Host {
  public:
    Host(const std::string& tag, const std::string& serial) : dir_("s2s-scenario-" + tag) {
        root_ = RealPath(dir_.path());
        MakeDirs(root_ + "/etc/s2s");
        MakeDirs(root_ + "/tmp/S2S", 0700);
        MakeDirs(Volume());
        MakeDirs(root_ + "/logs");
        s2s_test::WriteFile(root_ + "/etc/s2s/host.conf", "[host]\n\tserial=\"" + serial +
                                                              "\"\n[volumes]\n\t" + Volume() +
                                                              "=\"internal,directory\"\n");
    }

    const std::string& Root() const { return root_; }
    std::string Volume() const { return root_ + "/volume1"; }
    std::string SharePath(const std::string& name) const { return Volume() + "/" + name; }
    std::map<std::string, std::string> Env() const { return {{"S2S_ROOT", root_}}; }

    // Runs a built program with this host's root; waits for it.
    Result Run(const std::string& tool, const std::vector<std::string>& args,
               const std::string& input = std::string(),
               const std::map<std::string, std::string>& extra = {}) const {
        std::vector<std::string> argv = {Tool(tool)};
        argv.insert(argv.end(), args.begin(), args.end());
        std::map<std::string, std::string> env = Env();
        env.insert(extra.begin(), extra.end());
        Child child(argv, env, root_ + "/logs", input);
        Result r;
        r.status = child.Wait();
        r.out = child.Out();
        r.err = child.Err();
        return r;
    }

    // Registers a share (its folder is created) through `s2s share add`.
    void AddShare(const std::string& name, const std::vector<std::string>& extra = {}) const {
        MakeDirs(SharePath(name));
        std::vector<std::string> args = {"share", "add", name, "--path", SharePath(name)};
        args.insert(args.end(), extra.begin(), extra.end());
        const Result r = Run("s2s", args);
        if (r.status != 0) {
            throw std::runtime_error("share add failed: " + r.All());
        }
    }

  private:
    s2s_test::TempDir dir_;
    std::string root_;
};

// The receiving server: its rsync daemon on 127.0.0.1 at the standard port, stopped on
// destruction.
class Receiver : public Host {
  public:
    Receiver(const std::string& user, const std::string& password)
        : Host("receiver", "SN-RECEIVER"), user_(user), password_(password) {}
    ~Receiver() { Stop(); }

    Result Configure(bool oldServer = false) const {
        std::vector<std::string> args = {"configure", "--user",    user_,      "--port",
                                         "873",       "--address", "127.0.0.1"};
        if (oldServer) {
            args.push_back("--old-server");
        }
        return Run("s2s-receiver", args, password_ + "\n");
    }
    Result Start() {
        Result r = Run("s2s-receiver", {"start"});
        started_ = started_ || r.status == 0;
        return r;
    }
    Result Stop() {
        if (!started_) {
            return Result{0, "", ""};
        }
        started_ = false;
        return Run("s2s-receiver", {"stop"});
    }
    Result Status() const { return Run("s2s-receiver", {"status"}); }

  private:
    std::string user_;
    std::string password_;
    bool started_ = false;
};

// The sending server: shares, a password file and `s2s sync` runs.
class Sender : public Host {
  public:
    Sender(const std::string& tag, const std::string& serial, const std::string& password)
        : Host(tag, serial) {
        password_file_ = Root() + "/password";
        s2s_test::WriteFile(password_file_, password + "\n");
        chmod(password_file_.c_str(), 0600);
    }

    const std::string& PasswordFile() const { return password_file_; }

    std::vector<std::string> SyncArgs(const std::string& user,
                                      const std::vector<std::string>& shares,
                                      const std::vector<std::string>& extra = {}) const {
        std::vector<std::string> args = {
            "sync",   "--server-ip", "127.0.0.1",       "--user",       user,
            "--name", "scenario",    "--password-file", password_file_, "--no-progress"};
        for (const std::string& share : shares) {
            args.push_back("--share");
            args.push_back(share);
        }
        args.insert(args.end(), extra.begin(), extra.end());
        return args;
    }

    Result Sync(const std::string& user, const std::vector<std::string>& shares,
                const std::vector<std::string>& extra = {}) const {
        return Run("s2s", SyncArgs(user, shares, extra));
    }

    // Starts a sync without waiting for it.
    std::unique_ptr<Child> StartSync(const std::string& user,
                                     const std::vector<std::string>& shares,
                                     const std::vector<std::string>& extra = {}) const {
        std::vector<std::string> argv = {Tool("s2s")};
        const auto args = SyncArgs(user, shares, extra);
        argv.insert(argv.end(), args.begin(), args.end());
        return std::unique_ptr<Child>(new Child(argv, Env(), Root() + "/logs"));
    }

  private:
    std::string password_file_;
};

// True when `dir` holds an rsync temporary file (".name.XXXXXX") of at least `min_size` bytes.
inline bool HasPartialFile(const std::string& dir, off_t min_size = 1) {
    DIR* d = opendir(dir.c_str());
    if (d == nullptr) {
        return false;
    }
    bool found = false;
    while (struct dirent* entry = readdir(d)) {
        const std::string name = entry->d_name;
        if (name.size() > 8 && name[0] == '.' && name != "." && name != "..") {
            struct stat st;
            if (stat((dir + "/" + name).c_str(), &st) == 0 && st.st_size >= min_size) {
                found = true;
            }
        }
    }
    closedir(d);
    return found;
}

// The sending rsync below a running s2s (the first descendant named rsync), or -1.
inline pid_t SenderRsync(pid_t s2s) {
    for (pid_t pid : Descendants(s2s)) {
        if (ProcessName(pid) == "rsync") {
            return pid;
        }
    }
    return -1;
}

}  // namespace s2s_scenario

#endif  // S2S_TESTS_TOOLS_S2S_SCENARIO_H
