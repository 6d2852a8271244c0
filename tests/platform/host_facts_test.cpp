// What this host's files under S2S_ROOT and the machine say: serial, HA state, model class, network
// interfaces, volumes, usable addresses through the real resolver, and the share registry (records,
// defaults, management, share-name rules, and what it must refuse without damage).
#include <sys/stat.h>
#include <unistd.h>

#include <gtest/gtest.h>

#include <cstring>
#include <string>
#include <tuple>

#include "s2s_platform.h"
#include "support/test_util.h"

namespace {

using s2s_test::LogCapture;
using s2s_test::ReadFile;
using s2s_test::Table;

class HostFacts : public ::testing::Test {
  protected:
    HostFacts() : env_("S2S_ROOT", root_.path().c_str()) {}
    static void Write(const char* fixed, const std::string& text) {
        std::string path = S2SPath(fixed);
        s2s_test::MakeDirs(path.substr(0, path.rfind('/')));
        s2s_test::WriteFile(path, text);
    }
    static void HostConf(const std::string& text) { Write(S2S_PATH_HOST_CONF, text); }
    static std::string Registry() { return S2SPath(S2S_PATH_SHARE_REGISTRY); }
    // The share's record as "path status keyLen inSharebin keyFile autoKeyFile", or the error
    // (and the record must then be cleared).
    static std::string Record(const char* name) {
        VURNShare* share = reinterpret_cast<VURNShare*>(0x1);
        if (VURNShareGet(name, &share) != 0) {
            return "error " + std::to_string(VLIBCErrGet()) + (share ? " and a record" : "");
        }
        char key[4096] = "", auto_key[4096] = "";
        VURNShareEncKeyFileGet(share, key, sizeof(key));
        VURNShareEncAutoKeyFileGet(share, auto_key, sizeof(auto_key));
        std::string out = std::string(share->path) + " " + std::to_string(share->status) + " " +
                          std::to_string(share->keyLen) + " " + std::to_string(share->inSharebin) +
                          " " + key + " " + auto_key;
        VURNShareFree(share);
        return out;
    }

