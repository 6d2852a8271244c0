// Share, volume, client identity, host name and address queries under S2S_ROOT, over the real
// share registry, host file, mount table, interfaces and resolver.
#include <sched.h>
#include <sys/wait.h>
#include <unistd.h>

#include <gtest/gtest.h>

#include <cstring>
#include <functional>
#include <regex>
#include <stdexcept>
#include <string>
#include <vector>

#include "platform/platform_test_util.h"
#include "s2s_host.h"
#include "s2s_platform.h"
#include "support/test_util.h"

namespace {

using s2s_test::LogCapture;
using s2s_test::ScopedEnv;
using s2s_test::Table;
using s2s_test::TempDir;
using s2s_test::WriteFile;

// True when the log holds exactly one line, the ERROR line with `text` (regex-escaped by caller).
bool OneErrorLine(const LogCapture& log, const std::string& text) {
    return std::regex_match(
        log.Text(),
        std::regex("\\w+ +\\d+ [\\d:]+ \\[ERROR\\] s2s\\.cpp\\(\\d+\\): " + text + "\n"));
}

class HostQueries : public ::testing::Test {
  protected:
    HostQueries() : env_("S2S_ROOT", root_.path().c_str()) {
        volume_ = root_ / "volume1";
        EXPECT_EQ(system(("mkdir -p '" + volume_ + "/docs' '" + volume_ + "/@secret@'").c_str()),
                  0);
    }
    void HostConf(const std::string& text) {
        std::string path = S2SPath(S2S_PATH_HOST_CONF);
        EXPECT_EQ(system(("mkdir -p '" + path.substr(0, path.rfind('/')) + "'").c_str()), 0);
        WriteFile(path, text);
    }
    void AddShare(const char* name, std::initializer_list<std::pair<const char*, std::string>> kv) {
        Table attrs(kv);
        ASSERT_EQ(VURNShareSet(name, attrs.get()), 0);
    }

