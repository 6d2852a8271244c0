// What differs over SSH, against ServerPair's sshd (root's password is the receiver's rsync
// password): the wrapper's data, key and command runs through a one-shot daemon reading the
// receiver's configuration, a refused password, logins that cannot serve, a cancel that leaves
// no ssh behind; and the Rsyncer's key sync, which always travels over SSH.
#include <algorithm>
#include <atomic>
#include <chrono>
#include <filesystem>
#include <random>

#include "gtest/gtest.h"
#include "s2s_rsync_wrapper.h"
#include "s2s_rsyncer.h"
#include "support/server_pair.h"

namespace {

using VURN::Backup::RsyncWrapper;
using namespace s2s_test;
namespace fs = std::filesystem;

const char kPassword[] = "pw-Ssh-4e1b";

class OverSsh : public ::testing::Test {
  protected:
    // The ssh login and the rsync account are root, with one password.
    static PairOptions Options() {
        return {"root", kPassword, /*standardPort=*/true, /*ssh=*/true};
    }
    static void SetUpTestSuite() {
        if ((why_ = ServerPair::Unavailable(Options())).empty()) {
            pair_ = std::make_unique<ServerPair>(Options());
            for (Host* host : {&pair_->Sender(), &pair_->Receiver()}) {
                host->AddShare("photos");
                host->AddShare("secret", ShareAttrs{true});
                host->AddShare("boot", ShareAttrs{true, true});  // encrypted, mounted at boot
            }
            started_ = pair_->Start();
        }
    }
    static void TearDownTestSuite() { pair_.reset(); }
    void SetUp() override {
        if (!why_.empty()) {
            GTEST_SKIP() << why_;
        }
        ASSERT_EQ(started_, "");
    }
    static int Run(RsyncWrapper& w, const std::string& dest, const std::string& module = "",
                   const std::string& login = "root", const std::string& password = kPassword,
                   const boost::function<bool()>& cancel = {}) {
        w.setSsh(true);
        w.setPort(pair_->SshPort());
        w.setConnectTimeout(10);
        w.setVurnAuth(true, true);
        w.setDestPath("127.0.0.1", login, password, dest, module);
        return w.execute(cancel);
    }
    static std::unique_ptr<ServerPair> pair_;
    static std::string why_;
    static std::string started_;
    TempDir local_{"s2s-ssh-src"};
};
std::unique_ptr<ServerPair> OverSsh::pair_;
std::string OverSsh::why_;
std::string OverSsh::started_;

TEST_F(OverSsh, DataAndCommandsTravel) {
    fs::create_directories(local_ / "share/sub");
    WriteFile(local_ / "share/sub/f.txt", "over ssh\n");
    RsyncWrapper data;
    data.setSrcPath(local_ / "share/");
    data.setDelete(true);
    ASSERT_EQ(Run(data, "photos"), 0) << data.lastError();
    EXPECT_EQ(ReadFile(pair_->Receiver().SharePath("photos") + "/sub/f.txt"), "over ssh\n");
    RsyncWrapper cmd;
    cmd.setVurnCustCmdRule({"command=\"S2S_GetProtocolVer\"", "clientID=\"SN1\"",
                            "outfile=\"" + (local_ / "version") + "\""});
    EXPECT_EQ(Run(cmd, ""), 0) << cmd.lastError();
    EXPECT_EQ(ReadFile(local_ / "version"), "1\n");
    EXPECT_TRUE(WaitFor([&] { return fs::is_empty(pair_->Receiver().Spool() + "/replies"); }));
}

// A refused password ends the run at once and never shows; the one-shot daemon runs as the SSH
// login and must read root's configuration: a login that cannot is named before rsync runs (by
// what it can do, not by its name), and a daemon that fails to start anyway is reported the same
// way, not as rsync's bare usage error.
TEST_F(OverSsh, RefusedAndUnfitLoginsAreNamed) {
    WriteFile(local_ / "vault.key", "KEY");
    const std::string broken = local_ / "broken.conf";
    WriteFile(broken, "[unterminated\n");
    const struct {
        const char* login;
        const char* password;
        std::string config;
        int expected;
        const char* said;
    } rows[] = {
        {"root", "wrong-password", "", 5, ""},
        {ServerPair::kGuest, kPassword, "", RsyncWrapper::kResultSshLogin, "must be root"},
        {ServerPair::kRootAlias, kPassword, "", 5, "auth failed"},  // uid 0: the account decides
        {"root", kPassword, broken, RsyncWrapper::kResultSshLogin, "syntax or usage error"},
    };
    for (const auto& row : rows) {
        SCOPED_TRACE(row.login);
        RsyncWrapper w;
        w.setSrcPath(local_ / "vault.key");
        if (!row.config.empty()) {
            w.setRemoteConfig(row.config);
        }
        const auto start = std::chrono::steady_clock::now();
        EXPECT_EQ(Run(w, "/usr/vurn/etc/.encrypt", "vault", row.login, row.password), row.expected)
            << w.lastError();
        EXPECT_LT(std::chrono::steady_clock::now() - start, std::chrono::seconds(30));
        EXPECT_NE(w.lastError().find(row.said), std::string::npos) << w.lastError();
        EXPECT_EQ(w.lastError().find("wrong-password"), std::string::npos);
    }
    EXPECT_FALSE(fs::exists(pair_->Receiver().KeyDir() + "/vault"));
}

TEST_F(OverSsh, CancelLeavesNoSshBehind) {
    std::independent_bits_engine<std::mt19937, 8, unsigned> gen(7);
    std::string data(4 << 20, '\0');
    std::generate(data.begin(), data.end(), std::ref(gen));
    WriteFile(local_ / "big.bin", data);
    RsyncWrapper w;
    w.setBandwidthLimit(256);  // 16 s for the file: the cancel comes in the middle
    w.setSrcPath(local_ / "big.bin");
    std::atomic<bool> flowing{false};
    w.setProgressCallback([&](int) { flowing = true; });
    EXPECT_EQ(Run(w, "photos", "", "root", kPassword, [&] { return flowing.load(); }),
              RsyncWrapper::kResultCancelled);
    // ssh and sshpass ran with the sshd's port on their command lines.
    const std::string needle = "-p " + std::to_string(pair_->SshPort()) + " ";
    EXPECT_TRUE(WaitFor(
        [&] {
            return RunProgram({"/usr/bin/pgrep", "-f", "--", needle}).status == 1;
        },
        std::chrono::seconds(5)))
        << "ssh or sshpass survived the cancel";
}

// The key file travels over SSH on the task's SSH port whatever the task's own setting (the
// server test before it goes over the daemon port); an auto-mounted share sends its auto-mount
// key; a refused login is the transfer's code, not a local failure.
TEST_F(OverSsh, RsyncerKeySyncAlwaysUsesSsh) {
    ScopedEnv root("S2S_ROOT", pair_->Sender().Root().c_str());
    for (const char* share : {"secret", "boot"}) {
        fs::create_directories(pair_->Sender().Root() + "/keys");
        WriteFile(pair_->Sender().KeyFile(share), std::string("stored key of ") + share);
    }
    WriteFile(pair_->Sender().AutoKeyFile("boot"), "auto-mount key of boot");
    const std::string keys = pair_->Receiver().KeyDir();
    S2S::Rsyncer plain;
    ASSERT_EQ(plain.Initialize(pair_->Info(/*ssh=*/false)), 0);
    const size_t before = pair_->SshLog().size();
    EXPECT_EQ(plain.SyncEncryptKey("secret"), 0) << plain.GetLastError();
    EXPECT_EQ(ReadFile(keys + "/secret/secret.key"), "stored key of secret");
    EXPECT_NE(pair_->SshLog().find("Accepted password for root", before), std::string::npos)
        << pair_->SshLog();
    S2S::Rsyncer overSsh;
    ASSERT_EQ(overSsh.Initialize(pair_->Info(/*ssh=*/true)), 0);
    EXPECT_EQ(overSsh.SyncEncryptKey("boot"), 0) << overSsh.GetLastError();
    EXPECT_EQ(ReadFile(keys + "/boot/boot.auto.key"), "auto-mount key of boot");
    EXPECT_FALSE(fs::exists(keys + "/boot/boot.key"));
    S2S::SyncInfo wrong = pair_->Info();
    wrong.SetPassword("wrong-password");
    S2S::Rsyncer refused;
    EXPECT_EQ(refused.Initialize(wrong), 5);
    fs::remove_all(keys + "/secret");
    const int code = refused.SyncEncryptKey("secret");
    EXPECT_NE(code, 0);
    EXPECT_NE(code, S2S::kRsyncResultLocalFailure);
    EXPECT_FALSE(fs::exists(keys + "/secret/secret.key"));
}

}  // namespace