    s2s_test::TempDir root_;
    s2s_test::ScopedEnv env_;
};

// The host file wins over the firmware; placeholders are no serial; servers take letters, digits
// and "-_.:" only, so anything else becomes '-'; the buffer cuts it. Without a host file there
// are no facts and no error.
TEST_F(HostFacts, SerialHaAndModelComeFromTheHostFileOrTheFirmware) {
    LogCapture log;
    char model[16] = "junk", serial[64] = "junk";
    EXPECT_EQ(VLIBGetModelClass(model, sizeof(model)) + VURNHAIsRunning() + VLIBCIsPortBox(), 0);
    EXPECT_EQ(VLIBGetSerialNumber(serial, sizeof(serial)), 0);
    EXPECT_EQ(std::string(model) + serial + log.Text(), "");
    const std::tuple<const char*, const char*, int, const char*> cases[] = {
        {"", "DMI-0042\n", 64, "DMI-0042"},
        {"", "To Be Filled By O.E.M.\n", 64, ""},
        {"", "0000000\n", 64, ""},
        {"", "VMware-56 4d 8a 3b\n", 64, "VMware-56-4d-8a-3b"},
        {"[host]\n\tserial=\"SN-1234567890\"\n", "DMI-0042\n", 64, "SN-1234567890"},
        {"[host]\n\tserial=\"SN-1234567890\"\n", "", 6, "SN-12"},
        {"[host]\n\tserial=\"A/b \xc3\xa9_x.y:z\"\n", "", 64, "A-b---_x.y:z"},
    };
    for (const auto& [host_conf, dmi, size, expected] : cases) {
        HostConf(host_conf);
        Write(S2S_PATH_DMI_SERIAL, dmi);
        EXPECT_EQ(VLIBGetSerialNumber(serial, size), 0);
        EXPECT_STREQ(serial, expected);
    }

    HostConf("[host]\n\tha=\"yes\"\n\tmodel_class=\"portbox\"\n");
    EXPECT_EQ(VURNHAIsRunning() + VLIBCIsPortBox(), 2);
    HostConf("[host]\n\tha=\"perhaps\"\n\tmodel_class=\"rackstation\"\n");
    EXPECT_EQ(VURNHAIsRunning() + VLIBCIsPortBox(), 0);
    EXPECT_TRUE(log.Contains("Invalid ha value 'perhaps'"));
    HostConf("[host]\nserial is SN1\n");
    EXPECT_LT(VLIBGetSerialNumber(serial, sizeof(serial)), 0);
    EXPECT_EQ(VLIBCErrGet(), VLIB_ERR_BAD_FORMAT);
    EXPECT_TRUE(serial[0] == '\0' && VURNHAIsRunning() == 0 && VLIBGetSerialNumber(nullptr, 5) < 0);
    EXPECT_TRUE(log.Contains("Malformed line 2 in section file"));
}

// Physical interfaces come first (the client ID is the first one's address), loopback never.
TEST(NetInterfaces, MatchTheKernelsListPhysicalFirstWithoutLoopback) {
    VLIBNetIfInfo list[32];
    int count = VLIBNetGetInterfaceInfo(list, 32, 0);
    ASSERT_GE(count, 0);
    bool virtual_seen = false;
    for (int i = 0; i < count; ++i) {
        const std::string sys = std::string("/sys/class/net/") + list[i].name;
        const std::string address = ReadFile(sys + "/address");
        const unsigned char* m = list[i].mac;
        char mac[19];
        snprintf(mac, sizeof(mac), "%02x:%02x:%02x:%02x:%02x:%02x\n", m[0], m[1], m[2], m[3], m[4],
                 m[5]);
        EXPECT_TRUE(address.size() != 18 || address == mac) << sys;  // a 6-byte address
        EXPECT_STRNE(list[i].name, "lo");
        struct stat st;
        bool physical = stat((sys + "/device").c_str(), &st) == 0;
        EXPECT_FALSE(physical && virtual_seen) << sys << " comes after a virtual interface";
        virtual_seen |= !physical;
    }
    EXPECT_TRUE(VLIBNetGetInterfaceInfo(nullptr, 1, 0) < 0 &&
                VLIBNetGetInterfaceInfo(list, 0, 0) < 0);
}

// A host file may list volumes (mount paths) and their type; a plain directory listed is a volume
// not mounted, unless listed as a directory; a link names the same volume.
TEST_F(HostFacts, VolumeOfAPathIsItsListedVolumeOrItsMountPoint) {
    LogCapture log;
    const std::string volume = root_ / "volume1", link = root_ / "vlink";
    s2s_test::MakeDirs(volume + "/share");
    ASSERT_EQ(symlink(volume.c_str(), link.c_str()), 0);
    VURNVolumeRecord rec;
    ASSERT_EQ(VolumePathParseEx((volume + "/share").c_str(), &rec), 0);
    struct stat a, b;
    EXPECT_TRUE(volume.rfind(std::string(rec.path), 0) == 0 && stat(rec.path, &a) == 0 &&
                stat(volume.c_str(), &b) == 0 && a.st_dev == b.st_dev)
        << rec.path;
    EXPECT_TRUE(VolumePathParseEx("/proc/self", &rec) == 0 && std::string(rec.path) == "/proc");
    EXPECT_EQ(VURNVolumeIsMounted("/proc"), 1);
    const std::tuple<std::string, std::string, int, int> cases[] = {
        {volume + "/", "external", VURN_VOLUME_TYPE_EXTERNAL, 0},
        {volume, "internal", VURN_VOLUME_TYPE_INTERNAL, 0},
        {link, "external", VURN_VOLUME_TYPE_EXTERNAL, 0},
        {volume, "external, directory", VURN_VOLUME_TYPE_EXTERNAL, 1},
        {volume, "usb", -1, -1},
        {volume, "internal,dir", -1, -1},
    };
    for (const auto& [listed, type, expected_type, mounted] : cases) {
        SCOPED_TRACE(listed + " " + type);
        HostConf("[volumes]\n\t" + listed + "=\"" + type + "\"\n");
        int rc = VolumePathParseEx((listed + "/share").c_str(), &rec);
        EXPECT_EQ(VURNVolumeIsMounted(volume.c_str()), mounted);
        EXPECT_EQ(rc == 0 ? rec.type : -1, expected_type);
        EXPECT_TRUE(rc != 0 ? log.Contains("Invalid volume type '" + type + "'")
                            : std::string(rec.path) == volume);
    }

    const std::string missing = root_ / "no/such/dir";
    EXPECT_NE(VolumePathParseEx(missing.c_str(), &rec), 0);
    EXPECT_EQ(VLIBCErrGet(), VLIB_ERR_FILE_NOT_FOUND);
    EXPECT_TRUE(log.Contains("Fail to resolve path '" + missing + "'"));
    EXPECT_TRUE(VolumePathParseEx("", &rec) != 0 && VolumePathParseEx("/", nullptr) != 0);
    const std::string deep = root_ / std::string(140, 'd');  // listed, too long for the record
    s2s_test::MakeDirs(deep);
    HostConf("[volumes]\n\t" + deep + "=\"internal\"\n");
    EXPECT_NE(VolumePathParseEx(deep.c_str(), &rec), 0);
    EXPECT_EQ(VLIBCErrGet(), VLIB_ERR_BUFFER_TOO_SMALL);
}

// The given address first, then the resolver's, without duplicates, up to the room given.
TEST(UsableIP, GivenAddressFirstThenTheResolversWithoutDuplicates) {
    LogCapture log;
    const std::tuple<const char*, const char*, int, const char*> cases[] = {
        {"localhost", "", 20, "127.0.0.1 "},
        {"localhost", "10.1.2.3", 20, "10.1.2.3 127.0.0.1 "},
        {"localhost", "127.0.0.1", 20, "127.0.0.1 "},
        {"localhost", "::1", 20, "::1 127.0.0.1 "},
        {"localhost", "10.1.2.3", 1, "10.1.2.3 "},
        {"127.0.0.2", nullptr, 20, "127.0.0.2 "},
        {"", "not-an-address", 20, ""},
        {"no-such-host.invalid", "", 20, ""},
    };
    for (const auto& [name, ip, max, expected] : cases) {
        VURNBkpIPEntry entries[20];
        std::string got;
        for (int i = 0, n = VURNBkpGetUsableIPList(name, ip, entries, max); i < n; ++i) {
            got += std::string(entries[i].addr) + " ";
        }
        EXPECT_EQ(got, expected) << name << " / " << (ip != nullptr ? ip : "null");
    }
    EXPECT_EQ(VLIBCErrGet(), VLIB_ERR_RESOLVE);
    EXPECT_TRUE(log.Contains("Fail to resolve 'no-such-host.invalid'") &&
                log.Contains("'not-an-address' is not an IP address"));
    VURNBkpIPEntry entries[1];
    EXPECT_TRUE(VURNBkpGetUsableIPList("localhost", "", nullptr, 4) < 0 &&
                VURNBkpGetUsableIPList("localhost", "", entries, 0) < 0);
}

// Absent attributes read as defaults (key files in the key directory, the encrypted directory
// "@name@" beside the share); Set creates the registry, and replaces a record wholly.
TEST_F(HostFacts, RecordsCarryEveryAttributeDefaultsAndWholeReplacement) {
    // clang-format off
    Table full({{"path", "/volume1/docs"}, {"encrypted", "yes"}, {"encrypted_path", "/v/@d@"},
                {"auto_mount", "yes"}, {"acl", "no"}, {"win_share", "yes"}, {"key_len", "256"},
                {"key_file", "/k/d.key"}, {"auto_key_file", "/k/d.auto"}, {"in_sharebin", "yes"}});
    // clang-format on
    Table plain({{"path", "/volume2/media"}});
    ASSERT_EQ(VURNShareSet("docs", full.get()) + VURNShareSet("media", full.get()), 0);
    ASSERT_EQ(VURNShareSet("media", plain.get()), 0);
    EXPECT_EQ(Record("docs"), "/volume1/docs 2054 256 1 /k/d.key /k/d.auto");
    const std::string keys = S2SPath(S2S_PATH_KEY_DIR);
    EXPECT_EQ(Record("media"),
              "/volume2/media 0 0 0 " + keys + "/media.key " + keys + "/media.auto.key");
    VURNShare* share = nullptr;
    ASSERT_EQ(VURNShareGet("docs", &share), 0);
    int encrypted = 0, auto_mount = 0;
    EXPECT_TRUE(VLIBShareIsEncryptionGet(share, &encrypted) == 0 && encrypted == 1 &&
                VLIBShareIsAutoDecryptGet(share, &auto_mount) == 0 && auto_mount == 1);
    char buf[4096];
    EXPECT_LT(VURNShareEncKeyFileGet(share, buf, 5), 0);
    EXPECT_EQ(VLIBCErrGet(), VLIB_ERR_BUFFER_TOO_SMALL);
    VURNShareFree(share);
    ASSERT_GT(VLIBShareEncryptPathGet("/volume1/docs/", buf, 4095), 0);
    EXPECT_STREQ(buf, "/v/@d@");
    ASSERT_GT(VLIBShareEncryptPathGet("/volume2/media", buf, 4095), 0);
    EXPECT_STREQ(buf, "/volume2/@media@");
    EXPECT_LT(VLIBShareEncryptPathGet("/volume3/none", buf, 4095), 0);
    EXPECT_EQ(VURNShareIsInSharebin("docs") * 2 + VURNShareIsInSharebin("media"), 2);

    VLIBSzList* names = VLIBCSzListAlloc(4);
    EXPECT_EQ(VURNShareEnum(&names), 2);
    EXPECT_EQ(std::string(VLIBCSzListGet(names, 0)) + VLIBCSzListGet(names, 1), "docsmedia");
    VLIBCSzListFree(names);
    EXPECT_EQ(VURNShareRemove("docs"), 0);
    EXPECT_LT(VURNShareRemove("docs"), 0);
    EXPECT_EQ(VLIBCErrGet(), VLIB_ERR_NOT_FOUND);
    EXPECT_EQ(Record("docs"), "error " + std::to_string(VLIB_ERR_NOT_FOUND));
}

TEST_F(HostFacts, MissingOrMalformedRegistriesAndValuesFailWithoutDamage) {
    LogCapture log;
    EXPECT_EQ(Record("a"), "error " + std::to_string(VLIB_ERR_FILE_NOT_FOUND));
    EXPECT_TRUE(log.Contains("Share registry '" + Registry() + "' does not exist"));
    EXPECT_LT(VURNShareIsInSharebin("a"), 0);
    EXPECT_LT(VURNShareRemove("a"), 0);
    VLIBSzList* names = VLIBCSzListAlloc(1);
    EXPECT_LT(VURNShareEnum(&names), 0);
    VLIBCSzListFree(names);
    EXPECT_LT(VLIBShareEncryptPathGet("/v/a", nullptr, 0), 0);
    // Attributes the registry does not know or cannot store write nothing.
    Table unknown({{"path", "/v/a"}, {"colour", "blue"}}), newline({{"path", "/v/a\nb"}}),
        bad_bool({{"acl", "on"}});
    for (const Table* bad : {&unknown, &newline, &bad_bool}) {
        EXPECT_LT(VURNShareSet("a", bad->get()), 0);
    }
    EXPECT_LT(VURNShareSet("a", nullptr), 0);
    EXPECT_EQ(VLIBCFileExist(Registry().c_str()), 0);

    Table attrs({{"path", "/v/a"}});
    ASSERT_EQ(VURNShareSet("a", attrs.get()), 0);
    const std::string broken = ReadFile(Registry()) + "garbage line\n";
    s2s_test::WriteFile(Registry(), broken);
    const std::string bad_format = "error " + std::to_string(VLIB_ERR_BAD_FORMAT);
    EXPECT_EQ(Record("a"), bad_format);
    EXPECT_LT(VURNShareSet("b", attrs.get()), 0);
    EXPECT_EQ(ReadFile(Registry()), broken);
    for (const char* line : {"encrypted=\"maybe\"", "key_len=\"-5\"", "key_len=\"12345678901\"",
                             "path=\"relative/dir\"", "in_sharebin=\"YES\""}) {
        s2s_test::WriteFile(Registry(), std::string("[a]\n\t") + line + "\n");
        EXPECT_EQ(Record("a"), bad_format) << line;
    }
    EXPECT_TRUE(log.Contains("Share 'a' has an invalid encrypted 'maybe'"));
}

// Valid names are UTF-8 without separators, brackets, control characters or outer blanks. The
// receiving daemon folds module names (ASCII case, blanks), so two names that fold alike would be
// served as one module: the registry never holds such a pair, and the wire rule refuses names
// the daemon would serve under another name.
TEST_F(HostFacts, ShareNamesAreCheckedStrictlyAndNeverFoldIntoAnother) {
    Table attrs({{"path", "/v/x"}});
    const std::string too_long(256, 'n');
    for (const char* bad : {"", ".", "..", "a/b", "a\\b", "[x]", "tab\there", " lead", "trail ",
                            "caf\xe9", "\xc0\xaf", "\xed\xa0\x80", too_long.c_str()}) {
        EXPECT_EQ(VURNShareNameIsValid(bad), 0) << bad;
        EXPECT_EQ(Record(bad), "error " + std::to_string(VLIB_ERR_BAD_PARAMETER)) << bad;
        EXPECT_LT(VURNShareSet(bad, attrs.get()), 0) << bad;
    }
    EXPECT_EQ(VURNShareNameIsValid(nullptr), 0);
    EXPECT_EQ(VURNShareNameIsValid(std::string(255, 'n').c_str()), 1);
    for (const char* name : {"docs", "a b", "Caf\xc3\xa9 \xe6\x96\x87"}) {
        ASSERT_EQ(VURNShareSet(name, attrs.get()), 0) << name;
    }
    for (const char* clash : {"DOCS", "do cs", "a  b", "ab", "A B", "CAF\xc3\xa9 \xe6\x96\x87"}) {
        EXPECT_LT(VURNShareSet(clash, attrs.get()), 0) << clash;
        EXPECT_EQ(VLIBCErrGet(), VLIB_ERR_NAME_TAKEN) << clash;
        char other[256];
        EXPECT_EQ(VURNShareNameCollision(clash, other, sizeof other), 1) << clash;
    }
    EXPECT_EQ(VURNShareSet("docs", attrs.get()), 0) << "replacing a record is no collision";
    EXPECT_EQ(VURNShareSet("caf\xc3\x89 \xe6\x96\x87", attrs.get()), 0) << "é is not folded";
    for (const char* bad : {"a  b", "@x@", "GLOBAL", "a..b", "it's", "100%", "say\"hi\""}) {
        EXPECT_EQ(VURNShareNameIsSyncable(bad), 0) << bad;
    }
    EXPECT_EQ(VURNShareNameIsSyncable("a b") + VURNShareNameIsSyncable("Caf\xc3\xa9"), 2);
}

}  // namespace
