// Share, volume, client identity, host name and address queries under S2S_ROOT, over the real
// share registry, host file, interfaces and resolver. The facts below them are the platform's.
#include <sched.h>
#include <unistd.h>

#include <gtest/gtest.h>

#include <regex>
#include <string>
#include <tuple>
#include <vector>

#include "s2s_host.h"
#include "s2s_platform.h"
#include "support/test_util.h"

namespace {

using s2s_test::LogCapture;

// True when the log holds one line only (a time stamp, then the ERROR line `text`).
bool OneErrorLine(const LogCapture& log, const std::string& text) {
    return std::regex_match(log.Text(),
                            std::regex(".*\\[ERROR\\] s2s\\.cpp\\(\\d+\\): " + text + "\n"));
}

// `body` in a child inside new namespaces of `flags`: its exit code, or 100 when this machine
// allows no such namespace.
int InNamespace(int flags, const std::function<int()>& body) {
    return s2s_test::Child([&] { return unshare(flags) != 0 ? 100 : body(); }).Wait();
}

class HostQueries : public ::testing::Test {
  protected:
    HostQueries() : env_("S2S_ROOT", root_.path().c_str()) {
        s2s_test::MakeDirs(volume_ + "/docs");
    }
    static void HostConf(const std::string& text) {
        std::string path = S2SPath(S2S_PATH_HOST_CONF);
        s2s_test::MakeDirs(path.substr(0, path.rfind('/')));
        s2s_test::WriteFile(path, text);
    }
    static void AddShare(const char* name,
                         std::initializer_list<std::pair<const char*, std::string>> attrs) {
        s2s_test::Table table(attrs);
        ASSERT_EQ(VURNShareSet(name, table.get()), 0);
    }

