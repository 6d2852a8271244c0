// RsyncWrapper over ssh: a real sshd on a free loopback port (password login as root, checked
// against a shadow file bind-mounted in the sshd's own mount namespace), reaching the receiver's
// modules through rsync's daemon-over-remote-shell mode with the receiver's configuration.
#include <fcntl.h>
#include <sched.h>
#include <signal.h>
#include <sys/mount.h>
#include <sys/stat.h>
#include <sys/wait.h>
#include <unistd.h>

#include <atomic>
#include <chrono>
#include <fstream>
#include <memory>
#include <random>
#include <sstream>
#include <string>

#include "gtest/gtest.h"
#include "rsync/wrapper_fixture.h"
#include "s2s_rsync_wrapper.h"

namespace {

using VURN::Backup::RsyncWrapper;
using wrapper_test::MakeDirs;
using wrapper_test::RunProgram;
using wrapper_test::Server;

const char kPassword[] = "pw-Ssh-4e1b";
const char kGuest[] = "s2sguest";
const char kRootAlias[] = "s2sroot";

// sshd on 127.0.0.1:<port> in a mount namespace of its own where /etc/shadow gives root the test
// password and /etc/passwd adds kGuest and kRootAlias; nothing outside that namespace changes.
class Sshd {
  public:
    Sshd() : dir_("s2s-sshd"), port_(s2s_test::FreeTcpPort()) {}
    ~Sshd() {
        if (pid_ > 0) {
            kill(pid_, SIGTERM);
            waitpid(pid_, nullptr, 0);
        }
    }

    // "" when it runs, else why not.
    std::string Start() {
        const std::string d = dir_.path();
        if (access("/usr/sbin/sshd", X_OK) != 0 || access("/usr/bin/sshpass", X_OK) != 0) {
            return "sshd or sshpass is not installed";
        }
        wrapper_test::Run key =
            RunProgram({"/usr/bin/ssh-keygen", "-q", "-t", "ed25519", "-N", "", "-f", d + "/key"});
        wrapper_test::Run hash = RunProgram({"/usr/bin/openssl", "passwd", "-6", "-stdin"},
                                            std::string(kPassword) + "\n");
        if (key.status != 0 || hash.status != 0) {
            return "cannot make a host key or password hash: " + key.output + hash.output;
        }
        std::string crypted = hash.output.substr(0, hash.output.find('\n'));
        std::istringstream shadow(s2s_test::ReadFile("/etc/shadow"));
        std::string out;
        for (std::string line; std::getline(shadow, line);) {
            if (line.compare(0, 5, "root:") == 0) {
                size_t second = line.find(':', 5);
                line = "root:" + crypted + line.substr(second);
            }
            out += line + "\n";
        }
        // Two more logins with the same password: an ordinary account, and one with uid 0 under
        // another name.
        std::string passwd = s2s_test::ReadFile("/etc/passwd");
        for (const char* login : {kGuest, kRootAlias}) {
            passwd += std::string(login) + (login == kGuest ? ":x:64999:64999" : ":x:0:0") +
                      "::/:/bin/sh\n";
            out += std::string(login) + ":" + crypted + ":19000:0:99999:7:::\n";
        }
        s2s_test::WriteFile(d + "/shadow", out);
        chmod((d + "/shadow").c_str(), 0600);
        s2s_test::WriteFile(d + "/passwd", passwd);
        s2s_test::WriteFile(d + "/sshd_config",
                            "Port " + std::to_string(port_) +
                                "\nListenAddress 127.0.0.1\nHostKey " + d + "/key\nPidFile " + d +
                                "/sshd.pid\nPermitRootLogin yes\nPasswordAuthentication yes\n"
                                "KbdInteractiveAuthentication no\nUsePAM no\nStrictModes no\n"
                                "AuthorizedKeysFile none\n");
        mkdir("/run/sshd", 0755);  // sshd's privilege separation directory
        pid_ = fork();
        if (pid_ == 0) {
            if (unshare(CLONE_NEWNS) != 0 ||
                mount("none", "/", nullptr, MS_REC | MS_PRIVATE, nullptr) != 0 ||
                mount((d + "/shadow").c_str(), "/etc/shadow", nullptr, MS_BIND, nullptr) != 0 ||
                mount((d + "/passwd").c_str(), "/etc/passwd", nullptr, MS_BIND, nullptr) != 0) {
                _exit(3);
            }
            int log = open((d + "/sshd.log").c_str(), O_WRONLY | O_CREAT | O_TRUNC, 0600);
            if (log >= 0) {
                dup2(log, 2);
            }
            execl("/usr/sbin/sshd", "/usr/sbin/sshd", "-D", "-e", "-f",
                  (d + "/sshd_config").c_str(), static_cast<char*>(nullptr));
            _exit(127);
        }
        bool up = s2s_test::WaitFor([&] {
            int status = 0;
            if (waitpid(pid_, &status, WNOHANG) == pid_) {
                pid_ = -1;
                return true;
            }
            return !s2s_test::ReadFile(d + "/sshd.pid").empty();
        });
        if (!up || pid_ < 0) {
            pid_ = -1;
            return "sshd did not start (no mount namespace here?)";
        }
        return std::string();
    }

