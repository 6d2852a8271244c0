// ServerPair, its hosts, the sshd and the private network they may need.
#include "support/server_pair.h"

#include <pwd.h>
#include <sched.h>
#include <signal.h>
#include <sys/mount.h>
#include <sys/stat.h>
#include <sys/wait.h>
#include <unistd.h>

#include <filesystem>
#include <stdexcept>

#include "s2s_platform.h"

namespace s2s_test {
namespace {

// Makes this process's view of root's home a fresh directory, so that ssh records the test host
// key there and not in the machine's own known-hosts file. Once per process.
bool PrivateHome() {
    static TempDir home("s2s-home");
    static const bool done = [] {
        const struct passwd* pw = getpwuid(0);
        return pw != nullptr && unshare(CLONE_NEWNS) == 0 &&
               mount(nullptr, "/", nullptr, MS_REC | MS_PRIVATE, nullptr) == 0 &&
               mount(home.path().c_str(), pw->pw_dir, nullptr, MS_BIND, nullptr) == 0;
    }();
    return done;
}

}  // namespace

bool EnterPrivateNetwork() {
    static const bool done = geteuid() == 0 && unshare(CLONE_NEWNET) == 0 &&
                             RunProgram({"/usr/sbin/ip", "link", "set", "lo", "up"}).status == 0;
    return done;
}

Host::Host(const std::string& tag, const std::string& serial)
    : dir_("s2s-" + tag), root_(std::filesystem::canonical(dir_.path()).string()) {
    std::filesystem::create_directories(root_ + "/etc/s2s");
    std::filesystem::create_directories(Volume());
    std::filesystem::create_directories(root_ + "/tmp/S2S");
    chmod((root_ + "/tmp/S2S").c_str(), 0700);
    WriteHostConf(serial);
}

void Host::WriteHostConf(const std::string& serial) const {
    WriteFile(root_ + "/etc/s2s/host.conf",
              "[host]\n" + (serial.empty() ? "" : "\tserial=\"" + serial + "\"\n") +
                  "[volumes]\n\t" + Volume() + "=\"internal,directory\"\n");
}

std::string Host::AddShare(const std::string& name, const ShareAttrs& attrs) const {
    ScopedEnv env("S2S_ROOT", root_.c_str());
    std::filesystem::create_directories(SharePath(name));
    VLIBSzHash* table = VLIBCSzHashAlloc(8);
    VLIBCSzHashSetValue(&table, "path", SharePath(name).c_str());
    VLIBCSzHashSetValue(&table, "encrypted", attrs.encrypted ? "yes" : "no");
    if (attrs.encrypted) {
        std::filesystem::create_directories(EncryptedPath(name));
        VLIBCSzHashSetValue(&table, "encrypted_path", EncryptedPath(name).c_str());
        VLIBCSzHashSetValue(&table, "key_file", KeyFile(name).c_str());
        VLIBCSzHashSetValue(&table, "auto_key_file", AutoKeyFile(name).c_str());
    }
    VLIBCSzHashSetValue(&table, "auto_mount", attrs.autoMount ? "yes" : "no");
    VLIBCSzHashSetValue(&table, "acl", attrs.acl ? "yes" : "no");
    VLIBCSzHashSetValue(&table, "win_share", attrs.winShare ? "yes" : "no");
    VLIBCSzHashSetValue(&table, "key_len", std::to_string(attrs.keyLen).c_str());
    const int rc = VURNShareSet(name.c_str(), table);
    VLIBCSzHashFree(table);
    if (rc < 0) {
        throw std::runtime_error("cannot register share " + name);
    }
    return SharePath(name);
}

ProgramResult Host::Run(const std::string& tool, const std::vector<std::string>& args,
                        const std::string& input, const EnvMap& extra) const {
    std::vector<std::string> argv = {ToolPath(tool)};
    argv.insert(argv.end(), args.begin(), args.end());
    EnvMap env = Env();
    env.insert(extra.begin(), extra.end());
    return RunProgram(argv, env, input);
}

// A real sshd on a free loopback port, in a mount namespace of its own where /etc/shadow and
// /etc/passwd are copies with the test logins, and /run (its privilege separation folder) is empty.
std::string ServerPair::StartSshd() {
    sshDir_.reset(new TempDir("s2s-sshd"));
    sshPort_ = FreeTcpPort();
    const std::string d = sshDir_->path();
    WriteFile(d + "/sshd_config",
              "Port " + std::to_string(sshPort_) + "\nListenAddress 127.0.0.1\nHostKey " + d +
                  "/key\nPidFile none\nPermitRootLogin yes\nPasswordAuthentication yes\n"
                  "KbdInteractiveAuthentication no\nPubkeyAuthentication no\nUsePAM no\n"
                  "StrictModes no\nLogLevel INFO\n");
    // The password arrives on standard input; $0 is the sshd's folder.
    const std::string script =
        "set -e; cd \"$0\"; h=$(openssl passwd -6 -stdin); ssh-keygen -q -t ed25519 -N '' -f key\n"
        "sed \"s|^root:[^:]*:|root:$h:|\" /etc/shadow > shadow; cp /etc/passwd passwd\n"
        "for u in " +
        std::string(kGuest) + ":64999 " + kRootAlias +
        ":0; do echo \"${u%:*}:$h:19000:0:99999:7:::\" >> shadow\n"
        "  echo \"${u%:*}:x:${u#*:}:${u#*:}::/:/bin/sh\" >> passwd; done\n"
        "mount --bind shadow /etc/shadow; mount --bind passwd /etc/passwd\n"
        "mount -t tmpfs tmpfs /run; mkdir /run/sshd\n"
        "exec /usr/sbin/sshd -D -e -f sshd_config 2>sshd.log\n";
    sshd_.reset(new Program(
        {"/usr/bin/unshare", "--mount", "--propagation", "private", "/bin/sh", "-c", script, d}, {},
        options_.password + "\n"));
    const auto listening = [&] { return SshLog().find("Server listening") != std::string::npos; };
    WaitFor([&] { return listening() || sshd_->Ended(); });
    return listening() ? std::string() : "sshd did not start: " + sshd_->Wait().All() + SshLog();
}

ServerPair::ServerPair(const PairOptions& options)
    : options_(options),
      sender_("sender", "SN-SENDER-0001"),
      receiver_("receiver", "SN-RECEIVER-0001"),
      remoteRoot_("S2S_REMOTE_ROOT", receiver_.Root().c_str()),
      port_(options.standardPort ? 873 : FreeTcpPort()) {}

ServerPair::~ServerPair() {
    Stop();
}

std::string ServerPair::Unavailable(const PairOptions& options) {
    if ((options.standardPort || options.ssh) && geteuid() != 0) {
        return "needs root (a private network, or an sshd in a mount namespace)";
    }
    if (options.standardPort && !EnterPrivateNetwork()) {
        return "no private network namespace here";
    }
    for (const char* program : {"/usr/sbin/sshd", "/usr/bin/sshpass", "/usr/bin/ssh"}) {
        if (options.ssh && access(program, X_OK) != 0) {
            return std::string(program) + " is not installed";
        }
    }
    if (options.ssh && !PrivateHome()) {
        return "no mount namespace here";
    }
    return std::string();
}

std::string ServerPair::Start(bool oldServer) {
    Stop();
    if (const std::string why = Unavailable(options_); !why.empty()) {
        return why;
    }
    std::vector<std::string> args = {"configure",           "--user",    options_.user, "--port",
                                     std::to_string(port_), "--address", "127.0.0.1"};
    if (oldServer) {
        args.push_back("--old-server");
    }
    ProgramResult r = receiver_.Run("s2s-receiver", args, options_.password + "\n");
    if (r.status == 0) {
        r = receiver_.Run("s2s-receiver", {"start"});
    }
    if (r.status != 0) {
        return "s2s-receiver: " + r.All();
    }
    started_ = true;
    return options_.ssh && !sshd_ ? StartSshd() : std::string();
}

void ServerPair::Stop() {
    if (started_) {
        receiver_.Run("s2s-receiver", {"stop"});
        started_ = false;
    }
}

std::string ServerPair::SshLog() const {
    return sshDir_ ? ReadFile(sshDir_->path() + "/sshd.log") : std::string();
}

S2S::SyncInfo ServerPair::Info(bool ssh) const {
    S2S::SyncInfo info;
    info.SetServerIP("127.0.0.1");
    info.SetUser(options_.user);
    info.SetPassword(options_.password);
    info.SetSSH(ssh);
    info.SetSSHPort(static_cast<unsigned>(sshPort_));
    return info;
}

}  // namespace s2s_test