    s2s_test::TempDir root_;
    s2s_test::ScopedEnv env_;
    const std::string volume_ = root_ / "volume1";
};

// An encrypted share is served through its encrypted directory, as module "@name@"; a Windows
// share counts as an ACL share even without the ACL bit.
TEST_F(HostQueries, ShareInfoAddressesEncryptedSharesThroughTheirEncryptedDirectory) {
    AddShare("docs", {{"path", volume_ + "/docs"}, {"acl", "yes"}});
    // clang-format off
    AddShare("secret", {{"path", volume_ + "/secret"}, {"encrypted", "yes"}, {"auto_mount", "yes"},
                        {"key_len", "32"}, {"win_share", "yes"}});
    // clang-format on
    S2S::ShareInfo plain, secret;
    ASSERT_EQ(S2S::GetShareInfo("docs", plain), 0);
    ASSERT_EQ(S2S::GetShareInfo("secret", secret), 0);
    EXPECT_EQ(plain.GetModulePath() + " " + plain.GetModuleName(), volume_ + "/docs docs");
    EXPECT_TRUE(plain.IsACL() && !plain.IsEncrypted() && !plain.IsWinShare());
    EXPECT_EQ(secret.GetPath(), volume_ + "/secret");
    EXPECT_EQ(secret.GetModulePath(), volume_ + "/@secret@");
    EXPECT_EQ(secret.GetModuleName(), "@secret@");
    EXPECT_TRUE(secret.IsEncrypted() && secret.IsAutoMount() && secret.IsWinShare() &&
                secret.IsACL());
    EXPECT_EQ(secret.GetEncryptKeyLen(), 32u);
}

TEST_F(HostQueries, ShareAndVolumeFailuresAreLoggedAtEachLevel) {
    LogCapture log;
    S2S::ShareInfo info;
    EXPECT_EQ(S2S::GetShareInfo("", info), -1);
    EXPECT_EQ(log.Text(), "");  // an empty name is refused silently
    AddShare("nopath", {{"acl", "yes"}});
    EXPECT_EQ(S2S::GetShareInfo("nopath", info), -1);
    EXPECT_TRUE(OneErrorLine(log, "Fail to get the path of share 'nopath'")) << log.Text();
    EXPECT_EQ(info.GetName(), "");  // untouched
    bool valid = true;
    EXPECT_EQ(S2S::IsValidShare("nosuch", valid), -1);
    EXPECT_TRUE(valid);  // untouched
    EXPECT_TRUE(log.Contains("Fail to get share 'nosuch'\n") &&
                log.Contains("): Fail to get share info\n") &&
                log.Contains("): Fail to get volume info\n"));
    AddShare("gone", {{"path", root_ / "not/there"}});
    S2S::VolumeInfo volume;
    EXPECT_EQ(S2S::GetVolumeInfo("gone", volume), -1);
    EXPECT_TRUE(log.Contains("): Fail to get volume info of share 'gone'\n"));
}

// Shares on internal volumes are syncable; a PortBox syncs the shares of its share bin instead,
// wherever they are.
TEST_F(HostQueries, ValidSharesAreOnInternalVolumesOrInAPortBoxsShareBin) {
    AddShare("docs", {{"path", volume_ + "/docs"}});
    AddShare("bin", {{"path", root_ / "nowhere"}, {"in_sharebin", "yes"}});
    const std::string portbox = "[host]\n\tmodel_class=\"portbox\"\n",
                      volumes = "[volumes]\n\t" + volume_;
    const std::tuple<std::string, const char*, bool> cases[] = {
        {volumes + "=\"internal\"\n", "docs", true},
        {volumes + "=\"external\"\n", "docs", false},
        {portbox + volumes + "=\"external\"\n", "bin", true},
        {portbox + volumes + "=\"internal\"\n", "docs", false},
        {portbox, "unknown", false},
    };
    for (const auto& [conf, share, expected] : cases) {
        HostConf(conf);
        bool valid = !expected;
        EXPECT_EQ(S2S::IsValidShare(share, valid), 0) << conf;
        EXPECT_EQ(valid, expected) << conf;
    }
    HostConf("[volumes]\n\t" + volume_ + "=\"internal\"\n");
    S2S::VolumeInfo volume;
    ASSERT_EQ(S2S::GetVolumeInfo("docs", volume), 0);
    EXPECT_EQ(volume.GetPath(), volume_);
    EXPECT_EQ(volume.GetName() + std::to_string(volume.GetType()), volume_.substr(1) + "1");
}

// Servers keep client IDs in 36-byte fields: at most 35 characters of the serial, except in HA
// where both machines present the pair's serial whole and there is no fallback to a MAC.
TEST_F(HostQueries, ClientIdIsTheSerialCutOutsideHaOrTheFirstInterfacesMac) {
    const std::string serial40 = "ABCDEFGHIJKLMNOPQRSTUVWXYZ0123456789wxyz";
    HostConf("[host]\n\tserial=\"" + serial40 + "\"\n");
    EXPECT_EQ(S2S::GetClientID(), serial40.substr(0, 35));
    HostConf("[host]\n\tserial=\"" + serial40 + "\"\n\tha=\"yes\"\n");
    EXPECT_EQ(S2S::GetClientID(), serial40);
    {
        LogCapture log;
        HostConf("[host]\n\tha=\"yes\"\n");
        EXPECT_EQ(S2S::GetClientID(), "");
        EXPECT_TRUE(OneErrorLine(log, "Fail to get ha sn and mac")) << log.Text();
    }
    HostConf("");
    VLIBNetIfInfo first[1];
    const bool any = VLIBNetGetInterfaceInfo(first, 1, VLIB_NETIF_WITH_MAC) == 1;
    const std::string sys = "/sys/class/net/" + std::string(any ? first[0].name : "") + "/address";
    EXPECT_EQ(S2S::GetClientID() + "\n",
              any ? s2s_test::ReadFile(sys) : "\n");  // as the kernel has it
    LogCapture log;
    int rc = InNamespace(CLONE_NEWNET, [] { return S2S::GetClientID().empty() ? 0 : 1; });
    EXPECT_TRUE(rc == 0 || rc == 100) << "no serial and no interface: an empty ID";
    EXPECT_EQ(log.Text(), "");
}

// The system's name cut to 63 characters; servers take a long name's tail, so the first `skip`
// characters go, but a name not longer than `skip` stays whole.
TEST(HostNameAndAddress, HostNameSkipsTheHeadAndUsableIpsAppend) {
    int rc = InNamespace(CLONE_NEWUTS, [] {
        const std::string forty = "0123456789012345678901234567890123456789", h64(64, 'h');
        return !(sethostname("abc", 3) == 0 &&
                 S2S::GetHostName(0) + S2S::GetHostName(3) + S2S::GetHostName(2) == "abcabcc" &&
                 sethostname(forty.c_str(), 40) == 0 && S2S::GetHostName(35) == "56789" &&
                 sethostname(h64.c_str(), 64) == 0 && S2S::GetHostName(0) == h64.substr(1));
    });
    EXPECT_TRUE(rc == 0 || rc == 100) << rc;  // 100: no UTS namespaces here
    char name[256] = {0};
    EXPECT_TRUE(gethostname(name, 255) == 0 && S2S::GetHostName(1000) == name);
    std::vector<std::string> ips{"kept"};
    ASSERT_EQ(S2S::GetUsableIP("localhost", "192.0.2.7", ips), 0);
    EXPECT_EQ(ips, (std::vector<std::string>{"kept", "192.0.2.7", "127.0.0.1"}));
    EXPECT_EQ(S2S::GetUsableIP("no-such-host.invalid", "", ips), -1);
    EXPECT_EQ(ips.size(), 3u);
}

}  // namespace