    int Port() const { return port_; }
    std::string KnownHosts() const { return dir_.path() + "/known_hosts"; }

  private:
    s2s_test::TempDir dir_;
    int port_;
    pid_t pid_ = -1;
};

class WrapperSsh : public ::testing::Test {
  protected:
    void SetUp() override {
        if (geteuid() != 0) {
            GTEST_SKIP() << "needs root (sshd, mount namespace, chroot)";
        }
        std::string why = sshd_.Start();
        if (!why.empty()) {
            GTEST_SKIP() << why;
        }
        server_.reset(new Server("root", kPassword));
        server_->AddShare("photos");
        server_->AddShare("vault", true);
        ASSERT_EQ(server_->Configure().status, 0);
    }

    // Aims at the receiver through ssh: ssh's port, and the receiver's configuration.
    void Aim(RsyncWrapper& w, const std::string& dest, const std::string& module = "",
             const std::string& password = kPassword, const std::string& login = "root") {
        w.setSsh(true);
        w.setPort(sshd_.Port());
        w.setConnectTimeout(10);
        w.setVurnAuth(true, true);
        w.setSshKnownHostsFile(sshd_.KnownHosts());
        w.setRemoteConfig(server_->Root() + "/usr/vurn/etc/s2s_rsyncd.conf");
        w.setDestPath("127.0.0.1", login, password, dest, module);
    }

