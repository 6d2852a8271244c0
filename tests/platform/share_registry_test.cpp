// The share registry under S2S_ROOT: records, defaults, management, and bad registries or names.
#include <gtest/gtest.h>

#include <string>
#include <vector>

#include "platform/platform_test_util.h"
#include "s2s_platform.h"
#include "support/test_util.h"

namespace {

using s2s_test::LogCapture;
using s2s_test::ReadFile;
using s2s_test::ScopedEnv;
using s2s_test::Table;
using s2s_test::TempDir;
using s2s_test::WriteFile;

class ShareRegistry : public ::testing::Test {
  protected:
    ShareRegistry() : env_("S2S_ROOT", root_.path().c_str()) {}
    std::string Registry() const { return S2SPath(S2S_PATH_SHARE_REGISTRY); }
    std::string KeyDir() const { return S2SPath(S2S_PATH_KEY_DIR); }

    TempDir root_;
    ScopedEnv env_;
};

TEST_F(ShareRegistry, RecordsCarryEveryAttribute) {
    Table attrs({{"path", "/volume1/docs"},
                 {"encrypted", "yes"},
                 {"encrypted_path", "/volume1/@docs@"},
                 {"auto_mount", "yes"},
                 {"acl", "no"},
                 {"win_share", "yes"},
                 {"key_len", "256"},
                 {"key_file", "/keys/docs.key"},
                 {"auto_key_file", "/keys/docs.auto"},
                 {"in_sharebin", "yes"}});
    ASSERT_EQ(VURNShareSet("docs", attrs.get()), 0);  // creates the registry and its directory
    VURNShare* share = nullptr;
    ASSERT_EQ(VURNShareGet("docs", &share), 0);
    ASSERT_NE(share, nullptr);
    EXPECT_STREQ(share->name, "docs");
    EXPECT_STREQ(share->path, "/volume1/docs");
    EXPECT_EQ(share->status, 0x2u | 0x4u | 0x800u);
    EXPECT_EQ(share->keyLen, 256u);
    EXPECT_EQ(share->inSharebin, 1);
    int value = -1;
    EXPECT_EQ(VLIBShareIsEncryptionGet(share, &value), 0);
    EXPECT_EQ(value, 1);
    EXPECT_EQ(VLIBShareIsAutoDecryptGet(share, &value), 0);
    EXPECT_EQ(value, 1);
    char buf[4096];
    EXPECT_EQ(VURNShareEncKeyFileGet(share, buf, sizeof(buf)), 14);
    EXPECT_STREQ(buf, "/keys/docs.key");
    EXPECT_GT(VURNShareEncAutoKeyFileGet(share, buf, sizeof(buf)), 0);
    EXPECT_STREQ(buf, "/keys/docs.auto");
    EXPECT_LT(VURNShareEncKeyFileGet(share, buf, 5), 0);
    EXPECT_EQ(VLIBCErrGet(), VLIB_ERR_BUFFER_TOO_SMALL);
    VURNShareFree(share);

    EXPECT_GT(VLIBShareEncryptPathGet("/volume1/docs/", buf, 4095), 0);
    EXPECT_STREQ(buf, "/volume1/@docs@");
    EXPECT_EQ(VURNShareIsInSharebin("docs"), 1);
}

TEST_F(ShareRegistry, AbsentKeysReadAsDefaults) {
    Table attrs({{"path", "/volume2/media"}});
    ASSERT_EQ(VURNShareSet("media", attrs.get()), 0);
    VURNShare* share = nullptr;
    ASSERT_EQ(VURNShareGet("media", &share), 0);
    EXPECT_EQ(share->status, 0u);
    EXPECT_EQ(share->keyLen, 0u);
    EXPECT_EQ(share->inSharebin, 0);
    char buf[4096];
    ASSERT_GT(VURNShareEncKeyFileGet(share, buf, sizeof(buf)), 0);
    EXPECT_EQ(std::string(buf), KeyDir() + "/media.key");
    ASSERT_GT(VURNShareEncAutoKeyFileGet(share, buf, sizeof(buf)), 0);
    EXPECT_EQ(std::string(buf), KeyDir() + "/media.auto.key");
    VURNShareFree(share);
    ASSERT_GT(VLIBShareEncryptPathGet("/volume2/media", buf, 4095), 0);
    EXPECT_STREQ(buf, "/volume2/@media@");
    EXPECT_EQ(VURNShareIsInSharebin("media"), 0);
}

TEST_F(ShareRegistry, SetReplacesRemoveAndEnumerate) {
    Table first({{"path", "/v/a"}, {"acl", "yes"}});
    Table second({{"path", "/v/a2"}});
    Table other({{"path", "/v/b"}});
    ASSERT_EQ(VURNShareSet("a", first.get()), 0);
    ASSERT_EQ(VURNShareSet("b", other.get()), 0);
    ASSERT_EQ(VURNShareSet("a", second.get()), 0);
    VURNShare* share = nullptr;
    ASSERT_EQ(VURNShareGet("a", &share), 0);
    EXPECT_STREQ(share->path, "/v/a2");
    EXPECT_EQ(share->status, 0u);  // replaced wholly: acl is gone
    VURNShareFree(share);

    VLIBSzList* names = VLIBCSzListAlloc(4);
    EXPECT_EQ(VURNShareEnum(&names), 2);
    EXPECT_STREQ(VLIBCSzListGet(names, 0), "a");
    EXPECT_STREQ(VLIBCSzListGet(names, 1), "b");
    VLIBCSzListFree(names);

    EXPECT_EQ(VURNShareRemove("a"), 0);
    EXPECT_LT(VURNShareRemove("a"), 0);
    EXPECT_EQ(VLIBCErrGet(), VLIB_ERR_NOT_FOUND);
    share = reinterpret_cast<VURNShare*>(0x1);
    EXPECT_LT(VURNShareGet("a", &share), 0);
    EXPECT_EQ(VLIBCErrGet(), VLIB_ERR_NOT_FOUND);
    EXPECT_EQ(share, nullptr);
    EXPECT_LT(VLIBShareEncryptPathGet("/v/a2", nullptr, 0), 0);
    char buf[64];
    EXPECT_LT(VLIBShareEncryptPathGet("/v/a2", buf, sizeof(buf)), 0);
    EXPECT_EQ(VLIBCErrGet(), VLIB_ERR_NOT_FOUND);
}

TEST_F(ShareRegistry, MissingRegistryIsAClearFailure) {
    LogCapture log;
    VURNShare* share = nullptr;
    EXPECT_LT(VURNShareGet("docs", &share), 0);
    EXPECT_EQ(VLIBCErrGet(), VLIB_ERR_FILE_NOT_FOUND);
    EXPECT_EQ(share, nullptr);
    EXPECT_TRUE(log.Contains("[ERROR] share_registry.cpp("));
    EXPECT_TRUE(log.Contains("Share registry '" + Registry() + "' does not exist"));
    EXPECT_LT(VURNShareIsInSharebin("docs"), 0);
    VLIBSzList* names = VLIBCSzListAlloc(1);
    EXPECT_LT(VURNShareEnum(&names), 0);
    VLIBCSzListFree(names);
    EXPECT_LT(VURNShareRemove("docs"), 0);
}

TEST_F(ShareRegistry, MalformedRegistryAndValuesFailWithoutDamage) {
    LogCapture log;
    Table attrs({{"path", "/v/a"}});
    ASSERT_EQ(VURNShareSet("a", attrs.get()), 0);
    std::string good = ReadFile(Registry());

    WriteFile(Registry(), good + "garbage line\n");
    VURNShare* share = nullptr;
    EXPECT_LT(VURNShareGet("a", &share), 0);
    EXPECT_EQ(VLIBCErrGet(), VLIB_ERR_BAD_FORMAT);
    EXPECT_LT(VURNShareSet("b", attrs.get()), 0);
    EXPECT_EQ(ReadFile(Registry()), good + "garbage line\n");

    const char* bad_values[] = {"\tencrypted=\"maybe\"\n", "\tkey_len=\"-5\"\n",
                                "\tkey_len=\"12345678901\"\n", "\tpath=\"relative/dir\"\n",
                                "\tin_sharebin=\"YES\"\n"};
    for (const char* line : bad_values) {
        WriteFile(Registry(), std::string("[a]\n") + line);
        EXPECT_LT(VURNShareGet("a", &share), 0) << line;
        EXPECT_EQ(VLIBCErrGet(), VLIB_ERR_BAD_FORMAT) << line;
    }
    EXPECT_TRUE(log.Contains("Share 'a' has an invalid encrypted 'maybe'"));
}

TEST_F(ShareRegistry, ShareNamesAreCheckedStrictly) {
    LogCapture log;
    Table attrs({{"path", "/v/x"}});
    const std::string too_long(256, 'n');
    const char* bad[] = {
        "",      ".",      "..",      "a/b",      "a\\b",         "[x]",           "tab\there",
        " lead", "trail ", "caf\xe9", "\xc0\xaf", "\xed\xa0\x80", too_long.c_str()};
    for (const char* name : bad) {
        EXPECT_EQ(VURNShareNameIsValid(name), 0) << name;
        EXPECT_LT(VURNShareSet(name, attrs.get()), 0) << name;
        EXPECT_EQ(VLIBCErrGet(), VLIB_ERR_BAD_PARAMETER);
        VURNShare* share = nullptr;
        EXPECT_LT(VURNShareGet(name, &share), 0);
        EXPECT_EQ(VLIBCErrGet(), VLIB_ERR_BAD_PARAMETER);
    }
    EXPECT_EQ(VURNShareNameIsValid(nullptr), 0);
    EXPECT_TRUE(log.Contains("Invalid share name"));

    const char* unicode = "Caf\xc3\xa9 \xe6\x96\x87\xe6\xa1\xa3";  // "Café 文档"
    EXPECT_EQ(VURNShareNameIsValid(unicode), 1);
    EXPECT_EQ(VURNShareNameIsValid(std::string(255, 'n').c_str()), 1);
    ASSERT_EQ(VURNShareSet(unicode, attrs.get()), 0);
    VURNShare* share = nullptr;
    ASSERT_EQ(VURNShareGet(unicode, &share), 0);
    EXPECT_STREQ(share->name, unicode);
    VURNShareFree(share);
}

// The receiving daemon folds module names (ASCII case, blanks): two shares that fold alike would
// be served as one module, the later one's path winning. The registry never holds such a pair,
// and the wire rule refuses names the daemon would serve under another name.
TEST_F(ShareRegistry, NamesTheDaemonWouldServeAsOneModuleAreRefused) {
    LogCapture log;
    Table attrs({{"path", "/v/x"}});
    for (const char* name : {"docs", "a b", "Caf\xc3\xa9"}) {
        ASSERT_EQ(VURNShareSet(name, attrs.get()), 0) << name;
    }
    for (const char* clash : {"DOCS", "Docs", "do cs", "a  b", "ab", "A B", "CAF\xc3\xa9"}) {
        EXPECT_LT(VURNShareSet(clash, attrs.get()), 0) << clash;
        EXPECT_EQ(VLIBCErrGet(), VLIB_ERR_NAME_TAKEN) << clash;
        char other[256];
        EXPECT_EQ(VURNShareNameCollision(clash, other, sizeof other), 1) << clash;
    }
    EXPECT_TRUE(log.Contains("would be served as the same module as share 'docs'"));
    EXPECT_EQ(VURNShareSet("docs", attrs.get()), 0) << "replacing a record is no collision";
    EXPECT_EQ(VURNShareSet("caf\xc3\x89", attrs.get()), 0) << "non-ASCII letters are not folded";

    for (const char* bad : {"a  b", "@x@", "GLOBAL", "a..b", "it's", "100%", "say\"hi\""}) {
        EXPECT_EQ(VURNShareNameIsSyncable(bad), 0) << bad;
    }
    EXPECT_EQ(VURNShareNameIsSyncable("a b"), 1);
    EXPECT_EQ(VURNShareNameIsSyncable("Caf\xc3\xa9"), 1);
}

TEST_F(ShareRegistry, SetRefusesUnknownOrUnstorableAttributes) {
    Table unknown({{"path", "/v/a"}, {"colour", "blue"}});
    EXPECT_LT(VURNShareSet("a", unknown.get()), 0);
    Table newline({{"path", "/v/a\nb"}});
    EXPECT_LT(VURNShareSet("a", newline.get()), 0);
    Table bad_bool({{"path", "/v/a"}, {"acl", "on"}});
    EXPECT_LT(VURNShareSet("a", bad_bool.get()), 0);
    EXPECT_EQ(VURNShareSet("a", nullptr), -1);
    EXPECT_EQ(VLIBCFileExist(Registry().c_str()), 0);  // nothing was written
}

}  // namespace
