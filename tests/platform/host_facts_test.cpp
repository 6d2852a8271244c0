// Host facts on the real machine and under S2S_ROOT: serial number, HA state, model class, host
// name, network interfaces, volumes, and usable addresses through the real resolver.
#include <sched.h>
#include <sys/stat.h>
#include <sys/wait.h>
#include <unistd.h>

#include <gtest/gtest.h>

#include <cstring>
#include <functional>
#include <string>

#include "platform/platform_test_util.h"
#include "s2s_platform.h"
#include "support/test_util.h"

namespace {

using s2s_test::LogCapture;
using s2s_test::ReadFile;
using s2s_test::ScopedEnv;
using s2s_test::TempDir;
using s2s_test::WriteFile;

class HostFacts : public ::testing::Test {
  protected:
    HostFacts() : env_("S2S_ROOT", root_.path().c_str()) {}
    void WriteHostConf(const std::string& text) {
        std::string path = S2SPath(S2S_PATH_HOST_CONF);
        EXPECT_EQ(system(("mkdir -p '" + path.substr(0, path.rfind('/')) + "'").c_str()), 0);
        WriteFile(path, text);
    }
    void WriteDmiSerial(const std::string& text) {
        std::string path = S2SPath(S2S_PATH_DMI_SERIAL);
        EXPECT_EQ(system(("mkdir -p '" + path.substr(0, path.rfind('/')) + "'").c_str()), 0);
        WriteFile(path, text);
    }
    std::string Serial(int size = 1024) {
        std::string buf(static_cast<size_t>(size), 'x');
        EXPECT_EQ(VLIBGetSerialNumber(&buf[0], size), 0);
        return buf.c_str();
    }