    Sshd sshd_;
    std::unique_ptr<Server> server_;
    s2s_test::TempDir local_{"s2s-ssh-src"};
};

TEST_F(WrapperSsh, DataKeysAndCommandsTravelOverSsh) {
    const std::string src = local_.path() + "/share";
    MakeDirs(src + "/sub");
    s2s_test::WriteFile(src + "/sub/f.txt", "over ssh\n");
    RsyncWrapper data;
    data.setSrcPath(src + "/");
    data.setDelete(true);
    Aim(data, "photos");
    ASSERT_EQ(data.execute(boost::function<bool()>()), 0) << data.lastError();
    EXPECT_EQ(s2s_test::ReadFile(server_->SharePath("photos") + "/sub/f.txt"), "over ssh\n");

    s2s_test::WriteFile(local_.path() + "/vault.key", "KEY");
    RsyncWrapper key;
    key.setSrcPath(local_.path() + "/vault.key");
    Aim(key, "/usr/vurn/etc/.encrypt", "vault");
    ASSERT_EQ(key.execute(boost::function<bool()>()), 0) << key.lastError();
    EXPECT_EQ(s2s_test::ReadFile(server_->KeyDir() + "/vault/vault.key"), "KEY");

    const std::string out = local_.path() + "/version";
    RsyncWrapper cmd;
    Aim(cmd, "");
    cmd.setVurnCustCmdRule(
        {"command=\"S2S_GetProtocolVer\"", "clientID=\"SN1\"", "outfile=\"" + out + "\""});
    EXPECT_EQ(cmd.execute(boost::function<bool()>()), 0) << cmd.lastError();
    EXPECT_EQ(s2s_test::ReadFile(out), "1\n");
    EXPECT_TRUE(s2s_test::WaitFor(
        [&] { return wrapper_test::CountEntries(server_->Spool() + "/replies") == 0; }));
}

TEST_F(WrapperSsh, WrongPasswordFailsWithoutHanging) {
    s2s_test::WriteFile(local_.path() + "/f", "x");
    RsyncWrapper w;
    w.setSrcPath(local_.path() + "/f");
    Aim(w, "photos", "", "wrong-password");
    auto started = std::chrono::steady_clock::now();
    int rc = w.execute(boost::function<bool()>());
    EXPECT_NE(rc, 0);
    EXPECT_LT(std::chrono::steady_clock::now() - started, std::chrono::seconds(30));
    EXPECT_EQ(w.lastError().find("wrong-password"), std::string::npos);
}

// The one-shot daemon runs as the SSH login and must read root's configuration. A login that
// cannot is refused before rsync runs, by what it can do (not by its name), and a daemon that
// fails to start anyway is reported the same way, not as rsync's bare usage error.
TEST_F(WrapperSsh, LoginThatCannotServeIsNamedBeforeTheTransfer) {
    s2s_test::WriteFile(local_.path() + "/vault.key", "KEY");
    RsyncWrapper guest;
    guest.setSrcPath(local_.path() + "/vault.key");
    Aim(guest, "/usr/vurn/etc/.encrypt", "vault", kPassword, kGuest);
    EXPECT_EQ(guest.execute(boost::function<bool()>()), RsyncWrapper::kResultSshLogin);
    EXPECT_NE(guest.lastError().find(std::string("SSH login '") + kGuest + "'"), std::string::npos)
        << guest.lastError();
    EXPECT_NE(guest.lastError().find("must be root"), std::string::npos);
    EXPECT_EQ(access((server_->KeyDir() + "/vault").c_str(), F_OK), -1);

    // uid 0 under another name passes the check; the rsync account (root) then decides.
    RsyncWrapper alias;
    alias.setSrcPath(local_.path() + "/vault.key");
    Aim(alias, "/usr/vurn/etc/.encrypt", "vault", kPassword, kRootAlias);
    EXPECT_EQ(alias.execute(boost::function<bool()>()), 5) << alias.lastError();
    EXPECT_NE(alias.lastError().find("auth failed"), std::string::npos) << alias.lastError();

    const std::string broken = local_.path() + "/broken.conf";
    s2s_test::WriteFile(broken, "[unterminated\n");
    RsyncWrapper daemon;
    daemon.setSrcPath(local_.path() + "/vault.key");
    Aim(daemon, "/usr/vurn/etc/.encrypt", "vault");
    daemon.setRemoteConfig(broken);
    EXPECT_EQ(daemon.execute(boost::function<bool()>()), RsyncWrapper::kResultSshLogin)
        << daemon.lastError();
    EXPECT_NE(daemon.lastError().find("syntax or usage error"), std::string::npos);
}

TEST_F(WrapperSsh, CancelLeavesNoSshBehind) {
    const std::string src = local_.path() + "/big";
    MakeDirs(src);
    // Incompressible: random MiBs, each varied, so that compression keeps the run slow.
    std::mt19937 gen(7);
    std::string block(1 << 20, '\0');
    for (char& c : block) {
        c = static_cast<char>(gen());
    }
    std::string data;
    for (int i = 0; i < 160; ++i) {
        block[static_cast<size_t>(i)] ^= 0x5a;
        data += block;
    }
    s2s_test::WriteFile(src + "/big.bin", data);
    RsyncWrapper w;
    w.setCompress(true);
    w.setSrcPath(src + "/");
    Aim(w, "photos");
    // Cancelled once data flows (the first progress report): in the middle of the transfer.
    std::atomic<bool> flowing{false};
    w.setProgressCallback([&](int) { flowing = true; });
    int rc = w.execute([&] { return flowing.load(); });
    EXPECT_EQ(rc, RsyncWrapper::kResultCancelled);
    // ssh and sshpass ran with the known-hosts path of this test on their command lines.
    int left = 0;
    s2s_test::WaitFor(
        [&] {
            left = 0;
            wrapper_test::Run ps = RunProgram({"/bin/ps", "-eo", "stat=,args="});
            std::istringstream lines(ps.output);
            for (std::string line; std::getline(lines, line);) {
                left += line[0] != 'Z' && line.find(sshd_.KnownHosts()) != std::string::npos;
            }
            return left == 0;
        },
        std::chrono::seconds(5));
    EXPECT_EQ(left, 0) << "ssh or sshpass survived the cancel";
}

}  // namespace
