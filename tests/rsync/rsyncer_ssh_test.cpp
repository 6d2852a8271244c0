// Encryption key sync over SSH against a real sshd on a loopback port. The key file always
// travels over SSH on the task's SSH port, whatever the task's own SSH setting; on the server a
// one-shot rsync daemon started through ssh reads the receiver's configuration and stores the
// key in the key module under the share's name.
//
// The sshd runs in a mount namespace of its own where /etc/shadow is a copy with a test password
// for root and /run is private; the client runs in one where root's home is a temporary
// directory, so that ssh records the test host key there. Nothing of the machine changes.
#include <fcntl.h>
#include <netinet/in.h>
#include <pwd.h>
#include <sched.h>
#include <signal.h>
#include <sys/mount.h>
#include <sys/socket.h>
#include <sys/stat.h>
#include <sys/wait.h>
#include <unistd.h>

#include <cstdio>
#include <memory>
#include <sstream>
#include <string>
#include <vector>

#include "gtest/gtest.h"
#include "rsync/rsyncer_fixture.h"
#include "s2s_rsyncer.h"

namespace {

using rsyncer_test::ClientHost;
using rsyncer_test::Receiver;
using rsyncer_test::RunTool;
using rsyncer_test::ShareAttrs;

// The receiver's rsync account is root, which is also the ssh login: one password for both.
const char kUser[] = "root";
const char kPassword[] = "pw-Key-Sync-41c2";

bool Executable(const std::string& path) {
    return access(path.c_str(), X_OK) == 0;
}

// A real sshd on 127.0.0.1:<free port> that accepts root with kPassword.
class TestSshd {
  public:
    TestSshd() : dir_("s2s-rsyncer-sshd") {}
    ~TestSshd() {
        if (pid_ > 0) {
            kill(pid_, SIGTERM);
            int status = 0;
            waitpid(pid_, &status, 0);
        }
    }
    TestSshd(const TestSshd&) = delete;
    TestSshd& operator=(const TestSshd&) = delete;

    // "" when it runs, else why not.
    std::string Start() {
        const std::string dir = rsyncer_test::RealPath(dir_.path());
        rsyncer_test::ToolResult r = RunTool(
            {"/usr/bin/ssh-keygen", "-q", "-t", "ed25519", "-N", "", "-f", dir + "/host_key"}, {});
        if (r.status != 0) {
            return "ssh-keygen: " + r.output;
        }
        r = RunTool({"/usr/bin/openssl", "passwd", "-6", "-stdin"}, {},
                    std::string(kPassword) + "\n");
        if (r.status != 0 || r.output.empty()) {
            return "openssl passwd: " + r.output;
        }
        const std::string hash = r.output.substr(0, r.output.find('\n'));
        std::string shadow;
        bool root = false;
        std::istringstream in(s2s_test::ReadFile("/etc/shadow"));
        for (std::string line; std::getline(in, line);) {
            if (line.rfind("root:", 0) == 0) {
                const size_t second = line.find(':', 5);
                line = "root:" + hash + line.substr(second);
                root = true;
            }
            shadow += line + "\n";
        }
        if (!root) {
            return "no root entry in /etc/shadow";
        }
        s2s_test::WriteFile(dir + "/shadow", shadow);
        chmod((dir + "/shadow").c_str(), 0600);
        port_ = s2s_test::FreeTcpPort();
        s2s_test::WriteFile(dir + "/sshd_config", "Port " + std::to_string(port_) +
                                                      "\n"
                                                      "ListenAddress 127.0.0.1\n"
                                                      "HostKey " +
                                                      dir +
                                                      "/host_key\n"
                                                      "PidFile " +
                                                      dir +
                                                      "/sshd.pid\n"
                                                      "PermitRootLogin yes\n"
                                                      "PasswordAuthentication yes\n"
                                                      "KbdInteractiveAuthentication no\n"
                                                      "PubkeyAuthentication no\n"
                                                      "UsePAM no\n"
                                                      "StrictModes no\n"
                                                      "LogLevel INFO\n");
        log_ = dir + "/sshd.log";
        const std::string config = dir + "/sshd_config";
        const std::string shadowCopy = dir + "/shadow";
        pid_ = fork();
        if (pid_ == 0) {
            const int out = open(log_.c_str(), O_WRONLY | O_CREAT | O_TRUNC, 0600);
            dup2(out, 1);
            dup2(out, 2);
            if (unshare(CLONE_NEWNS) != 0 ||
                mount(nullptr, "/", nullptr, MS_REC | MS_PRIVATE, nullptr) != 0 ||
                mount(shadowCopy.c_str(), "/etc/shadow", nullptr, MS_BIND, nullptr) != 0 ||
                mount("tmpfs", "/run", "tmpfs", 0, "mode=0755") != 0 ||
                mkdir("/run/sshd", 0755) != 0) {
                std::perror("sshd namespace");
                _exit(126);
            }
            execl("/usr/sbin/sshd", "/usr/sbin/sshd", "-D", "-e", "-f", config.c_str(),
                  static_cast<char*>(nullptr));
            _exit(127);
        }
        if (!s2s_test::WaitFor([&] {
                int status = 0;
                return rsyncer_test::PortAccepting(port_) ||
                       waitpid(pid_, &status, WNOHANG) == pid_;
            }) ||
            !rsyncer_test::PortAccepting(port_)) {
            return "sshd did not start: " + s2s_test::ReadFile(log_);
        }
        return std::string();
    }

