// Test scaffolding for the Rsyncer tests: a sending host under its own S2S_ROOT (host facts,
// share registry, temporary directory), a capture of the library's log, and a child process for
// code that must run in a namespace of its own.
#ifndef S2S_TESTS_RSYNC_RSYNCER_FIXTURE_H
#define S2S_TESTS_RSYNC_RSYNCER_FIXTURE_H

#include <sched.h>
#include <sys/stat.h>
#include <sys/wait.h>
#include <unistd.h>

#include <climits>
#include <cstdlib>
#include <functional>
#include <map>
#include <memory>
#include <stdexcept>
#include <string>

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
struct ShareSpec {
    bool encrypted = false;
    bool autoMount = false;
    bool acl = false;
    bool winShare = false;
    unsigned keyLen = 0;
};

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
        text += "[volumes]\n\t" + Volume() + "=\"internal\"\n";
        s2s_test::WriteFile(real_ + "/etc/s2s/host.conf", text);
    }

    // Registers a share whose directory is <volume>/<name> (and, when encrypted, whose ciphertext
    // directory is <volume>/@<name>@); both are created. The path of the share's directory.
    std::string AddShare(const std::string& name, const ShareSpec& spec = ShareSpec()) {
        const std::string path = Volume() + "/" + name;
        MakeDirs(path);
        VLIBSzHash* attrs = VLIBCSzHashAlloc(8);
        VLIBCSzHashSetValue(&attrs, "path", path.c_str());
        VLIBCSzHashSetValue(&attrs, "encrypted", spec.encrypted ? "yes" : "no");
        if (spec.encrypted) {
            const std::string lower = EncryptedDir(name);
            MakeDirs(lower);
            VLIBCSzHashSetValue(&attrs, "encrypted_path", lower.c_str());
            VLIBCSzHashSetValue(&attrs, "key_file", KeyFile(name).c_str());
            VLIBCSzHashSetValue(&attrs, "auto_key_file", AutoKeyFile(name).c_str());
        }
        VLIBCSzHashSetValue(&attrs, "auto_mount", spec.autoMount ? "yes" : "no");
        VLIBCSzHashSetValue(&attrs, "acl", spec.acl ? "yes" : "no");
        VLIBCSzHashSetValue(&attrs, "win_share", spec.winShare ? "yes" : "no");
        VLIBCSzHashSetValue(&attrs, "key_len", std::to_string(spec.keyLen).c_str());
        const int rc = VURNShareSet(name.c_str(), attrs);
        VLIBCSzHashFree(attrs);
        if (rc < 0) {
            throw std::runtime_error("VURNShareSet failed for " + name);
        }
        return path;
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

}  // namespace rsyncer_test

#endif  // S2S_TESTS_RSYNC_RSYNCER_FIXTURE_H
