// Test scaffolding for the Rsyncer tests: a sending host under its own S2S_ROOT (host facts,
// share registry, temporary directory), a capture of the library's log, and a child process for
// code that must run in a namespace of its own.
#ifndef S2S_TESTS_RSYNC_RSYNCER_FIXTURE_H
#define S2S_TESTS_RSYNC_RSYNCER_FIXTURE_H

#include <dirent.h>
#include <fcntl.h>
#include <net/if.h>
#include <netinet/in.h>
#include <sched.h>
#include <sys/ioctl.h>
#include <sys/socket.h>
#include <sys/stat.h>
#include <sys/wait.h>
#include <unistd.h>

#include <climits>
#include <cstdlib>
#include <cstring>
#include <functional>
#include <map>
#include <memory>
#include <stdexcept>
#include <string>
#include <vector>

#include "s2s_logger.h"
#include "s2s_platform.h"
#include "support/test_util.h"

namespace rsyncer_test {

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

// Attributes of one share in the sending host's registry.
struct ShareAttrs {
    bool encrypted = false;
    bool autoMount = false;
    bool acl = false;
    bool winShare = false;
    unsigned keyLen = 0;
};

// Adds (or replaces) a share in the registry of the host whose root is `root`.
inline std::string RegisterShare(const std::string& root, const std::string& volume,
                                 const std::string& name, const ShareAttrs& attrs) {
    s2s_test::ScopedEnv env("S2S_ROOT", root.c_str());
    const std::string path = volume + "/" + name;
    MakeDirs(path);
    VLIBSzHash* table = VLIBCSzHashAlloc(8);
    VLIBCSzHashSetValue(&table, "path", path.c_str());
    VLIBCSzHashSetValue(&table, "encrypted", attrs.encrypted ? "yes" : "no");
    if (attrs.encrypted) {
        const std::string lower = volume + "/@" + name + "@";
        MakeDirs(lower);
        VLIBCSzHashSetValue(&table, "encrypted_path", lower.c_str());
        VLIBCSzHashSetValue(&table, "key_file", (root + "/keys/" + name + ".key").c_str());
        VLIBCSzHashSetValue(&table, "auto_key_file",
                            (root + "/keys/" + name + ".auto.key").c_str());
    }
    VLIBCSzHashSetValue(&table, "auto_mount", attrs.autoMount ? "yes" : "no");
    VLIBCSzHashSetValue(&table, "acl", attrs.acl ? "yes" : "no");
    VLIBCSzHashSetValue(&table, "win_share", attrs.winShare ? "yes" : "no");
    VLIBCSzHashSetValue(&table, "key_len", std::to_string(attrs.keyLen).c_str());
    const int rc = VURNShareSet(name.c_str(), table);
    VLIBCSzHashFree(table);
    if (rc < 0) {
        throw std::runtime_error("VURNShareSet failed for " + name);
    }
    return path;
}

// The sending side: S2S_ROOT points at a fresh directory holding the host facts (serial number,
// one internal volume), the share registry and the temporary-file directory.
class ClientHost {
  public:
    explicit ClientHost(const std::string& serial = "SN-CLIENT-0001")
        : root_("s2s-rsyncer-client"), env_("S2S_ROOT", RealPath(root_.path()).c_str()) {
        real_ = RealPath(root_.path());
        MakeDirs(real_ + "/etc/s2s");
        MakeDirs(real_ + "/tmp/S2S", 0700);
        MakeDirs(Volume());
        WriteHostConf(serial);
    }

    const std::string& Root() const { return real_; }
    std::string Volume() const { return real_ + "/volume1"; }

    // host.conf with the given serial number ("" for a machine without one).
    void WriteHostConf(const std::string& serial) {
        std::string text = "[host]\n";
        if (!serial.empty()) {
            text += "\tserial=\"" + serial + "\"\n";
        }
        text += "[volumes]\n\t" + Volume() + "=\"internal,directory\"\n";
        s2s_test::WriteFile(real_ + "/etc/s2s/host.conf", text);
    }

    // Registers a share whose directory is <volume>/<name> (and, when encrypted, whose ciphertext
    // directory is <volume>/@<name>@ and whose key files are under <root>/keys); the directories
    // are created. The path of the share's directory.
    std::string AddShare(const std::string& name, const ShareAttrs& attrs = ShareAttrs()) {
        return RegisterShare(real_, Volume(), name, attrs);
    }

    std::string EncryptedDir(const std::string& name) const { return Volume() + "/@" + name + "@"; }
    std::string KeyFile(const std::string& name) const { return real_ + "/keys/" + name + ".key"; }
    std::string AutoKeyFile(const std::string& name) const {
        return real_ + "/keys/" + name + ".auto.key";
    }
    std::string TempDir() const { return real_ + "/tmp/S2S"; }