    int Port() const { return port_; }
    std::string Log() const { return s2s_test::ReadFile(log_); }

  private:
    s2s_test::TempDir dir_;
    std::string log_;
    pid_t pid_ = -1;
    int port_ = 0;
};

class RsyncerKeySyncSsh : public ::testing::Test {
  protected:
    void SetUp() override {
        for (const char* program : {"/usr/sbin/sshd", "/usr/bin/sshpass", "/usr/bin/ssh",
                                    "/usr/bin/ssh-keygen", "/usr/bin/openssl"}) {
            if (!Executable(program)) {
                GTEST_SKIP() << program << " is not installed";
            }
        }
        if (!rsyncer_test::EnterPrivateNetwork()) {
            GTEST_SKIP() << "needs root for a private network namespace";
        }
        client_.reset(new ClientHost("SN-KEYS"));
        server_.reset(new Receiver(kUser, kPassword));
        ShareAttrs stored;
        stored.encrypted = true;
        ShareAttrs automatic = stored;
        automatic.autoMount = true;
        client_->AddShare("secret", stored);
        client_->AddShare("boot", automatic);
        server_->AddShare("secret", stored);
        server_->AddShare("boot", automatic);
        rsyncer_test::MakeDirs(client_->Root() + "/keys");
        s2s_test::WriteFile(client_->KeyFile("secret"), "stored key of secret\n");
        s2s_test::WriteFile(client_->KeyFile("boot"), "stored key of boot\n");
        s2s_test::WriteFile(client_->AutoKeyFile("boot"), "auto-mount key of boot\n");

        rsyncer_test::ToolResult r = server_->Configure();
        ASSERT_EQ(r.status, 0) << r.output;
        r = server_->Start();
        ASSERT_EQ(r.status, 0) << r.output;
        // Client and server share this machine: the server's fixed paths are below its root,
        // which the client learns from S2S_REMOTE_ROOT (its own S2S_ROOT says nothing about them).
        remoteRoot_.reset(new s2s_test::ScopedEnv("S2S_REMOTE_ROOT", server_->Root().c_str()));
        const std::string why = sshd_.Start();
        ASSERT_EQ(why, "");
    }

    // Runs the key sync of each share in a child whose view of root's home is a temporary
    // directory; "code,code,...".
    std::string SyncKeys(const std::vector<std::string>& shares, bool taskUsesSsh,
                         const std::string& password = kPassword) {
        s2s_test::TempDir home("s2s-rsyncer-home");
        const std::string homeDir = rsyncer_test::RealPath(home.path());
        S2S::SyncInfo info;
        info.SetServerIP("127.0.0.1");
        info.SetUser(kUser);
        info.SetPassword(password);
        info.SetSSH(taskUsesSsh);
        info.SetSSHPort(static_cast<unsigned>(sshd_.Port()));
        return rsyncer_test::RunInChild([&]() -> std::string {
            const struct passwd* pw = getpwuid(0);
            if (pw == nullptr || unshare(CLONE_NEWNS) != 0 ||
                mount(nullptr, "/", nullptr, MS_REC | MS_PRIVATE, nullptr) != 0 ||
                mount(homeDir.c_str(), pw->pw_dir, nullptr, MS_BIND, nullptr) != 0) {
                return "<no mount namespace>";
            }
            S2S::Rsyncer rsyncer;
            // Without SSH the server test runs over the daemon port; with it over ssh.
            const int init = rsyncer.Initialize(info);
            std::string out = std::to_string(init);
            for (const auto& share : shares) {
                out += "," + std::to_string(rsyncer.SyncEncryptKey(share));
            }
            return out;
        });
    }

    std::unique_ptr<ClientHost> client_;
    std::unique_ptr<Receiver> server_;
    std::unique_ptr<s2s_test::ScopedEnv> remoteRoot_;
    TestSshd sshd_;
};

TEST_F(RsyncerKeySyncSsh, KeyTravelsOverSshEvenWhenTheTaskDoesNot) {
    EXPECT_EQ(SyncKeys({"secret"}, /*taskUsesSsh=*/false), "0,0");
    EXPECT_EQ(s2s_test::ReadFile(server_->KeyDir() + "/secret/secret.key"),
              "stored key of secret\n");
    EXPECT_NE(sshd_.Log().find("Accepted password for root"), std::string::npos) << sshd_.Log();
}

TEST_F(RsyncerKeySyncSsh, AutoMountedShareSendsItsAutoMountKey) {
    EXPECT_EQ(SyncKeys({"boot"}, /*taskUsesSsh=*/true), "0,0");
    EXPECT_EQ(s2s_test::ReadFile(server_->KeyDir() + "/boot/boot.auto.key"),
              "auto-mount key of boot\n");
    EXPECT_EQ(access((server_->KeyDir() + "/boot/boot.key").c_str(), F_OK), -1);
}

TEST_F(RsyncerKeySyncSsh, RefusedLoginIsTheTransfersCodeNotALocalFailure) {
    const std::string out = SyncKeys({"secret"}, /*taskUsesSsh=*/false, "wrong-password");
    // The server test fails over the daemon port (5); the key transfer's own code follows.
    ASSERT_EQ(out.rfind("5,", 0), 0u) << out;
    const int code = std::stoi(out.substr(2));
    EXPECT_NE(code, 0);
    EXPECT_NE(code, S2S::kRsyncResultLocalFailure);
    EXPECT_EQ(access((server_->KeyDir() + "/secret/secret.key").c_str(), F_OK), -1);
}

}  // namespace