    TempDir root_;
    ScopedEnv env_;
};

TEST_F(HostFacts, NoHostFileMeansNoFactsAndNoError) {
    LogCapture log;
    EXPECT_EQ(Serial(), "");
    EXPECT_EQ(VURNHAIsRunning(), 0);
    EXPECT_EQ(VLIBCIsPortBox(), 0);
    char model[16] = "junk";
    EXPECT_EQ(VLIBGetModelClass(model, sizeof(model)), 0);
    EXPECT_STREQ(model, "");
    EXPECT_EQ(log.Text(), "");
}

TEST_F(HostFacts, SerialFromTheHostFileThenDmiAndCutToTheBuffer) {
    WriteDmiSerial("DMI-0042\n");
    EXPECT_EQ(Serial(), "DMI-0042");
    WriteDmiSerial("To Be Filled By O.E.M.\n");
    EXPECT_EQ(Serial(), "");
    WriteDmiSerial("0000000\n");
    EXPECT_EQ(Serial(), "");
    WriteHostConf("[host]\n\tserial=\"SN-1234567890\"\n");
    EXPECT_EQ(Serial(), "SN-1234567890");
    EXPECT_EQ(Serial(6), "SN-12");
    EXPECT_LT(VLIBGetSerialNumber(nullptr, 5), 0);
    // Virtual machines report serials with blanks; servers take letters, digits and "-_.:" only.
    WriteHostConf("");
    WriteDmiSerial("VMware-56 4d 8a 3b\n");
    EXPECT_EQ(Serial(), "VMware-56-4d-8a-3b");
    WriteHostConf("[host]\n\tserial=\"A/b \xc3\xa9_x.y:z\"\n");
    EXPECT_EQ(Serial(), "A-b---_x.y:z");
}

TEST_F(HostFacts, HaStateAndModelClass) {
    LogCapture log;
    WriteHostConf("[host]\n\tha=\"yes\"\n\tmodel_class=\"portbox\"\n");
    EXPECT_EQ(VURNHAIsRunning(), 1);
    EXPECT_EQ(VLIBCIsPortBox(), 1);
    WriteHostConf("[host]\n\tha=\"no\"\n\tmodel_class=\"rackstation\"\n");
    EXPECT_EQ(VURNHAIsRunning(), 0);
    EXPECT_EQ(VLIBCIsPortBox(), 0);
    WriteHostConf("[host]\n\tha=\"perhaps\"\n");
    EXPECT_EQ(VURNHAIsRunning(), 0);
    EXPECT_TRUE(log.Contains("Invalid ha value 'perhaps'"));
}

TEST_F(HostFacts, MalformedHostFileFailsClearly) {
    LogCapture log;
    WriteHostConf("[host]\nserial is SN1\n");
    char buf[64] = "x";
    EXPECT_LT(VLIBGetSerialNumber(buf, sizeof(buf)), 0);
    EXPECT_EQ(VLIBCErrGet(), VLIB_ERR_BAD_FORMAT);
    EXPECT_STREQ(buf, "");
    EXPECT_EQ(VURNHAIsRunning(), 0);
    EXPECT_TRUE(log.Contains("Malformed line 2 in section file"));
}

// Runs `body` in a child process inside new namespaces of `flags`; the child's exit code is the
// result. Skips when this machine does not allow namespaces.
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

TEST(HostName, IsTheSystemHostNameCutTo63Characters) {
    char buf[VURN_HOSTNAME_MAX];
    ASSERT_EQ(VURNLnxGetHostname(buf), 0);
    char expected[256] = {0};
    ASSERT_EQ(gethostname(expected, sizeof(expected) - 1), 0);
    EXPECT_STREQ(buf, expected);

    int rc = InNamespace(CLONE_NEWUTS, [] {
        std::string longest(64, 'h');
        if (sethostname(longest.c_str(), longest.size()) != 0) {
            return 2;
        }
        char out[VURN_HOSTNAME_MAX];
        memset(out, 'z', sizeof(out));
        return VURNLnxGetHostname(out) == 0 && std::string(out) == std::string(63, 'h') ? 0 : 1;
    });
    if (rc == -2) {
        GTEST_SKIP() << "no UTS namespaces here";
    }
    EXPECT_EQ(rc, 0);
}

TEST(NetInterfaces, MatchTheKernelsListAndSkipLoopback) {
    VLIBNetIfInfo list[32];
    int count = VLIBNetGetInterfaceInfo(list, 32, 0);
    ASSERT_GE(count, 0);
    bool physical_seen_after_virtual = false;
    bool virtual_seen = false;
    for (int i = 0; i < count; ++i) {
        std::string name = list[i].name;
        EXPECT_NE(name, "lo");
        std::string sys = "/sys/class/net/" + name;
        std::string address = s2s_test::ReadFile(sys + "/address");
        char mac[18];
        snprintf(mac, sizeof(mac), "%02x:%02x:%02x:%02x:%02x:%02x", list[i].mac[0], list[i].mac[1],
                 list[i].mac[2], list[i].mac[3], list[i].mac[4], list[i].mac[5]);
        if (address.size() == 18) {  // a 6-byte hardware address
            EXPECT_EQ(std::string(mac) + "\n", address) << name;
        }
        struct stat st;
        bool physical = stat((sys + "/device").c_str(), &st) == 0;
        physical_seen_after_virtual |= physical && virtual_seen;
        virtual_seen |= !physical;
    }
    EXPECT_FALSE(physical_seen_after_virtual);

    VLIBNetIfInfo one[1];
    int limited = VLIBNetGetInterfaceInfo(one, 1, VLIB_NETIF_WITH_MAC);
    EXPECT_LE(limited, 1);
    if (limited == 1) {
        static const unsigned char zero[6] = {0};
        EXPECT_NE(memcmp(one[0].mac, zero, 6), 0);
    }
    EXPECT_LT(VLIBNetGetInterfaceInfo(nullptr, 1, 0), 0);
    EXPECT_LT(VLIBNetGetInterfaceInfo(one, 0, 0), 0);
}

TEST(NetInterfaces, ANamespaceWithOnlyLoopbackHasNone) {
    int rc = InNamespace(CLONE_NEWNET, [] {
        VLIBNetIfInfo list[4];
        return VLIBNetGetInterfaceInfo(list, 4, 0) == 0 ? 0 : 1;
    });
    if (rc == -2) {
        GTEST_SKIP() << "no network namespaces here";
    }
    EXPECT_EQ(rc, 0);
}

TEST_F(HostFacts, VolumeOfAPathIsItsMountPoint) {
    std::string share = root_ / "volume1/share";
    ASSERT_EQ(system(("mkdir -p '" + share + "'").c_str()), 0);
    VURNVolumeRecord rec;
    ASSERT_EQ(VolumePathParseEx(share.c_str(), &rec), 0);
    // The mount point holds the path, and is on the same device.
    std::string mount = rec.path;
    EXPECT_TRUE(mount == "/" || share.rfind(mount + "/", 0) == 0) << mount;
    struct stat a;
    struct stat b;
    ASSERT_EQ(stat(mount.c_str(), &a), 0);
    ASSERT_EQ(stat(share.c_str(), &b), 0);
    EXPECT_EQ(a.st_dev, b.st_dev);
    VURNVolumeRecord proc;
    ASSERT_EQ(VolumePathParseEx("/proc/self", &proc), 0);
    EXPECT_STREQ(proc.path, "/proc");
}

TEST_F(HostFacts, HostFileNamesVolumesAndTheirType) {
    LogCapture log;
    std::string volume = root_ / "volume1";
    std::string share = volume + "/share";
    ASSERT_EQ(system(("mkdir -p '" + share + "'").c_str()), 0);
    WriteHostConf("[volumes]\n\t" + volume + "/=\"external\"\n");
    VURNVolumeRecord rec;
    ASSERT_EQ(VolumePathParseEx(share.c_str(), &rec), 0);
    EXPECT_EQ(std::string(rec.path), volume);
    EXPECT_EQ(rec.type, VURN_VOLUME_TYPE_EXTERNAL);

    WriteHostConf("[volumes]\n\t" + volume + "=\"internal\"\n");
    ASSERT_EQ(VolumePathParseEx(share.c_str(), &rec), 0);
    EXPECT_EQ(rec.type, VURN_VOLUME_TYPE_INTERNAL);
    // A listed volume is a mount path: a plain directory there is a volume that is not mounted.
    EXPECT_EQ(VURNVolumeIsMounted(volume.c_str()), 0);
    EXPECT_EQ(VURNVolumeIsMounted("/proc"), 1);
    // Listed through a symbolic link, it is the same volume, still not mounted.
    const std::string link = root_ / "vlink";
    ASSERT_EQ(symlink(volume.c_str(), link.c_str()), 0);
    WriteHostConf("[volumes]\n\t" + link + "=\"external\"\n");
    ASSERT_EQ(VolumePathParseEx((link + "/share").c_str(), &rec), 0);
    EXPECT_EQ(std::string(rec.path), volume);
    EXPECT_EQ(rec.type, VURN_VOLUME_TYPE_EXTERNAL);
    EXPECT_EQ(VURNVolumeIsMounted(rec.path), 0);

    WriteHostConf("[volumes]\n\t" + volume + "=\"external, directory\"\n");
    ASSERT_EQ(VolumePathParseEx(share.c_str(), &rec), 0);
    EXPECT_EQ(rec.type, VURN_VOLUME_TYPE_EXTERNAL);
    EXPECT_EQ(VURNVolumeIsMounted(volume.c_str()), 1);

    for (const char* bad : {"usb", "internal,dir"}) {
        WriteHostConf("[volumes]\n\t" + volume + "=\"" + bad + "\"\n");
        EXPECT_NE(VolumePathParseEx(share.c_str(), &rec), 0);
        EXPECT_EQ(VLIBCErrGet(), VLIB_ERR_BAD_FORMAT);
        EXPECT_LT(VURNVolumeIsMounted(volume.c_str()), 0);
        EXPECT_TRUE(log.Contains(std::string("Invalid volume type '") + bad + "'"));
    }
}

TEST_F(HostFacts, VolumeFailures) {
    LogCapture log;
    VURNVolumeRecord rec;
    std::string missing = root_ / "no/such/dir";
    EXPECT_NE(VolumePathParseEx(missing.c_str(), &rec), 0);
    EXPECT_EQ(VLIBCErrGet(), VLIB_ERR_FILE_NOT_FOUND);
    EXPECT_TRUE(log.Contains("Fail to resolve path '" + missing + "'"));
    EXPECT_NE(VolumePathParseEx("", &rec), 0);
    EXPECT_NE(VolumePathParseEx("/", nullptr), 0);

    std::string deep = root_.path();
    while (deep.size() < 140) {
        deep += "/long-directory-name";
    }
    ASSERT_EQ(system(("mkdir -p '" + deep + "'").c_str()), 0);
    WriteHostConf("[volumes]\n\t" + deep + "=\"internal\"\n");
    EXPECT_NE(VolumePathParseEx(deep.c_str(), &rec), 0);
    EXPECT_EQ(VLIBCErrGet(), VLIB_ERR_BUFFER_TOO_SMALL);
}

std::vector<std::string> Usable(const char* name, const char* ip, int max = 20) {
    VURNBkpIPEntry entries[20];
    int n = VURNBkpGetUsableIPList(name, ip, entries, max);
    std::vector<std::string> out;
    for (int i = 0; i < n; ++i) {
        out.push_back(entries[i].addr);
    }
    return out;
}

TEST(UsableIP, GivenAddressFirstThenTheResolversWithoutDuplicates) {
    using V = std::vector<std::string>;
    EXPECT_EQ(Usable("localhost", ""), V{"127.0.0.1"});
    EXPECT_EQ(Usable("localhost", "10.1.2.3"), (V{"10.1.2.3", "127.0.0.1"}));
    EXPECT_EQ(Usable("localhost", "127.0.0.1"), V{"127.0.0.1"});
    EXPECT_EQ(Usable("localhost", "::1"), (V{"::1", "127.0.0.1"}));
    EXPECT_EQ(Usable("localhost", "10.1.2.3", 1), V{"10.1.2.3"});
    EXPECT_EQ(Usable("", "192.168.0.9"), V{"192.168.0.9"});
    EXPECT_EQ(Usable("127.0.0.2", nullptr), V{"127.0.0.2"});
}

TEST(UsableIP, NothingUsableIsZeroWithAnError) {
    LogCapture log;
    VURNBkpIPEntry entries[4];
    EXPECT_EQ(VURNBkpGetUsableIPList("no-such-host.invalid", "", entries, 4), 0);
    EXPECT_EQ(VLIBCErrGet(), VLIB_ERR_RESOLVE);
    EXPECT_TRUE(log.Contains("Fail to resolve 'no-such-host.invalid'"));
    EXPECT_EQ(Usable("", "not-an-address"), std::vector<std::string>{});
    EXPECT_TRUE(log.Contains("'not-an-address' is not an IP address"));
    EXPECT_EQ(Usable("", ""), std::vector<std::string>{});
    EXPECT_LT(VURNBkpGetUsableIPList("localhost", "", nullptr, 4), 0);
    EXPECT_LT(VURNBkpGetUsableIPList("localhost", "", entries, 0), 0);
}

}  // namespace