    TempDir root_;
    ScopedEnv env_;
    std::string volume_;
};

TEST_F(HostQueries, PlainShareInfo) {
    AddShare("docs", {{"path", (volume_ + "/docs").c_str()}, {"acl", "yes"}, {"key_len", "0"}});
    S2S::ShareInfo info;
    ASSERT_EQ(S2S::GetShareInfo("docs", info), 0);
    EXPECT_EQ(info.GetName(), "docs");
    EXPECT_EQ(info.GetPath(), volume_ + "/docs");
    EXPECT_EQ(info.GetModulePath(), volume_ + "/docs");
    EXPECT_EQ(info.GetModuleName(), "docs");
    EXPECT_FALSE(info.IsEncrypted());
    EXPECT_FALSE(info.IsAutoMount());
    EXPECT_FALSE(info.IsWinShare());
    EXPECT_TRUE(info.IsACL());
    S2S::ShareInfo copy = info;
    EXPECT_EQ(copy.GetModulePath(), info.GetModulePath());
}

TEST_F(HostQueries, EncryptedShareIsAddressedThroughItsEncryptedDirectory) {
    AddShare("secret", {{"path", (volume_ + "/secret").c_str()},
                        {"encrypted", "yes"},
                        {"auto_mount", "yes"},
                        {"key_len", "32"},
                        {"win_share", "yes"}});
    S2S::ShareInfo info;
    ASSERT_EQ(S2S::GetShareInfo("secret", info), 0);
    EXPECT_EQ(info.GetPath(), volume_ + "/secret");
    EXPECT_EQ(info.GetModulePath(), volume_ + "/@secret@");
    EXPECT_EQ(info.GetModuleName(), "@secret@");
    EXPECT_TRUE(info.IsEncrypted());
    EXPECT_TRUE(info.IsAutoMount());
    EXPECT_EQ(info.GetEncryptKeyLen(), 32u);
    // A Windows share counts as an ACL share even without the ACL bit.
    EXPECT_TRUE(info.IsWinShare());
    EXPECT_TRUE(info.IsACL());
}

TEST_F(HostQueries, ShareInfoFailures) {
    LogCapture log;
    S2S::ShareInfo info;
    EXPECT_EQ(S2S::GetShareInfo("", info), -1);
    EXPECT_EQ(log.Text(), "");  // an empty name is refused silently

    AddShare("other", {{"path", "/v/other"}});
    EXPECT_EQ(S2S::GetShareInfo("nosuch", info), -1);
    EXPECT_TRUE(OneErrorLine(log, "Fail to get share 'nosuch'")) << log.Text();
}

TEST_F(HostQueries, ShareWithoutPathIsAFailure) {
    AddShare("nopath", {{"acl", "yes"}});
    LogCapture log;
    S2S::ShareInfo info;
    EXPECT_EQ(S2S::GetShareInfo("nopath", info), -1);
    EXPECT_TRUE(OneErrorLine(log, "Fail to get the path of share 'nopath'")) << log.Text();
    EXPECT_EQ(info.GetName(), "");  // untouched
}

TEST_F(HostQueries, VolumeInfoAndShareValidity) {
    AddShare("docs", {{"path", (volume_ + "/docs").c_str()}});
    HostConf("[volumes]\n\t" + volume_ + "=\"internal\"\n");
    S2S::VolumeInfo vol;
    ASSERT_EQ(S2S::GetVolumeInfo("docs", vol), 0);
    EXPECT_EQ(vol.GetPath(), volume_);
    EXPECT_EQ(vol.GetName(), volume_.substr(1));
    EXPECT_EQ(vol.GetType(), 1);
    EXPECT_TRUE(vol.IsInternal());
    bool valid = false;
    EXPECT_EQ(S2S::IsValidShare("docs", valid), 0);
    EXPECT_TRUE(valid);

    HostConf("[volumes]\n\t" + volume_ + "=\"external\"\n");
    valid = true;
    EXPECT_EQ(S2S::IsValidShare("docs", valid), 0);
    EXPECT_FALSE(valid);
}

TEST_F(HostQueries, VolumeFailuresAreLoggedAtEachLevel) {
    LogCapture log;
    S2S::VolumeInfo vol;
    EXPECT_THROW(vol.GetName(), std::out_of_range);
    bool valid = true;
    AddShare("x", {{"path", "/v/x"}});
    EXPECT_EQ(S2S::IsValidShare("nosuch", valid), -1);
    EXPECT_TRUE(valid);  // untouched
    EXPECT_TRUE(log.Contains("Fail to get share 'nosuch'\n"));
    EXPECT_TRUE(log.Contains("): Fail to get share info\n"));
    EXPECT_TRUE(log.Contains("): Fail to get volume info\n"));

    AddShare("gone", {{"path", (root_ / "not/there").c_str()}});
    EXPECT_EQ(S2S::GetVolumeInfo("gone", vol), -1);
    EXPECT_TRUE(log.Contains("): Fail to get volume info of share 'gone'\n"));
}

TEST_F(HostQueries, PortBoxValidatesByShareBinAndIgnoresVolumes) {
    HostConf("[host]\n\tmodel_class=\"portbox\"\n[volumes]\n\t" + volume_ + "=\"external\"\n");
    AddShare("bin", {{"path", (root_ / "nowhere").c_str()}, {"in_sharebin", "yes"}});
    AddShare("notbin", {{"path", (volume_ + "/docs").c_str()}});
    bool valid = false;
    EXPECT_EQ(S2S::IsValidShare("bin", valid), 0);
    EXPECT_TRUE(valid);
    EXPECT_EQ(S2S::IsValidShare("notbin", valid), 0);
    EXPECT_FALSE(valid);
    valid = true;
    EXPECT_EQ(S2S::IsValidShare("unknown", valid), 0);  // a failed query is "not in the bin"
    EXPECT_FALSE(valid);
}

TEST_F(HostQueries, ClientIdIsTheSerialCutTo35CharactersOutsideHa) {
    const std::string serial40 = "ABCDEFGHIJKLMNOPQRSTUVWXYZ0123456789wxyz";
    HostConf("[host]\n\tserial=\"" + serial40 + "\"\n");
    EXPECT_EQ(S2S::GetClientID(), serial40.substr(0, 35));
    HostConf("[host]\n\tserial=\"" + serial40 + "\"\n\tha=\"yes\"\n");
    EXPECT_EQ(S2S::GetClientID(), serial40);
    HostConf("[host]\n\tserial=\"SN42\"\n");
    EXPECT_EQ(S2S::GetClientID(), "SN42");
}

TEST_F(HostQueries, ClientIdFallsBackToTheFirstInterfacesMacOutsideHa) {
    VLIBNetIfInfo first[1];
    int count = VLIBNetGetInterfaceInfo(first, 1, VLIB_NETIF_WITH_MAC);
    std::string id = S2S::GetClientID();
    if (count < 1) {
        EXPECT_EQ(id, "");
        return;
    }
    char mac[18];
    snprintf(mac, sizeof(mac), "%02x:%02x:%02x:%02x:%02x:%02x", first[0].mac[0], first[0].mac[1],
             first[0].mac[2], first[0].mac[3], first[0].mac[4], first[0].mac[5]);
    EXPECT_EQ(id, mac);
    EXPECT_TRUE(std::regex_match(id, std::regex("([0-9a-f]{2}:){5}[0-9a-f]{2}")));
}

TEST_F(HostQueries, HaWithoutSerialHasNoMacFallback) {
    HostConf("[host]\n\tha=\"yes\"\n");
    LogCapture log;
    EXPECT_EQ(S2S::GetClientID(), "");
    EXPECT_TRUE(OneErrorLine(log, "Fail to get ha sn and mac")) << log.Text();
}

// Runs `body` in a child inside new namespaces; its exit code, or -2 when not permitted here.
int InNamespace(int flags, const std::function<int()>& body) {
    int ready[2];
    if (pipe(ready) != 0) {
        return -1;
    }
    pid_t pid = fork();
    if (pid == 0) {
        close(ready[0]);
        char ok = unshare(flags) == 0 ? 1 : 0;
        if (write(ready[1], &ok, 1) != 1 || !ok) {
            _exit(100);
        }
        _exit(body());
    }
    close(ready[1]);
    char ok = 0;
    bool got = read(ready[0], &ok, 1) == 1;
    close(ready[0]);
    int status = 0;
    waitpid(pid, &status, 0);
    if (!got || !ok) {
        return -2;
    }
    return WIFEXITED(status) ? WEXITSTATUS(status) : -1;
}

TEST_F(HostQueries, NoSerialAndNoInterfacesGiveAnEmptyIdSilently) {
    LogCapture log;
    int rc = InNamespace(CLONE_NEWNET, [] { return S2S::GetClientID().empty() ? 0 : 1; });
    if (rc == -2) {
        GTEST_SKIP() << "no network namespaces here";
    }
    EXPECT_EQ(rc, 0);
    EXPECT_EQ(log.Text(), "");
}

TEST(HostName, SkipDropsTheHeadOfLongNamesOnly) {
    int rc = InNamespace(CLONE_NEWUTS, [] {
        int failures = 0;
        if (sethostname("abc", 3) != 0) {
            return 90;
        }
        failures += S2S::GetHostName(35) == "abc" ? 0 : 1;
        failures += S2S::GetHostName(0) == "abc" ? 0 : 1;
        failures += S2S::GetHostName(3) == "abc" ? 0 : 1;  // not shorter than skip: kept whole
        failures += S2S::GetHostName(2) == "c" ? 0 : 1;
        std::string forty = "0123456789012345678901234567890123456789";
        if (sethostname(forty.c_str(), forty.size()) != 0) {
            return 91;
        }
        failures += S2S::GetHostName(35) == "56789" ? 0 : 1;
        return failures;
    });
    if (rc == -2) {
        GTEST_SKIP() << "no UTS namespaces here";
    }
    EXPECT_EQ(rc, 0);
    char expected[256] = {0};
    ASSERT_EQ(gethostname(expected, sizeof(expected) - 1), 0);
    EXPECT_EQ(S2S::GetHostName(1000), expected);
}

TEST(UsableIP, AppendsGivenAddressThenResolvedOnes) {
    std::vector<std::string> ips{"kept"};
    ASSERT_EQ(S2S::GetUsableIP("localhost", "192.0.2.7", ips), 0);
    EXPECT_EQ(ips, (std::vector<std::string>{"kept", "192.0.2.7", "127.0.0.1"}));
    LogCapture log;
    std::vector<std::string> none;
    EXPECT_EQ(S2S::GetUsableIP("no-such-host.invalid", "", none), -1);
    EXPECT_TRUE(none.empty());
}

}  // namespace
