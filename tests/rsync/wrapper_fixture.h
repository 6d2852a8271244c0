// A receiving server for wrapper and receiver tests: a temporary S2S_ROOT with a share registry,
// and an rsync daemon configured, started and stopped by the real s2s-receiver program on a free
// loopback port. The test process's own S2S_ROOT points at the server's root for the object's
// lifetime, so the pairing store and the registry can be inspected directly.
#ifndef S2S_TESTS_RSYNC_WRAPPER_FIXTURE_H
#define S2S_TESTS_RSYNC_WRAPPER_FIXTURE_H

#include <dirent.h>
#include <fcntl.h>
#include <sys/stat.h>
#include <sys/wait.h>
#include <unistd.h>

#include <climits>
#include <cstdlib>
#include <stdexcept>
#include <string>
#include <vector>

#include "s2s_platform.h"
#include "s2s_rsync_wrapper.h"
#include "support/test_util.h"

namespace wrapper_test {

inline void MakeDirs(const std::string& path, mode_t mode = 0755) {
    for (size_t pos = 1; pos <= path.size(); ++pos) {
        if (pos == path.size() || path[pos] == '/') {
            mkdir(path.substr(0, pos).c_str(), mode);
        }
    }
}

struct Run {
    int status = -1;     // exit code; -1 when it did not exit normally
    std::string output;  // standard output and error
};

// Runs a program without a shell, `input` on its standard input.
inline Run RunProgram(const std::vector<std::string>& argv, const std::string& input = "") {
    int in[2];
    int out[2];
    if (pipe2(in, O_CLOEXEC) != 0 || pipe2(out, O_CLOEXEC) != 0) {
        throw std::runtime_error("pipe failed");
    }
    pid_t pid = fork();
    if (pid == 0) {
        dup2(in[0], 0);
        dup2(out[1], 1);
        dup2(out[1], 2);
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
    if (!input.empty() && write(in[1], input.data(), input.size()) < 0) {
        input.size();  // the program may have left already; its status tells
    }
    close(in[1]);
    Run r;
    char buffer[4096];
    for (ssize_t n; (n = read(out[0], buffer, sizeof buffer)) > 0;) {
        r.output.append(buffer, static_cast<size_t>(n));
    }
    close(out[0]);
    int status = 0;
    waitpid(pid, &status, 0);
    r.status = WIFEXITED(status) ? WEXITSTATUS(status) : -1;
    return r;
}

inline size_t CountEntries(const std::string& dir) {
    size_t n = 0;
    if (DIR* d = opendir(dir.c_str())) {
        while (struct dirent* e = readdir(d)) {
            std::string name = e->d_name;
            n += name != "." && name != "..";
        }
        closedir(d);
    }
    return n;
}

class Server {
  public:
    explicit Server(const std::string& user = "s2suser", const std::string& password = "pw-9Xq2r")
        : dir_("s2s-receiver"),
          root_(Real(dir_.path())),
          env_("S2S_ROOT", root_.c_str()),
          user_(user),
          password_(password),
          port_(s2s_test::FreeTcpPort()) {
        MakeDirs(root_ + "/etc/s2s");
        MakeDirs(root_ + "/usr/vurn/etc");
        MakeDirs(Volume());
    }
    ~Server() { Stop(); }
    Server(const Server&) = delete;
    Server& operator=(const Server&) = delete;

    const std::string& Root() const { return root_; }
    std::string Volume() const { return root_ + "/volume1"; }
    std::string SharePath(const std::string& name) const { return Volume() + "/" + name; }
    std::string EncryptedPath(const std::string& name) const {
        return Volume() + "/@" + name + "@";
    }
    std::string KeyDir() const { return root_ + "/usr/vurn/etc/.encrypt"; }
    std::string Spool() const { return root_ + "/var/spool/s2s"; }
    int Port() const { return port_; }
    const std::string& User() const { return user_; }
    const std::string& Password() const { return password_; }

    // Registers a share (with its directory) in the server's share registry.
    void AddShare(const std::string& name, bool encrypted = false) {
        MakeDirs(SharePath(name));
        VLIBSzHash* attrs = VLIBCSzHashAlloc(4);
        VLIBCSzHashSetValue(&attrs, "path", SharePath(name).c_str());
        VLIBCSzHashSetValue(&attrs, "encrypted", encrypted ? "yes" : "no");
        int rc = VURNShareSet(name.c_str(), attrs);
        VLIBCSzHashFree(attrs);
        if (rc < 0) {
            throw std::runtime_error("cannot register share " + name);
        }
    }

    Run Tool(const std::vector<std::string>& args, const std::string& input = "") const {
        std::vector<std::string> argv = {std::string(S2S_TOOL_DIR) + "/s2s-receiver"};
        argv.insert(argv.end(), args.begin(), args.end());
        return RunProgram(argv, input);
    }
    Run Configure(bool oldServer = false) const {
        std::vector<std::string> args = {"configure",           "--user",    user_,      "--port",
                                         std::to_string(port_), "--address", "127.0.0.1"};
        if (oldServer) {
            args.push_back("--old-server");
        }
        return Tool(args, password_ + "\n");
    }
    // Configures and starts; an empty string on success, else what the tool said.
    std::string Start(bool oldServer = false) {
        Run r = Configure(oldServer);
        if (r.status != 0) {
            return "configure: " + r.output;
        }
        r = Tool({"start"});
        if (r.status != 0) {
            return "start: " + r.output;
        }
        started_ = true;
        return std::string();
    }
    void Stop() {
        if (started_) {
            Tool({"stop"});
            started_ = false;
        }
    }

    // A wrapper aimed at this server: port, account, and a short connect time-out.
    void Aim(VURN::Backup::RsyncWrapper& w, const std::string& dest,
             const std::string& module = "") const {
        w.setPort(port_);
        w.setConnectTimeout(10);
        w.setVurnAuth(true, true);
        w.setDestPath("127.0.0.1", user_, password_, dest, module);
    }

  private:
    static std::string Real(const std::string& path) {
        char buf[PATH_MAX];
        if (realpath(path.c_str(), buf) == nullptr) {
            throw std::runtime_error("realpath " + path);
        }
        return buf;
    }

    s2s_test::TempDir dir_;
    std::string root_;
    s2s_test::ScopedEnv env_;
    std::string user_;
    std::string password_;
    int port_;
    bool started_ = false;
};

}  // namespace wrapper_test

#endif  // S2S_TESTS_RSYNC_WRAPPER_FIXTURE_H