  private:
    s2s_test::TempDir root_;
    s2s_test::ScopedEnv env_;
    std::string real_;
};

// Sends the library's log to a file for the object's lifetime.
class LogCapture {
  public:
    LogCapture() : dir_("s2s-rsyncer-log") {
        path_ = dir_ / "log";
        S2S::Logger::Initialize(S2S::Logger::File, S2S::Logger::Debug, path_, 2);
    }
    ~LogCapture() { S2S::Logger::Destroy(); }
    LogCapture(const LogCapture&) = delete;
    LogCapture& operator=(const LogCapture&) = delete;

    std::string Text() const { return s2s_test::ReadFile(path_); }
    bool Has(const std::string& needle) const { return Text().find(needle) != std::string::npos; }
    size_t Count(const std::string& needle) const {
        const std::string text = Text();
        size_t n = 0;
        for (size_t at = text.find(needle); at != std::string::npos;
             at = text.find(needle, at + needle.size())) {
            ++n;
        }
        return n;
    }

  private:
    s2s_test::TempDir dir_;
    std::string path_;
};

// Runs `body` in a forked child and returns what it returned; the child leaves with _exit so that
// nothing of the test framework runs twice. Used for changes that must not outlive one call
// (a host name in a private UTS namespace).
inline std::string RunInChild(const std::function<std::string()>& body) {
    int fds[2];
    if (pipe(fds) != 0) {
        throw std::runtime_error("pipe failed");
    }
    const pid_t pid = fork();
    if (pid < 0) {
        throw std::runtime_error("fork failed");
    }
    if (pid == 0) {
        close(fds[0]);
        std::string out;
        try {
            out = body();
        } catch (...) {
            out = "<exception>";
        }
        size_t done = 0;
        while (done < out.size()) {
            const ssize_t n = write(fds[1], out.data() + done, out.size() - done);
            if (n <= 0) {
                break;
            }
            done += static_cast<size_t>(n);
        }
        _exit(0);
    }
    close(fds[1]);
    std::string out;
    char buffer[4096];
    for (;;) {
        const ssize_t n = read(fds[0], buffer, sizeof buffer);
        if (n <= 0) {
            break;
        }
        out.append(buffer, static_cast<size_t>(n));
    }
    close(fds[0]);
    int status = 0;
    waitpid(pid, &status, 0);
    return out;
}

// Moves this process (and the children it starts afterwards) into a network namespace of its own
// with only the loopback interface, up. The sending side reaches a daemon on the standard rsync
// port, so each test process gets a loopback of its own where that port is free. Needs root;
// false when it cannot be done. Done once per process.
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

// True when something accepts TCP connections on 127.0.0.1:`port`.
inline bool PortAccepting(int port) {
    const int fd = socket(AF_INET, SOCK_STREAM | SOCK_CLOEXEC, 0);
    if (fd < 0) {
        return false;
    }
    sockaddr_in addr{};
    addr.sin_family = AF_INET;
    addr.sin_port = htons(static_cast<uint16_t>(port));
    addr.sin_addr.s_addr = htonl(INADDR_LOOPBACK);
    const bool ok = connect(fd, reinterpret_cast<sockaddr*>(&addr), sizeof addr) == 0;
    close(fd);
    return ok;
}

struct ToolResult {
    int status = -1;     // exit code, or -1 when it did not exit normally
    std::string output;  // standard output and error together
};

// Runs a program (no shell) with extra environment variables, `input` on its standard input.
inline ToolResult RunTool(const std::vector<std::string>& argv,
                          const std::map<std::string, std::string>& env,
                          const std::string& input = std::string()) {
    int in[2];
    int out[2];
    if (pipe2(in, O_CLOEXEC) != 0 || pipe2(out, O_CLOEXEC) != 0) {
        throw std::runtime_error("pipe failed");
    }
    const pid_t pid = fork();
    if (pid < 0) {
        throw std::runtime_error("fork failed");
    }
    if (pid == 0) {
        dup2(in[0], 0);
        dup2(out[1], 1);
        dup2(out[1], 2);
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
    close(in[0]);
    close(out[1]);
    size_t done = 0;
    while (done < input.size()) {
        const ssize_t n = write(in[1], input.data() + done, input.size() - done);
        if (n <= 0) {
            break;
        }
        done += static_cast<size_t>(n);
    }
    close(in[1]);
    ToolResult result;
    char buffer[4096];
    for (;;) {
        const ssize_t n = read(out[0], buffer, sizeof buffer);
        if (n <= 0) {
            break;
        }
        result.output.append(buffer, static_cast<size_t>(n));
    }
    close(out[0]);
    int status = 0;
    waitpid(pid, &status, 0);
    result.status = WIFEXITED(status) ? WEXITSTATUS(status) : -1;
    return result;
}

// The receiving side: its own S2S_ROOT, a share registry, and an rsync daemon configured and
// served by s2s-receiver on 127.0.0.1 at the standard port (inside the private network).
class Receiver {
  public:
    Receiver(const std::string& user, const std::string& password)
        : root_("s2s-rsyncer-server"), user_(user), password_(password) {
        real_ = RealPath(root_.path());
        MakeDirs(real_ + "/etc/s2s");
        MakeDirs(Volume());
    }
    ~Receiver() { Stop(); }
    Receiver(const Receiver&) = delete;
    Receiver& operator=(const Receiver&) = delete;

    const std::string& Root() const { return real_; }
    std::string Volume() const { return real_ + "/volume1"; }
    std::string EncryptedDir(const std::string& name) const { return Volume() + "/@" + name + "@"; }
    std::string KeyDir() const { return real_ + "/usr/vurn/etc/.encrypt"; }
    std::string ConfigFile() const { return real_ + "/usr/vurn/etc/s2s_rsyncd.conf"; }

    std::string AddShare(const std::string& name, const ShareAttrs& attrs = ShareAttrs()) {
        return RegisterShare(real_, Volume(), name, attrs);
    }

    // Writes the daemon's configuration; `oldServer` makes it answer like a server that knows
    // neither the version query nor multi-source pairing nor share attributes.
    ToolResult Configure(bool oldServer = false) {
        std::vector<std::string> argv = {Tool(),   "configure", "--user",    user_,
                                         "--port", "873",       "--address", "127.0.0.1"};
        if (oldServer) {
            argv.push_back("--old-server");
        }
        return RunTool(argv, Env(), password_ + "\n");
    }
    ToolResult Start() {
        ToolResult r = RunTool({Tool(), "start"}, Env());
        started_ = started_ || r.status == 0;
        return r;
    }
    ToolResult Stop() {
        if (!started_) {
            return ToolResult{0, ""};
        }
        started_ = false;
        return RunTool({Tool(), "stop"}, Env());
    }
    std::string Status() { return RunTool({Tool(), "status"}, Env()).output; }

  private:
    static std::string Tool() { return std::string(S2S_TOOL_DIR) + "/s2s-receiver"; }
    std::map<std::string, std::string> Env() const { return {{"S2S_ROOT", real_}}; }

    s2s_test::TempDir root_;
    std::string real_;
    std::string user_;
    std::string password_;
    bool started_ = false;
};

// A description of every entry below `root` (not following links), by relative path: type,
// permissions, owner, time, and size plus content for files, target for links; hard-linked
// files name the first path of their group. The root itself is left out.
inline std::map<std::string, std::string> Snapshot(const std::string& root) {
    std::map<std::string, struct stat> entries;
    std::vector<std::string> pending = {""};
    while (!pending.empty()) {
        const std::string rel = pending.back();
        pending.pop_back();
        DIR* dir = opendir((root + rel).c_str());
        if (dir == nullptr) {
            continue;
        }
        while (struct dirent* e = readdir(dir)) {
            const std::string name = e->d_name;
            if (name == "." || name == "..") {
                continue;
            }
            const std::string child = rel + "/" + name;
            struct stat st;
            if (lstat((root + child).c_str(), &st) != 0) {
                continue;
            }
            entries[child] = st;
            if (S_ISDIR(st.st_mode)) {
                pending.push_back(child);
            }
        }
        closedir(dir);
    }
    std::map<std::pair<dev_t, ino_t>, std::string> firstOfInode;
    for (const auto& e : entries) {
        if (S_ISREG(e.second.st_mode) && e.second.st_nlink > 1) {
            firstOfInode.emplace(std::make_pair(e.second.st_dev, e.second.st_ino), e.first);
        }
    }
    std::map<std::string, std::string> out;
    for (const auto& e : entries) {
        const struct stat& st = e.second;
        std::string d = std::to_string(st.st_mode) + " " + std::to_string(st.st_uid) + ":" +
                        std::to_string(st.st_gid);
        if (!S_ISDIR(st.st_mode)) {
            d += " t" + std::to_string(st.st_mtime);
        }
        if (S_ISREG(st.st_mode)) {
            d += " s" + std::to_string(st.st_size) + " h" +
                 std::to_string(std::hash<std::string>()(s2s_test::ReadFile(root + e.first)));
            if (st.st_nlink > 1) {
                d += " link-of " + firstOfInode[std::make_pair(st.st_dev, st.st_ino)];
            }
        } else if (S_ISLNK(st.st_mode)) {
            char target[PATH_MAX];
            const ssize_t n = readlink((root + e.first).c_str(), target, sizeof target);
            d += " -> " + std::string(target, n > 0 ? static_cast<size_t>(n) : 0);
        }
        out[e.first] = d;
    }
    return out;
}

}  // namespace rsyncer_test

#endif  // S2S_TESTS_RSYNC_RSYNCER_FIXTURE_H
